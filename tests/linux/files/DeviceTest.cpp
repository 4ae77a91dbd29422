#include <cerrno>

#include "platform/linux/FileDeviceProperties.hpp"
#include "tests/linux/files/World.hpp"

namespace platform::linux_ {
namespace {

struct DeviceTest : World {
  std::string answer(const char* key) {
    std::int32_t error = 0;
    const std::string text = describe(properties.copyAnswerWithError(key, error));
    return error != 0 ? text + " error " + std::to_string(error) : text;
  }
  std::string bootSession(std::size_t size) {
    std::string buffer(size, '?');
    if (kernel.sysctlbyname("kern.bootsessionuuid", buffer.data(), &size) != 0) return std::to_string(errno);
    return buffer.substr(0, size - 1);
  }

  const std::string etc = "/root/etc/device.json";
  DeviceFile file{files, etc};
  FileDeviceProperties properties{files, file};
  LinuxSystemControl kernel{files, file};
};

TEST_F(DeviceTest, FileComesFirstThenTheMachine) {
  files.put("/usr/lib/os-release", "NAME=\"X\"\nVERSION_ID=\"12\"\nBUILD_ID='21A5'\n");
  files.put("/etc/machine-id", "0123abcd\n");
  EXPECT_EQ(answer("BuildVersion"), "21A5");
  EXPECT_EQ(answer("ProductVersion") + answer("UniqueDeviceID") + answer("ProductType"), "120123abcdnil");
  for (const char* key : {"UserAssignedDeviceName", "k7QIBwZJJOVw+Sej/8h8VA"}) EXPECT_NE(answer(key), "nil");

  files.put(etc, R"({"BuildVersion": "9Z", "UniqueChipID": 77, "ProductType": {"value": "T", "error": -3},
                     "ProductVersion": {"error": 5}, "InternalBuild": true})");
  EXPECT_EQ(answer("BuildVersion"), "9Z") << "read anew";
  EXPECT_EQ(answer("UniqueChipID") + answer("ProductType"), "77T error -3");
  EXPECT_EQ(answer("ProductVersion"), "nil error 5");
  EXPECT_EQ(properties.isInternalBuild(), 1);

  files.put(etc, "{\n\"BuildVersion\": }");
  EXPECT_EQ(answer("BuildVersion"), "21A5");
  EXPECT_THAT(logged(), testing::ElementsAre(testing::HasSubstr(etc + ": line 2, column"))) << "once";
  files.put(etc, std::string((1 << 20) + 1, ' '));
  EXPECT_EQ(answer("UniqueChipID"), "nil");
  EXPECT_THAT(logged(), testing::ElementsAre(testing::HasSubstr(etc + ": ")));
  files.calls = 0;
  EXPECT_EQ(answer("UniqueChipID"), "nil");
  EXPECT_EQ(files.calls, 1) << "not read again";
  EXPECT_TRUE(files.exists(etc)) << "it is its administrator's";
}

TEST_F(DeviceTest, BootSessionIsTheKernelsInUpperCaseOrTheFiles) {
  EXPECT_EQ(bootSession(37), std::to_string(ENOENT));
  files.put("/proc/sys/kernel/random/boot_id", "01234567-89ab-cdef-0123-456789abcdef\n");
  EXPECT_EQ(bootSession(37), "01234567-89AB-CDEF-0123-456789ABCDEF");
  EXPECT_EQ(bootSession(36), std::to_string(ENOMEM));
  files.put(etc, R"({"BootSessionUUID": "another"})");
  EXPECT_EQ(bootSession(37), "another");
}

}  // namespace
}  // namespace platform::linux_
