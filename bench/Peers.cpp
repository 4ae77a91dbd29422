#include "bench/Peers.hpp"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <algorithm>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <fstream>
#include <mutex>
#include <stdexcept>
#include <thread>

namespace bench {
namespace {

void check(bool done, const char* what) {
  if (!done) throw std::runtime_error(what);
}

bool isServed(const std::string& socket) { return static_cast<bool>(fakes::socketAt(socket, ::connect)); }

Service echoAt(const std::string& socket, const std::string& destination) {
  return {socket, destination, "/x", "x.Echo"};
}

// What waits for the second thread.
class Hop {
 public:
  explicit Hop(void (*answer_)(int)) : answer(answer_), worker([this] { run(); }) {}
  void hand(int descriptor) {
    {
      const std::lock_guard lock(mutex);
      waiting.push_back(descriptor);
    }
    arrived.notify_one();
  }

 private:
  void run() {
    for (;;) {
      std::unique_lock lock(mutex);
      arrived.wait(lock, [&] { return !waiting.empty(); });
      const int descriptor = waiting.front();
      waiting.pop_front();
      lock.unlock();
      answer(descriptor);
    }
  }

  void (*const answer)(int);
  std::mutex mutex;
  std::condition_variable arrived;
  std::deque<int> waiting;
  std::thread worker;
};

void answer(int descriptor) {
  static const std::string reply = replyMessage();
  if (::send(descriptor, reply.data(), reply.size(), MSG_NOSIGNAL) < 0) return;
}

// Reads whole messages, as its clients wait for the answer before they send the next.
[[noreturn]] void serveBare(int listener, BareServer::Answers answers, std::size_t bytes) {
  const int loop = ::epoll_create1(EPOLL_CLOEXEC);
  const auto watch = [&](int descriptor) {
    epoll_event event{EPOLLIN, {}};
    event.data.fd = descriptor;
    ::epoll_ctl(loop, EPOLL_CTL_ADD, descriptor, &event);
  };
  watch(listener);
  std::unique_ptr<Hop> hop;
  if (answers == BareServer::Answers::afterHop) hop = std::make_unique<Hop>(answer);
  std::vector<char> buffer(bytes);
  for (;;) {
    epoll_event events[64];
    const int count = ::epoll_wait(loop, events, 64, -1);
    for (int index = 0; index < count; ++index) {
      const int descriptor = events[index].data.fd;
      if (descriptor == listener) {
        watch(::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC));
      } else if (::recv(descriptor, buffer.data(), bytes, MSG_WAITALL) <= 0) {
        ::close(descriptor);
      } else {
        hop ? hop->hand(descriptor) : answer(descriptor);
      }
    }
  }
}

int listenAt(const std::string& path) {
  auto socket = fakes::socketAt(path, ::bind);
  check(socket && ::listen(socket.get(), 1024) == 0, "listen");
  return socket.release();
}

constexpr char daemonConfiguration[] = R"(<busconfig><type>session</type><auth>EXTERNAL</auth>
<standard_session_servicedirs/>
<policy context="default"><allow send_destination="*"/><allow receive_sender="*"/><allow own="*"/></policy>
<limit name="max_completed_connections">4096</limit><limit name="max_connections_per_user">4096</limit>
<limit name="max_match_rules_per_connection">4096</limit>)";

// Everything is allowed to everybody, as in the daemon's.
void appendPolicy(sd_bus_message* call) {
  const auto open = [&](char type, const char* contents) {
    check(sd_bus_message_open_container(call, type, contents) >= 0, "policy");
  };
  const auto close = [&] { sd_bus_message_close_container(call); };
  constexpr char batch[] = "bta(btbs)a(btssssuutt)a(btssssuutt)";
  const auto appendRule = [&] {
    sd_bus_message_append(call, "a(btssssuutt)", 1, true, std::uint64_t{1}, "", "", "", "", 0U, 0U,
                          std::uint64_t{0}, UINT64_MAX);
  };
  const std::string users = "(u(" + std::string(batch) + "))", groups = "(buu(" + std::string(batch) + "))";
  const std::string whole = "a" + users + "a" + groups + "a(ss)bs";
  open('v', ("(" + whole + ")").c_str());
  open('r', whole.c_str());
  open('a', users.c_str());
  open('r', users.substr(1, users.size() - 2).c_str());
  sd_bus_message_append(call, "u", UINT32_MAX);  // any user
  open('r', batch);
  sd_bus_message_append(call, "bt", true, std::uint64_t{1});
  sd_bus_message_append(call, "a(btbs)", 1, true, std::uint64_t{1}, true, "");
  appendRule();
  appendRule();
  for (int level = 0; level < 3; ++level) close();
  open('a', groups.c_str());
  close();
  sd_bus_message_append(call, "a(ss)bs", 0, false, "session");
  close();
  close();
}

}  // namespace

BareServer::BareServer(Answers answers, std::size_t bytes)
    : _service{folder.path + "/socket", "", "", "", true},
      process([&] { serveBare(listenAt(_service.socket), answers, bytes); }) {
  await("the bare server does not start", [&] { return isServed(_service.socket); });
}

DirectEcho::DirectEcho(const std::string& programs)
    : _service(echoAt(folder.path + "/socket", "")),
      process({programs + "/pairwell_echo", "--listen", _service.socket}) {
  await("the echo service does not start", [&] { return isServed(_service.socket); });
}

Bus::Bus(Kind kind, const std::string& programs)
    : _echo(echoAt(folder.path + "/socket", "x.echo")),
      process(kind == Kind::daemon ? startDaemon() : startBroker()),
      service({programs + "/pairwell_echo", address()}) {
  awaitAnswer(_echo, "Echo");
}

Bus::~Bus() { sd_bus_close_unref(controller); }

Bus::Desktop::Desktop(const Bus& bus)
    : settings("XDG_CONFIG_HOME", bus.folder.path),
      runtime("XDG_RUNTIME_DIR", bus.folder.path),
      address("DBUS_SESSION_BUS_ADDRESS", bus.address()) {}

Child Bus::startDaemon() {
  const std::string path = folder.path + "/bus.conf";
  std::ofstream(path) << daemonConfiguration << "<listen>" << address() << "</listen></busconfig>\n";
  const Desktop desktop(*this);
  Child started({"dbus-daemon", "--nofork", "--config-file=" + path});
  await("dbus-daemon does not start", [&] { return isServed(_echo.socket); });
  return started;
}

// Its launcher wants a system that runs under systemd; so this is what tells it where to listen.
Child Bus::startBroker() {
  int ends[2];
  check(::socketpair(AF_UNIX, SOCK_STREAM, 0, ends) == 0, "socketpair");
  ::fcntl(ends[0], F_SETFD, FD_CLOEXEC);
  const int listener = listenAt(_echo.socket);
  ::fcntl(listener, F_SETFL, O_NONBLOCK);  // it accepts until there is nobody left
  Child started({"dbus-broker", "--controller", std::to_string(ends[1]), "--machine-id",
                 "0123456789abcdef0123456789abcdef", "--max-bytes", "1000000000", "--max-fds", "100000",
                 "--max-matches", "100000", "--max-objects", "1000000"});
  ::close(ends[1]);
  check(sd_bus_new(&controller) >= 0 && sd_bus_set_fd(controller, ends[0], ends[0]) >= 0 &&
            sd_bus_start(controller) >= 0,
        "controller");
  sd_bus_message* call = nullptr;
  check(sd_bus_message_new_method_call(controller, &call, nullptr, "/org/bus1/DBus/Broker",
                                       "org.bus1.DBus.Broker", "AddListener") >= 0,
        "AddListener");
  sd_bus_message_append(call, "oh", "/org/bus1/DBus/Listener/0", listener);
  appendPolicy(call);
  sd_bus_error error = SD_BUS_ERROR_NULL;
  if (sd_bus_call(controller, call, 0, &error, nullptr) < 0)
    throw std::runtime_error(std::string("dbus-broker does not listen: ") + error.message);
  sd_bus_message_unref(call);
  ::close(listener);
  return started;
}

Neighbours::Neighbours(const std::string& programs)
    : device(programs), daemon(Bus::Kind::daemon, programs), broker(Bus::Kind::broker, programs) {
  device.start();
  awaitAnswer(device.service(), "GetCurrentUserGivenName");
}

Dconf::Dconf(const std::string& programs, int keys)
    : bus(Bus::Kind::daemon, programs),
      watcher(start(programs, {"watch"})),
      writer(start(programs, {"write", std::to_string(keys)})) {}

Companion Dconf::start(const std::string& programs, const std::vector<std::string>& arguments) const {
  const Bus::Desktop desktop(bus);
  std::vector<std::string> command{programs + "/pairwell_dconf"};
  command.insert(command.end(), arguments.begin(), arguments.end());
  return Companion(command);
}

Dconf::Times Dconf::write() {
  writer.goOn();
  const double start = writer.moment(), returned = writer.moment();
  return {returned - start, watcher.moment() - start};
}

std::vector<double> bareDurableWrites(const std::string& folder, std::size_t rounds, int writes,
                                      std::size_t bytes) {
  const std::string path = folder + "/bare", temporary = path + ".new";
  const std::string contents(bytes, 'x');
  const int folderDescriptor = ::open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  check(folderDescriptor >= 0, "open the folder");
  std::vector<double> times;
  for (std::size_t round = 0; round < rounds; ++round) {
    const double start = now();
    for (int write = 0; write < writes; ++write) {
      const int file = ::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
      check(file >= 0, "open");
      check(::write(file, contents.data(), contents.size()) == static_cast<ssize_t>(contents.size()),
            "write");
      check(::fsync(file) == 0, "fsync");
      ::close(file);
      check(::rename(temporary.c_str(), path.c_str()) == 0, "rename");
      check(::fsync(folderDescriptor) == 0, "fsync of the folder");
    }
    times.push_back(now() - start);
  }
  ::close(folderDescriptor);
  ::unlink(path.c_str());
  return times;
}

}  // namespace bench
