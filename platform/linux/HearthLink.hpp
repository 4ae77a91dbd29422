// A job's link to hearthd: event streams and named notifications.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/EventStreams.hpp"
#include "platform/NamedNotifications.hpp"
#include "platform/Result.hpp"
#include "platform/linux/EventLoop.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace platform::linux_ {

// One per process. Any thread may call, nothing waits: the calls leave, in order, on the thread of `io`,
// which outlives the link.
class HearthLink : public EventStreams, public NamedNotifications, public NamedNotificationCentre {
 public:
  // The link that the process inherited; Outcome::notConnected where it inherited none. `lost` is called
  // once, on the thread of `io`, when hearthd has gone.
  static Result<std::unique_ptr<HearthLink>> inherit(EventLoop& io, std::shared_ptr<WorkQueue> mainQueue,
                                                     std::function<void()> lost);
  HearthLink(EventLoop& io, UniqueDescriptor socket, std::shared_ptr<WorkQueue> mainQueue,
             std::function<void()> lost);
  // Releases the handlers, on the caller's thread; a call under way on a queue completes.
  ~HearthLink() override;

  // An event stays with hearthd until its handler has returned, so a crash delivers it again. One that is
  // replaced or cleared while it waits for the queue is not handled any more.
  void setHandler(std::string_view stream, std::shared_ptr<WorkQueue> queue,
                  EventStreams::Handler handler) override;
  // A descriptor needs the entry "Date"; one without is logged, and leaves an earlier event as it was.
  void setEvent(std::string_view stream, std::string_view name,
                const std::optional<Dictionary>& descriptor) override;

  void post(std::string_view name) override;
  // Always answers 0. Posts made before hearthd has read the registration are not heard.
  std::uint32_t registerHandler(std::string_view name, std::int32_t& token, std::shared_ptr<WorkQueue> queue,
                                NamedNotifications::Handler handler) override;
  void cancel(std::int32_t token) override;

  void addObserver(std::weak_ptr<void> observer, Callback callback, std::string_view name) override;
  void removeObserver(const void* observer, std::string_view name) override;

 private:
  struct Observation {
    const void* observer;
    std::string name;
    std::int32_t token;
  };
  class State;

  const std::shared_ptr<WorkQueue> mainQueue;
  const std::shared_ptr<State> state;  // shared with work on its way, which holds it weakly
  std::mutex mutex;
  std::vector<Observation> observations;  // guarded by `mutex`
};

}  // namespace platform::linux_
