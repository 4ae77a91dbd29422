// Named events on the service manager's streams.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string_view>

#include "platform/Value.hpp"
#include "platform/WorkQueue.hpp"

namespace platform {

// Any thread.
class EventStreams {
 public:
  virtual ~EventStreams() = default;

  // A stream's events are alarms, or the named notifications that a job's file lists.
  static constexpr std::string_view alarms = "com.kestrel.alarm";
  static constexpr std::string_view matching = "com.kestrel.tidingsd.matching";
  // The entry of an event that holds its name.
  static constexpr std::string_view nameKey = "Name";

  // Runs `handler` on `queue` for every event of `stream`, those included that came before it was installed.
  using Handler = std::function<void(const Dictionary& event)>;
  virtual void setHandler(std::string_view stream, std::shared_ptr<WorkQueue> queue, Handler handler) = 0;
  // Registers, or replaces, the event `name`; no descriptor clears it. One that its stream cannot use is
  // refused with a line in the log, and an earlier event stays as it was.
  virtual void setEvent(std::string_view stream, std::string_view name,
                        const std::optional<Dictionary>& descriptor) = 0;
};

}  // namespace platform
