// A client's last word on real threads, with writes as long as a disk's. Usage: last_word_threads [PAIRS]
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <random>
#include <thread>

#include "pairwelld/debug/DebugManager.hpp"
#include "pairwelld/settings/KeyValueStoreManager.hpp"
#include "platform/linux/ThreadPool.hpp"
#include "tests/fakes/FakePlatform.hpp"

namespace pairwell {
namespace {

using namespace platform;

constexpr const char* flagKey = "VelaLogCloudCollectionEnabled";

void pause(int fromMicroseconds, int toMicroseconds) {
  thread_local std::mt19937 random(std::random_device{}());
  std::this_thread::sleep_for(std::chrono::microseconds(
      std::uniform_int_distribution<int>(fromMicroseconds, toMicroseconds)(random)));
}

// A store whose writes take 20 to 400 us.
template <class Interface>
class SlowStore : public Interface {
 public:
  bool boolForKey(std::string_view key) override { return get(key, toBool).value_or(false); }
  double doubleForKey(std::string_view key) override { return get(key, toDouble).value_or(0.0); }
  std::optional<std::string> textForKey(std::string_view key) override { return get(key, toText); }
  void setValue(const std::optional<Value>& value, std::string_view key) override {
    std::lock_guard lock(mutex);
    pause(20, 400);
    contents.erase(std::string(key));
    if (value) contents.emplace(key, *value);
  }
  void addObserver(std::weak_ptr<KeyObserver>, std::string_view) override {}
  void removeObserver(const KeyObserver*, std::string_view) override {}

 private:
  template <class Convert>
  auto get(std::string_view key, Convert convert) -> decltype(convert(Value())) {
    std::lock_guard lock(mutex);
    const auto found = contents.find(key);
    if (found == contents.end()) return std::nullopt;
    return convert(found->second);
  }
  std::mutex mutex;
  Dictionary contents;
};

struct SlowCloud : SlowStore<CloudStore> {
  bool synchronise() override { return true; }
  Dictionary dictionaryRepresentation() override { return {}; }
};

struct SlowRadix : RadixController {
  Result<Dictionary> readPrefKeys(const std::vector<std::string>& keys) override {
    return Dictionary{{keys.at(0), store.boolForKey(keys.at(0))}};
  }
  Result<void> writePrefKey(std::string_view key, const Value& value) override {
    store.setValue(value, key);
    return {};
  }
  SlowStore<UserPreferences> store;
};

// Posts come back on the queue that they were asked for on; alarms are only counted.
class Hearth : public NamedNotifications, public EventStreams {
 public:
  void post(std::string_view name) override {
    if (queue && name == "com.kestrel.bluetooth.prefsChanged") queue->async([this] { handler(1); });
  }
  std::uint32_t registerHandler(std::string_view, std::int32_t& token, std::shared_ptr<WorkQueue> queue_,
                                NamedNotifications::Handler handler_) override {
    token = 1;
    handler = std::move(handler_);
    queue = std::move(queue_);
    return 0;
  }
  void cancel(std::int32_t) override {}
  void setHandler(std::string_view, std::shared_ptr<WorkQueue>, EventStreams::Handler) override {}
  void setEvent(std::string_view, std::string_view, const std::optional<Dictionary>& descriptor) override {
    armed = descriptor.has_value();
  }
  std::atomic<bool> armed{false};

 private:
  std::shared_ptr<WorkQueue> queue;
  NamedNotifications::Handler handler;
};

struct SilentLog : LogSink {
  bool enabled(const LogChannel&, LogLevel) override { return false; }
  void write(const LogChannel&, LogLevel, std::string_view, std::span<const LogArgument>) override {}
};

struct PoolLoop : RunLoop {
  explicit PoolLoop(std::shared_ptr<WorkQueue> pool_) : pool(std::move(pool_)) {}
  void run() override {}
  void stop() override {}
  std::shared_ptr<WorkQueue> mainQueue() override { return pool; }
  const std::shared_ptr<WorkQueue> pool;
};

// Of the fakes it takes what no thread changes.
struct ThreadedPlatform : fakes::FakePlatform {
  RunLoop& runLoop() override { return poolLoop; }
  Queues& queues() override { return threadedQueues; }
  LogSink& logSink() override { return silentLog; }
  NamedNotifications& namedNotifications() override { return hearth; }
  NamedNotificationCentre* namedNotificationCentre() override { return nullptr; }
  std::shared_ptr<UserPreferences> userPreferences() override { return slowUser; }
  std::shared_ptr<CloudStore> makeCloudStore(std::string_view, int) override { return slowCloud; }
  RadixController& radixController() override { return slowRadix; }
  EventStreams& eventStreams() override { return hearth; }

  const std::shared_ptr<linux_::ThreadPool> threads = std::make_shared<linux_::ThreadPool>(4);
  PoolLoop poolLoop{threads};
  Queues threadedQueues{threads};
  SilentLog silentLog;
  const std::shared_ptr<SlowStore<UserPreferences>> slowUser = std::make_shared<SlowStore<UserPreferences>>();
  const std::shared_ptr<SlowCloud> slowCloud = std::make_shared<SlowCloud>();
  SlowRadix slowRadix;
  Hearth hearth;
};

// How many of the pairs left something on, or did not come to rest.
long lostPairs(ThreadedPlatform& device, DebugManager& manager, long pairs) {
  long lost = 0;
  for (long pair = 0; pair < pairs; ++pair) {
    manager.setAudioAccessoryLimitedLoggingEnabled(true);
    if (pair % 2 == 0) pause(0, 3000);
    manager.setAudioAccessoryLimitedLoggingEnabled(false);
    const bool rests =
        device.threads->waitUntilIdle(std::chrono::steady_clock::now() + std::chrono::seconds(10));
    const bool off = !manager.audioAccessoryLimitedLoggingEnabled() &&
                     !device.slowCloud->boolForKey(flagKey) && !device.slowRadix.store.boolForKey(flagKey) &&
                     !device.hearth.armed;
    if (!rests || !off) ++lost;
  }
  return lost;
}

}  // namespace
}  // namespace pairwell

int main(int count, char** arguments) {
  const long pairs = count > 1 ? std::atol(arguments[1]) : 100'000;
  auto& device = *new pairwell::ThreadedPlatform;  // for the life of the process, as its threads are
  platform::install(device);
  const auto kvs = pairwell::KeyValueStoreManager::create();
  kvs->activate();
  const auto manager = pairwell::DebugManager::create(kvs);
  manager->activate();
  const long lost = pairwell::lostPairs(device, *manager, pairs);
  std::printf("%ld of %ld pairs lost\n", lost, pairs);
  std::fflush(stdout);
  std::_Exit(lost == 0 && pairs > 0 ? 0 : 1);
}
