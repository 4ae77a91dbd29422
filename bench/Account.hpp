// Two devices that share an account in a folder.
#pragma once

#include <string>

#include "bench/Device.hpp"

namespace bench {

class Account {
 public:
  Account(const std::string& programs, const std::string& benchmark);
  ~Account();  // removes the folder, after the devices

  Device& member() { return one; }
  // From "on" at one device to its announcement at the other.
  void measureSwitches();
  // One is away while the other changes much; leaves both with all that.
  void measureCatchingUp();

 private:
  // The shared one lies in one of its own: whatever happens beside it would wake the devices.
  const std::string folder, share;
  Device one, two;
};

}  // namespace bench
