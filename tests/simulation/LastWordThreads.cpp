// A client's last word on real threads, with writes as long as a disk's. Usage: last_word_threads [PAIRS]
#include <cstdio>
#include <cstdlib>
#include <thread>

#include "pairwelld/debug/DebugManager.hpp"
#include "pairwelld/settings/KeyValueStoreManager.hpp"
#include "platform/linux/ThreadPool.hpp"
#include "tests/fakes/FakePlatform.hpp"

namespace pairwell {
namespace {

constexpr const char* flagKey = "VelaLogCloudCollectionEnabled";

void pause(int fromMicroseconds, int toMicroseconds) {
  thread_local std::mt19937 random(std::random_device{}());
  std::this_thread::sleep_for(std::chrono::microseconds(
      std::uniform_int_distribution<int>(fromMicroseconds, toMicroseconds)(random)));
}

// The main queue is one of the pool's; alarms are only counted.
struct Hearth : platform::RunLoop, platform::EventStreams {
  void run() override {}
  void stop() override {}
  std::shared_ptr<platform::WorkQueue> mainQueue() override { return pool; }
  void setHandler(std::string_view, std::shared_ptr<platform::WorkQueue>, Handler) override {}
  void setEvent(std::string_view, std::string_view,
                const std::optional<platform::Dictionary>& descriptor) override {
    armed = descriptor.has_value();
  }
  const std::shared_ptr<platform::linux_::ThreadPool> pool =
      std::make_shared<platform::linux_::ThreadPool>(4);
  std::atomic<bool> armed = false;
};

// The fakes, on threads. Every read and write of a store takes 20 to 400 us.
struct ThreadedPlatform : fakes::FakePlatform {
  ThreadedPlatform() {
    effects.onMoment = [] { pause(20, 400); };
  }
  platform::RunLoop& runLoop() override { return hearth; }
  platform::Queues& queues() override { return threadedQueues; }
  platform::LogSink& logSink() override { return silentLog; }
  platform::NamedNotificationCentre* namedNotificationCentre() override { return nullptr; }
  platform::EventStreams& eventStreams() override { return hearth; }

  Hearth hearth;
  platform::Queues threadedQueues{hearth.pool};
  fakes::SilentLog silentLog;
};

// How many of the pairs left something on, or did not come to rest.
long lostPairs(ThreadedPlatform& device, DebugManager& manager, long pairs) {
  long lost = 0;
  for (long pair = 0; pair < pairs && lost < 5; ++pair) {
    manager.setAudioAccessoryLimitedLoggingEnabled(true);
    if (pair % 2 == 0) pause(0, 3000);
    manager.setAudioAccessoryLimitedLoggingEnabled(false);
    const bool rests =
        device.hearth.pool->waitUntilIdle(std::chrono::steady_clock::now() + std::chrono::seconds(10));
    const bool off = !manager.audioAccessoryLimitedLoggingEnabled() &&
                     device.cloud->value(flagKey) == platform::Value(false) &&
                     device.radix.contents.at(flagKey) == platform::Value(false) && !device.hearth.armed;
    if (!rests || !off) ++lost;
    device.effects.mark();
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
