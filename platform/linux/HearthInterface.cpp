#include "platform/linux/HearthInterface.hpp"

namespace platform::linux_ {

const BusInterface& hearthInterface() {
  // In the order of HearthOperation and HearthSignal.
  static const BusInterface interface {
    "/com/kestrel/hearth", "com.kestrel.hearth.Manager",
        {{"Post", "s", ""},
         {"Watch", "s", ""},
         {"Unwatch", "s", ""},
         {"SetEvent", "ssx", "x"},
         {"ClearEvent", "ss", "x"},
         {"InstallHandler", "s", ""},
         {"Taken", "ssx", ""},
         {"DeliverEvent", "ss", ""},
         {"ListJobs", "", "a(ssxs)"},
         {"ControlJob", "ss", ""},
         {"ListAlarms", "", "a(sssx)"},
         {"CancelAlarm", "s", "u"}},
    {
      {"Notification", "s"}, { "Event", "ssx" }
    }
  };
  return interface;
}

}  // namespace platform::linux_
