// What the measured things stand beside: the same work with nothing around it, and what people would use.
#pragma once

#include <cstddef>
#include <memory>
#include <string>
#include <vector>

#include "bench/Client.hpp"
#include "bench/Clock.hpp"
#include "bench/Companion.hpp"
#include "bench/Device.hpp"
#include "bench/Process.hpp"
#include "tests/fakes/RealFiles.hpp"

struct sd_bus;

namespace bench {

// Answers messages of `bytes` bytes with a reply: on the thread that reads them, or on a second one.
class BareServer {
 public:
  enum class Answers { inPlace, afterHop };
  BareServer(Answers answers, std::size_t bytes);
  const Service& service() const { return _service; }

 private:
  const fakes::TemporaryFolder folder;
  const Service _service;
  const Child process;
};

// The library's echo service, which clients connect to themselves.
class DirectEcho {
 public:
  explicit DirectEcho(const std::string& programs);
  const Service& service() const { return _service; }
  pid_t pid() const { return process.pid(); }

 private:
  const fakes::TemporaryFolder folder;
  const Service _service;
  const Child process;
};

// A bus of its own, and the echo service behind it.
class Bus {
 public:
  enum class Kind { daemon, broker };
  Bus(Kind kind, const std::string& programs);
  ~Bus();

  const Service& echo() const { return _echo; }
  std::string address() const { return "unix:path=" + _echo.socket; }
  // While it is there, what is started is part of the bus's desktop.
  struct Desktop {
    explicit Desktop(const Bus& bus);
    const Variable settings, runtime, address;
  };
  pid_t pid() const { return process.pid(); }

 private:
  Child startDaemon();
  Child startBroker();

  const fakes::TemporaryFolder folder;
  const Service _echo;
  sd_bus* controller = nullptr;  // the broker's
  const Child process;
  const Child service;
};

// A device that serves, and the buses beside it, at rest until they are called.
struct Neighbours {
  explicit Neighbours(const std::string& programs);

  Device device;
  Bus daemon, broker;
};

// A settings service that desktops use, on a bus of its own; its writes do not wait for the disk (no fsync in
// a trace of its service).
class Dconf {
 public:
  Dconf(const std::string& programs, int keys);

  // Microseconds from a write's begin until it returns, and until another process has heard of it.
  struct Times {
    double returned, heard;
  };
  Times write();

 private:
  Companion start(const std::string& programs, const std::vector<std::string>& arguments) const;

  const Bus bus;
  Companion watcher, writer;
};

// Microseconds for each of `rounds` times the bare calls of one durable file: open, write, fsync, rename,
// fsync of the folder, `writes` times over.
std::vector<double> bareDurableWrites(const std::string& folder, std::size_t rounds, int writes,
                                      std::size_t bytes = 400);  // about what a store of three keys takes

}  // namespace bench
