// Two devices that share an account.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

#include "bench/Cluster.hpp"
#include "bench/Device.hpp"

namespace bench {

class Account {
 public:
  // `options` are hearthctl init's that say which account.
  Account(const std::string& programs, const std::string& options);

  Device& member() { return one; }
  // Milliseconds from "on" at one device to its announcement at the other.
  std::vector<double> timeSwitches(std::size_t count);
  // One switches on and on, while servers that lead the account's stream are killed: how long the other is
  // behind, and that it ends with the same.
  void measureLossOfLeaders(Cluster& cluster);
  // One is away while the other changes much; leaves both with all that. `documents` is the account's folder.
  void measureCatchingUp(const std::string& documents);

 private:
  Device one, two;
};

}  // namespace bench
