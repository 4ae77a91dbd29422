// A process's surroundings, as a test makes them up: queues, environment, clock, kernel, device and log.
#pragma once

#include <cerrno>
#include <cstring>
#include <deque>
#include <map>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "platform/Environment.hpp"
#include "platform/LogSink.hpp"
#include "platform/Platform.hpp"
#include "platform/RunLoop.hpp"
#include "tests/fakes/Effects.hpp"

namespace fakes {

// Unlike a real pool it has no thread: work runs on that of the test, one item at a time, with the platform
// current; in the order in which it came or, once seeded, in an order drawn from the seed.
class ManualPool : public WorkQueue {
 public:
  explicit ManualPool(Platform& owner_) : owner(owner_) {}

  void async(Work work) override { items.push_back(std::move(work)); }
  void seed(std::uint64_t value) { random.emplace(value); }
  bool isEmpty() const { return items.empty(); }
  // The pool must not be empty.
  void runOne() {
    const std::size_t index =
        random ? std::uniform_int_distribution<std::size_t>(0, items.size() - 1)(*random) : 0;
    const Work work = std::move(items[index]);
    items.erase(items.begin() + static_cast<std::ptrdiff_t>(index));
    const PlatformScope scope(owner);
    work();
  }
  // What is dropped may queue more as it dies.
  void drop() {
    while (!items.empty()) std::exchange(items, {}).clear();
  }

 private:
  Platform& owner;
  std::deque<Work> items;
  std::optional<std::mt19937_64> random;
};

// Unlike a real loop, run() returns when stop() was called or nothing is left to do: a test cannot wait.
struct ManualRunLoop : RunLoop {
  explicit ManualRunLoop(Platform& owner) : queue(std::make_shared<ManualPool>(owner)) {}
  void run() override {
    while (!stopped && !queue->isEmpty()) queue->runOne();
  }
  void stop() override { stopped = true; }
  std::shared_ptr<WorkQueue> mainQueue() override { return queue; }

  const std::shared_ptr<ManualPool> queue;
  bool stopped = false;
};

struct FakeEnvironment : ProcessEnvironment {
  std::optional<std::string> variable(std::string_view name) override {
    const auto found = variables.find(name);
    return found == variables.end() ? std::nullopt : std::optional(found->second);
  }
  std::map<std::string, std::string, std::less<>> all() override { return variables; }
  std::map<std::string, std::string, std::less<>> variables;
};

// Time passes only in FakePlatform::advance().
struct ManualClock : Clock {
  Time now() override { return time; }
  Time time{1'000'000};
};

// Knows one name. Fails, with `failure` in errno, when that is not 0.
struct FakeSystemControl : SystemControl {
  int sysctlbyname(const char* name, void* buffer, std::size_t* length) override {
    errno = std::string_view(name) == "kern.bootsessionuuid" ? failure : ENOENT;
    if (errno == 0 && *length <= bootSession.size()) errno = ENOMEM;
    if (errno != 0) return -1;
    *length = bootSession.size() + 1;
    std::memcpy(buffer, bootSession.c_str(), *length);
    return 0;
  }
  std::string bootSession = "01234567-89AB-CDEF-0123-456789ABCDEF";
  int failure = 0;
};

struct FakeDeviceProperties : DeviceProperties {
  std::optional<Value> copyAnswerWithError(std::string_view key, std::int32_t& error) override {
    if (const auto found = errors.find(key); found != errors.end()) error = found->second;
    const auto found = answers.find(key);
    return found == answers.end() ? std::nullopt : std::optional(found->second);
  }
  int isInternalBuild() override { return internalBuild; }
  Dictionary answers{{"BuildVersion", "21A5248v"}};
  std::map<std::string, std::int32_t, std::less<>> errors;
  int internalBuild = 0;
};

// Keeps what a log would print, private texts shown, as "category level: message"; a channel whose texts are
// not private is marked.
struct FakeLogSink : LogSink {
  explicit FakeLogSink(Effects& effects_) : effects(effects_) {}
  bool enabled(const LogChannel&, LogLevel) override { return true; }
  void write(const LogChannel& channel, LogLevel level, std::string_view format,
             std::span<const LogArgument> arguments) override {
    static constexpr const char* names[] = {" info: ", " default: ", " error: "};
    effects.record(Effects::log, (channel.textIsPrivate ? "" : "public ") + channel.category +
                                     names[static_cast<int>(level)] +
                                     formatLogMessage(format, arguments, false));
  }
  Effects& effects;
};

// Where a log is not what is looked at.
struct SilentLog : LogSink {
  bool enabled(const LogChannel&, LogLevel) override { return false; }
  void write(const LogChannel&, LogLevel, std::string_view, std::span<const LogArgument>) override {}
};

}  // namespace fakes
