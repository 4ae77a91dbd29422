// One device's files in memory, and its log.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "tests/fakes/FakePlatform.hpp"
#include "tests/fakes/MemoryFileSystem.hpp"

namespace platform::linux_ {

struct World : testing::Test {
  // Everything on the delivery thread, events first.
  void deliver() {
    files.deliverEvents();
    device.runAll();
  }
  // The log's lines since the last call.
  std::vector<std::string> logged() {
    auto lines = device.effects.sinceMark(fakes::Effects::log);
    device.effects.mark();
    return lines;
  }

  const std::string path = "/var/settings/store.json";
  fakes::FakePlatform device;
  const PlatformScope scope{device};
  fakes::MemoryFileSystem files;
};

}  // namespace platform::linux_
