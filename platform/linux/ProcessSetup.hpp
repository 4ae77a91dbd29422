// What a daemon's process does before anything else.
#pragma once

#include <signal.h>
#include <sys/resource.h>

namespace platform::linux_ {

// Before the first thread: the signals that end the process are blocked, for the loop to read, and a reader
// that has gone is an error of the write.
inline void prepareSignals() {
  sigset_t ending;
  sigemptyset(&ending);
  for (const int signal : {SIGTERM, SIGINT}) sigaddset(&ending, signal);
  ::pthread_sigmask(SIG_BLOCK, &ending, nullptr);
  ::signal(SIGPIPE, SIG_IGN);
}

// A client costs a few descriptors, and the usual limit is lower than the clients that are let in.
inline void raiseDescriptorLimit() {
  rlimit limit{};
  if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) return;
  limit.rlim_cur = limit.rlim_max;
  ::setrlimit(RLIMIT_NOFILE, &limit);
}

}  // namespace platform::linux_
