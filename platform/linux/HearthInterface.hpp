// What hearthd serves: on its socket to anyone, on each job's link to that job.
#pragma once

#include <string_view>

#include "platform/linux/BusServer.hpp"

namespace platform::linux_ {

// The operations; the numbers are indices into hearthInterface().operations.
//
//   Post s                 posts a named notification
//   Watch s / Unwatch s    the connection hears of the posts of a name from now on, or no longer
//   SetEvent ssx → x       stream, name, date in nanoseconds: registers an event, durably before it
//                          answers with its generation
//   ClearEvent ss → x      stream, name; the least generation that is not stale
//   InstallHandler s       the job has a handler for a stream: its events are delivered from now on
//   Taken ssx              stream, name, generation: the handler has returned
//   DeliverEvent ss        delivers an event by hand, to every job that consumes the stream
//   ListJobs → a(ssxs)     name, state, pid, detail
//   ControlJob ss          "start", "stop" or "restart", and the job's name
//   ListAlarms → a(sssx)   job, stream, name, date in nanoseconds
//   CancelAlarm s → u      clears the alarms of that name, of every job; how many there were
//
// On the socket SetEvent, ClearEvent, DeliverEvent, ControlJob and CancelAlarm are root's and hearthd's own
// user's. InstallHandler and Taken exist on a link alone. On a link SetEvent and ClearEvent are for the job's
// own streams, on the socket for every job that consumes the stream.
enum class HearthOperation {
  post,
  watch,
  unwatch,
  setEvent,
  clearEvent,
  installHandler,
  taken,
  deliverEvent,
  listJobs,
  controlJob,
  listAlarms,
  cancelAlarm
};

// Signals.
//
//   Notification s         a watched name was posted; unread ones of a name merge
//   Event ssx              stream, name, generation; on a link alone. Generation 0 is no alarm's, and
//                          is not answered with Taken
enum class HearthSignal { notification, event };

const BusInterface& hearthInterface();

// Errors that callers tell apart.
inline constexpr std::string_view notPermittedError = "com.kestrel.hearth.NotPermitted";
inline constexpr std::string_view unknownJobError = "com.kestrel.hearth.UnknownJob";
inline constexpr std::string_view unknownStreamError =
    "com.kestrel.hearth.UnknownStream";                                       // no job consumes it
inline constexpr std::string_view failedError = "com.kestrel.hearth.Failed";  // the system's, in the message

// The names of the descriptors that a job inherits (LISTEN_FDNAMES): its link, the lock that proves that it
// lives, and each service socket under the service's name.
inline constexpr std::string_view linkDescriptorName = "hearthd.link";
inline constexpr std::string_view lifeDescriptorName = "hearthd.life";

}  // namespace platform::linux_
