// System-wide named notifications: broadcasts between processes that carry only a name.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/WorkQueue.hpp"

namespace platform {

// Any thread.
class NamedNotifications {
 public:
  virtual ~NamedNotifications() = default;

  virtual void post(std::string_view name) = 0;

  // Runs `handler` on `queue`, with the token, after each post of `name`; posts that were not yet handled
  // merge. `token` is written before the first call. 0, or a non-zero status, and `token` is then -1.
  using Handler = std::function<void(std::int32_t token)>;
  virtual std::uint32_t registerHandler(std::string_view name, std::int32_t& token,
                                        std::shared_ptr<WorkQueue> queue, Handler handler) = 0;
  // A call already queued still comes, but for one on the main queue: what runs there relies on it that a
  // registration which it has cancelled is done with. A token that is not registered is ignored.
  virtual void cancel(std::int32_t token) = 0;
};

// The same notifications, observed by object. Callbacks run on the main queue. The one service that may be
// absent.
class NamedNotificationCentre {
 public:
  virtual ~NamedNotificationCentre() = default;

  // What the callback gets is the observer, held for the call, and the name; a centre may fail to give
  // either.
  using Callback = void (*)(const std::shared_ptr<void>& observer, const std::optional<std::string>& name);

  // The observer is held weakly, and is not called once it has died.
  virtual void addObserver(std::weak_ptr<void> observer, Callback callback, std::string_view name) = 0;
  // Compares addresses, so that an observer can remove itself in its own destructor.
  virtual void removeObserver(const void* observer, std::string_view name) = 0;
};

}  // namespace platform
