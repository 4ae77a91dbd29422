// Where things of one device lie.
#pragma once

#include <string>
#include <string_view>

namespace platform::linux_ {

// Below one folder (`--root`, HEARTH_ROOT), or, without one, in the system's own folders.
struct Paths {
  // An empty root stands for the system's folders.
  static Paths under(const std::string& root);
  // The same of what a person gave: made absolute, since jobs have another working folder.
  static Paths ofArgument(const std::string& root);

  std::string root;  // empty for the system's
  std::string etc;   // ROOT/etc, or /etc/pairwell
  std::string var;   // ROOT/var, or /var/lib/pairwell
  std::string run;   // ROOT/run, or /run/pairwell

  std::string device() const { return etc + "/device.json"; }
  std::string cloud() const { return etc + "/cloud.json"; }
  std::string jobs() const { return etc + "/jobs"; }
  std::string entitlements() const { return etc + "/entitlements.d"; }
  std::string userSettings() const { return var + "/settings/user/com.kestrel.pairwelld.json"; }
  std::string rootSettings() const { return var + "/settings/root/com.kestrel.bluetooth.json"; }
  std::string cloudSettings(std::string_view identifier) const {
    return var + "/settings/cloud/" + std::string(identifier) + ".json";
  }
  std::string hearthd() const { return var + "/hearthd"; }
  std::string alarms() const { return hearthd() + "/alarms.json"; }
  std::string hearthdSocket() const { return run + "/hearthd.sock"; }
  std::string serviceSocket(std::string_view service) const {
    return run + "/" + std::string(service) + ".sock";
  }
};

}  // namespace platform::linux_
