// Serves a Member to the operator's tools.
#pragma once

#include <sys/types.h>

#include <string>

#include "cloudsyncd/CloudInterface.hpp"
#include "cloudsyncd/Member.hpp"
#include "platform/linux/BusServer.hpp"
#include "platform/linux/EventLoop.hpp"
#include "platform/linux/UniqueDescriptor.hpp"

namespace cloudsync {

// The loop's thread; `member` and `loop` outlive the object.
class Service {
 public:
  Service(platform::linux_::EventLoop& loop, Member& member, platform::linux_::UniqueDescriptor socket);

 private:
  platform::linux_::BusServer server;
  platform::linux_::EventSource watch;
};

}  // namespace cloudsync
