#include "cloudsyncd/CloudInterface.hpp"

namespace cloudsync {

const platform::linux_::BusInterface& cloudInterface() {
  // In the order of CloudOperation.
  static const platform::linux_::BusInterface interface {
    "/com/kestrel/cloudsync", "com.kestrel.cloudsync.Manager",
        {{"Status", "", "s"}, {"Use", "s", ""}, {"Forget", "s", ""}}, {}
  };
  return interface;
}

}  // namespace cloudsync
