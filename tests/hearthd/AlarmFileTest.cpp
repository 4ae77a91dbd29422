// The alarms on a disk that fails, or whose device loses its power, at any call.
#include "hearthd/AlarmFile.hpp"

#include <gtest/gtest.h>

#include <cerrno>
#include <tuple>

#include "tests/fakes/FakePlatform.hpp"
#include "tests/fakes/MemoryFileSystem.hpp"

namespace hearth {
namespace {

TEST(AlarmFile, CutAtAnyCallLeavesTheOldAlarmsOrTheNew) {
  const std::string path = "/var/hearthd/alarms.json";
  fakes::FakePlatform device;
  const platform::PlatformScope scope{device};
  for (const bool first : {true, false}) {
    bool whole = false;
    for (int cut = 1; !whole; ++cut) {
      SCOPED_TRACE(testing::Message() << "first " << first << ", call " << cut);
      fakes::MemoryFileSystem disk;
      AlarmFile file(disk, path);
      Alarms alarms;
      if (!first) alarms.set({"job", "stream", "older"}, {2});
      ASSERT_TRUE(first || file.save(alarms));
      const auto old = alarms.toValue();
      alarms.set({"job", "stream", "name"}, {1});
      disk.calls = 0;
      disk.failFrom = cut;
      const bool saved = file.save(alarms).has_value();
      whole = disk.calls < cut;
      disk.failFrom = std::numeric_limits<int>::max();
      for (const bool power : {false, true}) {
        if (power) disk.powerCut();
        const auto found = AlarmFile(disk, path).load()->toValue();
        EXPECT_TRUE(found == alarms.toValue() || (!saved && found == old)) << platform::describe(found);
      }
      EXPECT_TRUE(file.save(alarms));
      disk.powerCut();
      EXPECT_EQ(AlarmFile(disk, path).load()->toValue(), alarms.toValue());
    }
  }
}

struct RefusingDisk : fakes::MemoryFileSystem {
  int refusals = 0, error = 0;
  platform::Result<std::unique_ptr<platform::linux_::File>> openToRead(const std::string& path) override {
    if (refusals-- > 0) return std::error_code(error, std::system_category());
    return MemoryFileSystem::openToRead(path);
  }
};

TEST(AlarmFile, WhatCannotBeReadIsReadAgainOrKeptAside) {
  fakes::FakePlatform device;
  const platform::PlatformScope scope{device};
  const std::string path = "/alarms.json";
  for (const auto& [error, refusals, count] : {std::tuple(EMFILE, 1, -1), {EIO, 1, 1}, {EIO, 2, 0}}) {
    RefusingDisk disk;
    Alarms alarms;
    alarms.set({"job", "stream", "name"}, {1});
    ASSERT_TRUE(AlarmFile(disk, path).save(alarms));
    const std::string old = disk.bytes(path);
    disk.refusals = refusals;
    disk.error = error;
    AlarmFile file(disk, path);
    const auto found = file.load();
    EXPECT_EQ(found ? static_cast<int>(found->list().size()) : -1, count) << error;
    EXPECT_EQ(disk.bytes(count == 0 ? path + ".damaged-1" : path), old);
    EXPECT_TRUE(file.save(alarms)) << "this run's own are kept";
  }
}

}  // namespace
}  // namespace hearth
