#include "util/device_facts.h"

#include <gtest/gtest.h>

#include <array>
#include <utility>
#include <vector>

#include "platform/fake/fake_device.h"
#include "tarnel/keys.h"

namespace tarnel {
namespace {

using Routine = MaybeString (*)(DeviceInformation&);

const std::vector<std::pair<Routine, std::string>> kRoutines = {
    {productVersion, "ProductVersion"}, {buildVersion, "BuildVersion"}, {productType, "ProductType"},
    {deviceName, "DeviceName"},         {hardwareModel, "HWModelStr"},  {serialNumber, "SerialNumber"},
    {releaseType, "ReleaseType"}};

TEST(DeviceFactsTest, EachRoutineAsksItsKey) {
  for (const auto& [routine, key] : kRoutines) {
    fake::FakeDeviceInformation device;
    device.answers = {{key, "answer of " + key}};
    EXPECT_EQ(routine(device), "answer of " + key);
  }
}

TEST(DeviceFactsTest, NoAnswerGivesNothing) {
  for (const auto& [routine, key] : kRoutines) {
    fake::FakeDeviceInformation device;
    device.answers.erase(key);
    EXPECT_EQ(routine(device), std::nullopt) << key;
  }
}

TEST(DeviceFactsTest, AnswersAreReadAfresh) {
  fake::FakeDeviceInformation device;
  device.answers["DeviceName"] = "Slate";
  EXPECT_EQ(deviceName(device), "Slate");
  device.answers["DeviceName"] = "Deskbox";
  EXPECT_EQ(deviceName(device), "Deskbox");
}

class UniqueDeviceIDTest : public testing::Test {
 protected:
  void SetUp() override { buffer_.fill('#'); }
  fake::FakeDeviceInformation device_;
  std::array<char, 41> buffer_;
};

TEST_F(UniqueDeviceIDTest, FortyCharactersFitWithTheirTerminator) {
  const std::string forty = "0123456789abcdefghijklmnopqrstuvwxyzABCD";
  ASSERT_EQ(forty.size(), 40U);
  device_.answers["UniqueDeviceID"] = forty;
  getUniqueDeviceID(device_, buffer_.data(), buffer_.size());
  EXPECT_EQ(buffer_[40], '\0');
  EXPECT_EQ(std::string(buffer_.data()), forty);
}

TEST_F(UniqueDeviceIDTest, ShorterAnswerIsTerminatedAndTheLastByteIsZero) {
  device_.answers["UniqueDeviceID"] = "abc";
  getUniqueDeviceID(device_, buffer_.data(), buffer_.size());
  EXPECT_STREQ(buffer_.data(), "abc");
  EXPECT_EQ(buffer_[40], '\0');
}

TEST_F(UniqueDeviceIDTest, NoAnswerLeavesTheBufferAsItWas) {
  device_.answers.erase("UniqueDeviceID");
  getUniqueDeviceID(device_, buffer_.data(), buffer_.size());
  EXPECT_EQ(std::string(buffer_.data(), buffer_.size()), std::string(41, '#'));
}

TEST_F(UniqueDeviceIDTest, LongAnswerIsCutToWholeCharactersAndTerminated) {
  device_.answers["UniqueDeviceID"] = std::string(39, 'a') + "\u00e9" + "tail";  // its 2 bytes end at 41
  getUniqueDeviceID(device_, buffer_.data(), buffer_.size());
  EXPECT_STREQ(buffer_.data(), std::string(39, 'a').c_str());
  EXPECT_EQ(buffer_[40], '\0');
}

TEST_F(UniqueDeviceIDTest, NothingIsWrittenBeyondTheSizeGiven) {
  getUniqueDeviceID(device_, buffer_.data(), 1);
  EXPECT_EQ(buffer_[0], '\0');
  EXPECT_EQ(buffer_[1], '#');
  getUniqueDeviceID(device_, buffer_.data() + 1, 0);
  EXPECT_EQ(buffer_[1], '#');
}

MaybeDictionary userInfo(const Value& client, const Value& service) {
  return Dictionary{{kTarnelUserInfoClientName, client}, {kTarnelUserInfoServiceName, service}};
}

TEST(UserInfoKeyTest, BothNamesLowerCased) {
  EXPECT_EQ(userInfoKey(userInfo("Foo", "Bar")), "foo:bar");
  EXPECT_EQ(userInfoKey(userInfo("com.Example.APP-9 z[", "AZ@`{")), "com.example.app-9 z[:az@`{");
}

TEST(UserInfoKeyTest, MissingPartsAreEmpty) {
  EXPECT_EQ(userInfoKey(Dictionary{}), ":");
  EXPECT_EQ(userInfoKey(std::nullopt), ":");
  EXPECT_EQ(userInfoKey(Dictionary{{kTarnelUserInfoClientName, "Foo"}}), "foo:");
  EXPECT_EQ(userInfoKey(Dictionary{{kTarnelUserInfoServiceName, "Bar"}}), ":bar");
  EXPECT_EQ(userInfoKey(userInfo(17, Array{})), ":") << "a name that is no text counts as missing";
}

TEST(UserInfoKeyTest, LettersBeyondAscii) {
  EXPECT_EQ(userInfoKey(userInfo("\u00c4\u00d6\u00dc Stra\u00dfe", "\u0395\u039b\u039b\u0397")),
            "\u00e4\u00f6\u00fc stra\u00dfe:\u03b5\u03bb\u03bb\u03b7");
  EXPECT_EQ(userInfoKey(userInfo("\u041c\u0418\u0420", "\u65e5\u672c")), "\u043c\u0438\u0440:\u65e5\u672c");
  EXPECT_EQ(userInfoKey(userInfo("\U00010400\U0001F600", "X")), "\U00010428\U0001F600:x");
}

TEST(UserInfoKeyTest, NamesThatAreTheSameInSmallLettersGiveTheSameKey) {
  EXPECT_EQ(userInfoKey(userInfo("\u039f\u03a3", "\u212aey")), userInfoKey(userInfo("\u03bf\u03c3", "key")));
  EXPECT_EQ(userInfoKey(userInfo("\u0531", "\uff21")), "\u0561:\uff41");
}

// Two small letters of one capital agree where names are compared, but a key keeps them apart.
TEST(UserInfoKeyTest, SmallLettersStayAsTheyAre) {
  EXPECT_EQ(userInfoKey(userInfo("\u03bf\u03c2", "\u017f\u0131\u00b5")), "\u03bf\u03c2:\u017f\u0131\u00b5");
  EXPECT_NE(userInfoKey(userInfo("\u03bf\u03c2", "key")), userInfoKey(userInfo("\u03bf\u03c3", "key")));
}

TEST(UserInfoKeyTest, TextThatIsNotUtf8KeepsItsBytes) {
  EXPECT_EQ(userInfoKey(userInfo("A\xff\xc3", "B\xe2\x82")), "a\xff\xc3:b\xe2\x82");
}

TEST(UserInfoKeyTest, NulInsideANameIsKept) {
  EXPECT_EQ(userInfoKey(userInfo(std::string("A\0B", 3), "C")), std::string("a\0b:c", 5));
}

}  // namespace
}  // namespace tarnel
