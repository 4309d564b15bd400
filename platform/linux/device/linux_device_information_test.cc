#include "platform/linux/device/linux_device_information.h"

#include <gmock/gmock.h>
#include <sys/utsname.h>
#include <unistd.h>

#include "platform/fake/fake_log.h"
#include "testing/linux_test_support.h"

namespace tarnel {
namespace {

class LinuxDeviceInformationTest : public testing::Test {
 protected:
  std::optional<std::string> answer(const char* key) { return device_.copyAnswer(key); }

  TemporaryFolder folder_;
  fake::FakeLog log_;
  LinuxDeviceInformation device_{folder_.path("config"), folder_.path(), log_};
};

TEST_F(LinuxDeviceInformationTest, AMachineThatSaysNothingHasFewAnswers) {
  for (const char* key :
       {"ProductVersion", "ProductType", "HWModelStr", "SerialNumber", "ReleaseType", "NoSuchKey", ""}) {
    EXPECT_FALSE(answer(key)) << key;
  }
  utsname names{};
  ASSERT_EQ(::uname(&names), 0);
  EXPECT_EQ(answer("BuildVersion"), std::string(&names.release[0]));
  EXPECT_TRUE(answer("DeviceName"));
  EXPECT_TRUE(log_.lines().empty());
}

TEST_F(LinuxDeviceInformationTest, TheSystemsReleaseIsRead) {
  folder_.write("usr/lib/os-release", "ID=x\nVERSION_ID=\"11\"\n");
  EXPECT_EQ(answer("ProductVersion"), "11");
  folder_.write("etc/os-release",
                "VERSION_ID_NOT=1\n#VERSION_ID=2\nVERSION_ID=\"12\\\"\" \nBUILD_ID='2024-06-07'\n");
  EXPECT_EQ(answer("ProductVersion"), "12\"");
  EXPECT_EQ(answer("BuildVersion"), "2024-06-07");
}

TEST_F(LinuxDeviceInformationTest, TheDeviceTreeComesBeforeDmi) {
  folder_.write("sys/class/dmi/id/product_name", "Box 9\n");
  folder_.write("sys/class/dmi/id/board_name", "B-1\n");
  folder_.write("sys/class/dmi/id/product_serial", "S123\n");
  EXPECT_EQ(answer("ProductType"), "Box 9");
  EXPECT_EQ(answer("HWModelStr"), "B-1");
  EXPECT_EQ(answer("SerialNumber"), "S123");
  folder_.write("proc/device-tree/model", std::string("Small Board 4\0", 14));
  folder_.write("proc/device-tree/compatible", std::string("maker,board-4\0maker,soc\0", 24));
  folder_.write("proc/device-tree/serial-number", std::string("0001\0", 5));
  EXPECT_EQ(answer("ProductType"), "Small Board 4");
  EXPECT_EQ(answer("HWModelStr"), "maker,board-4");
  EXPECT_EQ(answer("SerialNumber"), "0001");
}

TEST_F(LinuxDeviceInformationTest, WhatVendorsLeaveInEmptyFieldsIsNoAnswer) {
  for (const char* text :
       {"To be filled by O.E.M.\n", "Default string\n", "Not Specified", "None", "\n", "\xFF"}) {
    folder_.write("sys/class/dmi/id/product_serial", text);
    EXPECT_FALSE(answer("SerialNumber")) << text;
  }
}

TEST_F(LinuxDeviceInformationTest, ThePrettyHostNameComesFirst) {
  folder_.write("etc/machine-info", "PRETTY_HOSTNAME=\"Lea's phone\"\n");
  EXPECT_EQ(answer("DeviceName"), "Lea's phone");
  folder_.write("etc/machine-info", "PRETTY_HOSTNAME=\n");
  std::array<char, 257> name{};
  ASSERT_EQ(::gethostname(name.data(), name.size() - 1), 0);
  EXPECT_EQ(answer("DeviceName"), std::string(name.data()));
}

TEST_F(LinuxDeviceInformationTest, TheUniqueIdentifierHas40DigitsAndHidesTheMachineID) {
  folder_.write("etc/machine-id", "0123456789abcdef0123456789abcdef\n");
  EXPECT_EQ(answer("UniqueDeviceID"), "116b1807542f9935955d2d214539cd5a9a2ec69f");
  EXPECT_EQ(uniqueDeviceID("0123456789abcdef0123456789abcdef"), answer("UniqueDeviceID"));
  EXPECT_NE(uniqueDeviceID("1123456789abcdef0123456789abcdef"), answer("UniqueDeviceID"));
  for (const char* text : {"", "uninitialized", "0123456789abcdef0123456789abcde",
                           "0123456789ABCDEF0123456789ABCDEF", "00000000000000000000000000000000"}) {
    EXPECT_FALSE(uniqueDeviceID(text)) << text;
  }
}

TEST_F(LinuxDeviceInformationTest, AMachineWithoutIdentifierIsToldOnceWithItsRemedies) {
  EXPECT_FALSE(answer("UniqueDeviceID"));
  EXPECT_FALSE(answer("UniqueDeviceID"));
  const fake::FakeLog::Line warning{LogLevel::warning,
                                    "LinuxDeviceInformation(copyAnswer): " + folder_.path("etc/machine-id") +
                                        " holds no identifier, so that this device has none: run "
                                        "systemd-machine-id-setup, or set UniqueDeviceID in " +
                                        folder_.path("config/device.toml")};
  EXPECT_EQ(log_.lines(), std::vector{warning});
  folder_.write("config/device.toml", "UniqueDeviceID = \"mine\"\n");
  EXPECT_EQ(answer("UniqueDeviceID"), "mine");
  folder_.write("config/device.toml", "UniqueDeviceID = \"\"\n");
  EXPECT_FALSE(answer("UniqueDeviceID"));
  EXPECT_EQ(log_.lines(), std::vector{warning});
}

TEST_F(LinuxDeviceInformationTest, TheAdministratorDecidesKeyByKeyAndAtOnce) {
  folder_.write("etc/os-release", "VERSION_ID=12\nBUILD_ID=b\n");
  folder_.write("config/device.toml",
                "ProductVersion = \"99.1\"\nReleaseType = \"Internal\"\nBuildVersion = \"\"\n");
  EXPECT_EQ(answer("ProductVersion"), "99.1");
  EXPECT_EQ(answer("ReleaseType"), "Internal");
  EXPECT_FALSE(answer("BuildVersion"));
  folder_.write("config/device.toml", "ReleaseType = \"Beta\"\n");
  EXPECT_EQ(answer("ProductVersion"), "12");
  EXPECT_EQ(answer("ReleaseType"), "Beta");
  EXPECT_TRUE(log_.lines().empty());
}

TEST_F(LinuxDeviceInformationTest, MistakesOfTheAdministratorAreSaidOnce) {
  folder_.write("config/device.toml", "ProductVersion = 12\nProductVersoin = \"12\"\nReleaseType = \"x\"\n");
  EXPECT_EQ(answer("ReleaseType"), "x");
  EXPECT_FALSE(answer("ProductVersion"));
  const std::string begin = "LinuxDeviceInformation(copyAnswer): " + folder_.path("config/device.toml");
  EXPECT_EQ(log_.lines(),
            (std::vector<fake::FakeLog::Line>{
                {LogLevel::warning, begin + ":1: ProductVersion must be a text in quotes; the default stays"},
                {LogLevel::warning, begin + ":2: unknown key ProductVersoin; it is ignored, "
                                            "tarneld.conf(5) lists the keys"}}));
}

}  // namespace
}  // namespace tarnel
