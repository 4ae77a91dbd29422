#include "platform/Platform.hpp"

#include <cstdio>
#include <cstdlib>
#include <string>
#include <utility>

namespace platform {
namespace {

thread_local Platform* scoped = nullptr;
std::atomic<Platform*> installed = nullptr;
std::atomic<LogSink*> installedLogSink = nullptr;

class DroppingLogSink : public LogSink {
 public:
  bool enabled(const LogChannel&, LogLevel) override { return false; }
  void write(const LogChannel&, LogLevel, std::string_view, std::span<const LogArgument>) override {}
};

}  // namespace

void stop(std::string_view text) {
  if (Platform* platform = currentOrNull()) platform->willStop(text);
  std::fprintf(stderr, "%.*s\n", static_cast<int>(text.size()), text.data());
  std::abort();
}

Platform* currentOrNull() { return scoped ? scoped : installed.load(std::memory_order_acquire); }

Platform& current() {
  Platform* platform = currentOrNull();
  if (!platform) stop("no platform is installed");
  return *platform;
}

void install(Platform& platform) { installed.store(&platform, std::memory_order_release); }

LogSink& currentLogSink() {
  if (Platform* platform = currentOrNull()) return platform->logSink();
  if (LogSink* sink = installedLogSink.load(std::memory_order_acquire)) return *sink;
  static DroppingLogSink dropping;
  return dropping;
}

void installLogSink(LogSink& sink) { installedLogSink.store(&sink, std::memory_order_release); }

void Platform::clearSlots() {
  // Later ones stand on earlier ones: a manager's end still logs.
  for (auto slot = slots.rbegin(); slot != slots.rend(); ++slot) slot->object.reset();
}

PlatformScope::PlatformScope(Platform& platform) : previous(std::exchange(scoped, &platform)) {}

PlatformScope::~PlatformScope() { scoped = previous; }

}  // namespace platform
