#include "platform/linux/LinuxPlatform.hpp"

#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <future>
#include <mutex>
#include <optional>
#include <thread>
#include <utility>
#include <vector>

#include "platform/linux/BusServiceListener.hpp"
#include "platform/linux/Entitlements.hpp"
#include "platform/linux/EventLoop.hpp"
#include "platform/linux/FileDeviceProperties.hpp"
#include "platform/linux/FileRadixController.hpp"
#include "platform/linux/FileUserPreferences.hpp"
#include "platform/linux/HearthInterface.hpp"
#include "platform/linux/HearthLink.hpp"
#include "platform/linux/InheritedDescriptors.hpp"
#include "platform/linux/LinuxEnvironment.hpp"
#include "platform/linux/LinuxFileSystem.hpp"
#include "platform/linux/Paths.hpp"
#include "platform/linux/ProcessSetup.hpp"
#include "platform/linux/ReplicaFileCloudStore.hpp"
#include "platform/linux/ThreadPool.hpp"
#include "platform/linux/UnifiedLog.hpp"

// Present in builds with the leak check alone.
// NOLINTNEXTLINE(bugprone-reserved-identifier,cert-dcl37-c,cert-dcl51-cpp): the sanitizer's own
extern "C" __attribute__((weak)) int __lsan_do_recoverable_leak_check();

namespace platform::linux_ {
namespace {

// Work is short and mostly waits for the disk; threads start when they are needed.
constexpr std::size_t poolThreads = 4;
constexpr std::chrono::seconds patience{2};

std::string rootFromEnvironment() {
  const char* root = std::getenv("HEARTH_ROOT");
  return root ? root : "";
}

// Made on first use, by any thread.
template <class T>
class Lazy {
 public:
  template <class Make>
  T& get(Make make) {
    std::call_once(once, [&] {
      value.emplace(make());
      made = true;
    });
    return *value;
  }
  T* ifMade() { return made ? &*value : nullptr; }

 private:
  std::once_flag once;
  std::optional<T> value;
  std::atomic<bool> made{false};  // by a thread that may be another than who asks
};

[[noreturn]] void endWithoutLink() {
  hearthLog("link").error("there is no link to hearthd: pairwelld is a job of hearthd's, which starts it");
  ::_exit(1);
}

// A loop and the thread that runs it.
class LoopThread {
 public:
  LoopThread() : loop(std::make_unique<EventLoop>()), thread([this] { loop->run(); }) {}
  ~LoopThread() {
    loop->stop();
    thread.join();
  }
  EventLoop& operator*() { return *loop; }

 private:
  const std::unique_ptr<EventLoop> loop;
  std::thread thread;
};

// A job's environment. A service name that somebody set by hand makes no job: without hearthd's link the
// process ends at once, before it has written anything.
class JobEnvironment : public LinuxEnvironment {
 public:
  std::optional<std::string> variable(std::string_view name) override {
    auto value = LinuxEnvironment::variable(name);
    if (name == "CONDUIT_SERVICE_NAME" && value && !hasInheritedDescriptor(linkDescriptorName))
      endWithoutLink();
    return value;
  }
};

class MainLoop : public RunLoop {
 public:
  void run() override {
    const auto terminated = loop->watchSignal(SIGTERM, [this] { loop->stop(); });
    const auto interrupted = loop->watchSignal(SIGINT, [this] { loop->stop(); });
    loop->run();
  }
  void stop() override { loop->stop(); }
  std::shared_ptr<WorkQueue> mainQueue() override { return loop; }

 private:
  const std::shared_ptr<EventLoop> loop = std::make_shared<EventLoop>();
};

}  // namespace

struct LinuxPlatform::Services {
  Services() : paths(Paths::under(rootFromEnvironment())), log(!paths.root.empty()) {}

  EventLoop& ioLoop() {
    return **io.get([] { return std::make_unique<LoopThread>(); });
  }
  EventLoop& deliveryLoop() {
    return **delivery.get([] { return std::make_unique<LoopThread>(); });
  }
  FileSystem& fileSystem() {
    return *files.get([this] { return std::make_unique<LinuxFileSystem>(&deliveryLoop()); });
  }
  DeviceFile& deviceFile() {
    return *device.get([this] { return std::make_unique<DeviceFile>(fileSystem(), paths.device()); });
  }
  MainLoop& mainLoop() {
    return *main.get([] { return std::make_unique<MainLoop>(); });
  }
  HearthLink& hearth() {
    return *link.get([this] {
      auto inherited = HearthLink::inherit(ioLoop(), mainLoop().mainQueue(), [this] {
        hearthLog("link").error("hearthd has gone");
        mainLoop().stop();
      });
      if (!inherited) endWithoutLink();
      return std::move(*inherited);
    });
  }

  const Paths paths;
  UnifiedLog log;
  JobEnvironment environment;
  LinuxClock clock;
  NotificationCentre centre;
  Lazy<std::unique_ptr<MainLoop>> main;
  Lazy<std::unique_ptr<LoopThread>> io;
  Lazy<std::unique_ptr<LoopThread>> delivery;
  Lazy<std::unique_ptr<LinuxFileSystem>> files;
  Lazy<std::shared_ptr<ThreadPool>> pool;
  Lazy<Queues> queues;
  Lazy<std::unique_ptr<DeviceFile>> device;
  Lazy<FileDeviceProperties> deviceProperties;
  Lazy<LinuxSystemControl> systemControl;
  Lazy<std::unique_ptr<HearthLink>> link;
  Lazy<std::shared_ptr<FileUserPreferences>> userPreferences;
  Lazy<std::unique_ptr<FileRadixController>> radixController;
  Lazy<std::unique_ptr<Entitlements>> entitlements;

  std::mutex mutex;
  std::vector<std::shared_ptr<BusServiceListener>> listeners;  // guarded by `mutex`
};

LinuxPlatform::LinuxPlatform() : services(std::make_unique<Services>()) { prepareSignals(); }

LinuxPlatform::~LinuxPlatform() = default;

RunLoop& LinuxPlatform::runLoop() { return services->mainLoop(); }

Queues& LinuxPlatform::queues() {
  return services->queues.get([this] {
    return Queues(services->pool.get([] { return std::make_shared<ThreadPool>(poolThreads); }));
  });
}

LogSink& LinuxPlatform::logSink() { return services->log; }

ProcessEnvironment& LinuxPlatform::environment() { return services->environment; }

Clock& LinuxPlatform::clock() { return services->clock; }

SystemControl& LinuxPlatform::systemControl() {
  return services->systemControl.get(
      [this] { return LinuxSystemControl(services->fileSystem(), services->deviceFile()); });
}

DeviceProperties& LinuxPlatform::deviceProperties() {
  return services->deviceProperties.get(
      [this] { return FileDeviceProperties(services->fileSystem(), services->deviceFile()); });
}

NamedNotifications& LinuxPlatform::namedNotifications() { return services->hearth(); }

NamedNotificationCentre* LinuxPlatform::namedNotificationCentre() { return &services->hearth(); }

NotificationCentre& LinuxPlatform::notificationCentre() { return services->centre; }

std::shared_ptr<UserPreferences> LinuxPlatform::userPreferences() {
  return services->userPreferences.get([this] {
    return FileUserPreferences::create(services->fileSystem(), &services->deliveryLoop(),
                                       services->paths.userSettings());
  });
}

// A replica stands for every type of cloud store, so the type code decides nothing here.
std::shared_ptr<CloudStore> LinuxPlatform::makeCloudStore(std::string_view identifier, int) {
  return ReplicaFileCloudStore::create(services->fileSystem(), &services->deliveryLoop(), services->centre,
                                       services->clock, services->paths.cloudSettings(identifier));
}

RadixController& LinuxPlatform::radixController() {
  return *services->radixController.get([this] {
    return std::make_unique<FileRadixController>(services->fileSystem(), services->paths.rootSettings());
  });
}

EventStreams& LinuxPlatform::eventStreams() { return services->hearth(); }

std::shared_ptr<ServiceListener> LinuxPlatform::makeServiceListener(std::string_view serviceName) {
  raiseDescriptorLimit();
  Entitlements& entitlements = *services->entitlements.get(
      [this] { return std::make_unique<Entitlements>(services->fileSystem(), services->paths); });
  UniqueDescriptor socket = takeInheritedDescriptor(serviceName);
  if (!socket) hearthLog("bus").error("hearthd has given no socket for %s: no client can come", serviceName);
  auto listener =
      BusServiceListener::create(services->ioLoop(), entitlements, serviceName, std::move(socket));
  std::lock_guard lock(services->mutex);
  services->listeners.push_back(listener);
  return listener;
}

void LinuxPlatform::finish(int status) {
  const auto deadline = std::chrono::steady_clock::now() + patience;
  std::vector<std::shared_ptr<BusServiceListener>> listeners;
  {
    std::lock_guard lock(services->mutex);
    listeners = services->listeners;
  }
  for (const auto& listener : listeners) {
    const auto drained = std::make_shared<std::promise<void>>();
    listener->drain([drained] { drained->set_value(); });
    drained->get_future().wait_until(deadline);
  }
  if (auto* pool = services->pool.ifMade(); pool && !(*pool)->waitUntilIdle(deadline))
    hearthLog("platform").error("the time to end is up, and work is left undone");
  // What was handed to the link before this leaves before it.
  if (services->io.ifMade()) {
    const auto left = std::make_shared<std::promise<void>>();
    services->ioLoop().async([left] { left->set_value(); });
    left->get_future().wait_until(deadline);
  }
  if (__lsan_do_recoverable_leak_check && __lsan_do_recoverable_leak_check() != 0 && status == 0) status = 23;
  ::_exit(status);
}

}  // namespace platform::linux_
