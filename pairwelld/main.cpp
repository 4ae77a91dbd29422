// The program: the daemon on Linux.
#include "pairwelld/PairwellDaemon.hpp"
#include "platform/linux/LinuxPlatform.hpp"

int main() {
  auto& linuxPlatform = *new platform::linux_::LinuxPlatform;  // lives until finish() ends the process
  platform::install(linuxPlatform);
  linuxPlatform.finish(pairwell::runPairwellDaemon());
}
