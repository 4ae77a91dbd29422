// The engines that an account can live at, by URL.
#pragma once

#include <functional>
#include <memory>
#include <string>

#include "cloudsyncd/CloudFile.hpp"
#include "cloudsyncd/Transport.hpp"
#include "platform/Result.hpp"
#include "platform/WorkQueue.hpp"
#include "platform/linux/FileSystem.hpp"

namespace cloudsync {

struct Surroundings {
  platform::linux_::FileSystem& files;
  platform::WorkQueue& queue;  // the loop's
  std::function<Steady()> steady;
};

// `dir:PATH`, or `dir:PATH?poll=SECONDS` for a folder whose file system gives no events.
// `nats://[USER@]HOST[:PORT][,HOST[:PORT]…]`, the servers of one cluster; encrypted, unless all are this very
// machine or the membership says otherwise.
// Outcome::malformedFile for any other URL, and for an account that is no name; `problem` says what is wrong,
// for people. Nothing is opened before the transport is started.
platform::Result<std::shared_ptr<Transport>> makeTransport(const Membership& membership,
                                                           const Surroundings& surroundings,
                                                           std::string& problem);

// What makeTransport() would refuse it for; empty if nothing.
std::string problemOf(const Membership& membership);

}  // namespace cloudsync
