// A client's last word on real threads, with writes as long as a disk's. Usage: last_word_threads [PAIRS]
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <mutex>
#include <random>
#include <string>
#include <thread>

#include "pairwelld/debug/DebugManager.hpp"
#include "pairwelld/notifications/SystemNotificationManager.hpp"
#include "pairwelld/settings/KeyValueStoreManager.hpp"
#include "platform/linux/LinuxEnvironment.hpp"
#include "platform/linux/ThreadPool.hpp"
#include "tests/fakes/FakeEnvironment.hpp"

namespace pairwell {
namespace {

using platform::Value;

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
  bool boolForKey(std::string_view key) override { return get(key, platform::toBool).value_or(false); }
  double doubleForKey(std::string_view key) override { return get(key, platform::toDouble).value_or(0.0); }
  std::optional<std::string> textForKey(std::string_view key) override { return get(key, platform::toText); }
  void setValue(const std::optional<Value>& value, std::string_view key) override {
    std::lock_guard lock(mutex);
    pause(20, 400);
    contents.erase(std::string(key));
    if (value) contents.emplace(key, *value);
  }
  void addObserver(std::weak_ptr<platform::KeyObserver>, std::string_view) override {}
  void removeObserver(const platform::KeyObserver*, std::string_view) override {}

 private:
  template <class Convert>
  auto get(std::string_view key, Convert convert) -> decltype(convert(Value())) {
    std::lock_guard lock(mutex);
    const auto found = contents.find(key);
    if (found == contents.end()) return std::nullopt;
    return convert(found->second);
  }
  std::mutex mutex;
  platform::Dictionary contents;
};

class SlowCloud : public SlowStore<platform::CloudStore> {
 public:
  bool synchronise() override { return true; }
  platform::Dictionary dictionaryRepresentation() override { return {}; }
};

class SlowRadix : public platform::RadixController {
 public:
  platform::Result<platform::Dictionary> readPrefKeys(const std::vector<std::string>& keys) override {
    return platform::Dictionary{{keys.at(0), store.boolForKey(keys.at(0))}};
  }
  platform::Result<void> writePrefKey(std::string_view key, const Value& value) override {
    store.setValue(value, key);
    return {};
  }
  SlowStore<platform::UserPreferences> store;
};

// Posts come back on the queue that they were asked for on; alarms are only counted.
class Hearth : public platform::NamedNotifications, public platform::EventStreams {
 public:
  void post(std::string_view name) override {
    if (queue && name == "com.kestrel.bluetooth.prefsChanged") queue->async([this] { handler(1); });
  }
  std::uint32_t registerHandler(std::string_view, std::int32_t& token,
                                std::shared_ptr<platform::WorkQueue> queue_,
                                platform::NamedNotifications::Handler handler_) override {
    token = 1;
    handler = std::move(handler_);
    queue = std::move(queue_);
    return 0;
  }
  void cancel(std::int32_t) override {}
  void setHandler(std::string_view, std::shared_ptr<platform::WorkQueue>,
                  platform::EventStreams::Handler) override {}
  void setEvent(std::string_view, std::string_view,
                const std::optional<platform::Dictionary>& descriptor) override {
    armed = descriptor.has_value();
  }
  std::atomic<bool> armed{false};

 private:
  std::shared_ptr<platform::WorkQueue> queue;
  platform::NamedNotifications::Handler handler;
};

class SilentLog : public platform::LogSink {
  bool enabled(const platform::LogChannel&, platform::LogLevel) override { return false; }
  void write(const platform::LogChannel&, platform::LogLevel, std::string_view,
             std::span<const platform::LogArgument>) override {}
};

class PoolLoop : public platform::RunLoop {
 public:
  explicit PoolLoop(std::shared_ptr<platform::WorkQueue> pool_) : pool(std::move(pool_)) {}
  void run() override {}
  void stop() override {}
  std::shared_ptr<platform::WorkQueue> mainQueue() override { return pool; }

 private:
  const std::shared_ptr<platform::WorkQueue> pool;
};

class ThreadedPlatform : public platform::Platform {
 public:
  platform::RunLoop& runLoop() override { return loop; }
  platform::Queues& queues() override { return queueMaker; }
  platform::LogSink& logSink() override { return log; }
  platform::ProcessEnvironment& environment() override { return variables; }
  platform::Clock& clock() override { return wallClock; }
  platform::SystemControl& systemControl() override { return kernel; }
  platform::DeviceProperties& deviceProperties() override { return device; }
  platform::NamedNotifications& namedNotifications() override { return hearth; }
  platform::NamedNotificationCentre* namedNotificationCentre() override { return nullptr; }
  platform::NotificationCentre& notificationCentre() override { return centre; }
  std::shared_ptr<platform::UserPreferences> userPreferences() override { return user; }
  std::shared_ptr<platform::CloudStore> makeCloudStore(std::string_view, int) override { return cloud; }
  platform::RadixController& radixController() override { return radix; }
  platform::EventStreams& eventStreams() override { return hearth; }
  std::shared_ptr<platform::ServiceListener> makeServiceListener(std::string_view) override {
    return nullptr;
  }

  const std::shared_ptr<platform::linux_::ThreadPool> pool =
      std::make_shared<platform::linux_::ThreadPool>(4);
  const std::shared_ptr<SlowCloud> cloud = std::make_shared<SlowCloud>();
  SlowRadix radix;
  Hearth hearth;

 private:
  PoolLoop loop{pool};
  platform::Queues queueMaker{pool};
  SilentLog log;
  fakes::FakeEnvironment variables;
  platform::linux_::LinuxClock wallClock;
  fakes::FakeSystemControl kernel;
  fakes::FakeDeviceProperties device;
  platform::NotificationCentre centre;
  const std::shared_ptr<SlowStore<platform::UserPreferences>> user =
      std::make_shared<SlowStore<platform::UserPreferences>>();
};

// How many of the pairs left something on, or did not come to rest.
long lostPairs(ThreadedPlatform& device, DebugManager& manager, long pairs) {
  long lost = 0;
  for (long pair = 0; pair < pairs; ++pair) {
    manager.setAudioAccessoryLimitedLoggingEnabled(true);
    if (pair % 2 == 0) pause(0, 3000);
    manager.setAudioAccessoryLimitedLoggingEnabled(false);
    const bool rests =
        device.pool->waitUntilIdle(std::chrono::steady_clock::now() + std::chrono::seconds(10));
    const bool off = !manager.audioAccessoryLimitedLoggingEnabled() && !device.cloud->boolForKey(flagKey) &&
                     !device.radix.store.boolForKey(flagKey) && !device.hearth.armed;
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
