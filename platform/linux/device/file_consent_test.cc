#include "platform/linux/device/file_consent.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include "platform/fake/fake_log.h"
#include "testing/linux_test_support.h"

namespace tarnel {
namespace {

class FileConsentTest : public testing::Test {
 protected:
  TemporaryFolder folder_;
  fake::FakeLog log_;
  FileConsent consent_{folder_.path(), log_};
};

TEST_F(FileConsentTest, IsOffUntilSomebodyTurnsItOn) {
  EXPECT_FALSE(consent_.isDiagnosticSubmissionAllowed());
  EXPECT_TRUE(log_.lines().empty());
}

TEST_F(FileConsentTest, AChangeTakesEffectAtOnce) {
  ASSERT_FALSE(FileConsent::store(folder_.path(), true));
  EXPECT_TRUE(consent_.isDiagnosticSubmissionAllowed());
  ASSERT_FALSE(FileConsent::store(folder_.path(), false));
  EXPECT_FALSE(consent_.isDiagnosticSubmissionAllowed());
  EXPECT_EQ(folder_.read("consent.toml"),
            "# Whether diagnostics may be submitted; written by tarnelctl consent.\ndiagnostics = false\n");
  EXPECT_TRUE(log_.lines().empty());
}

TEST_F(FileConsentTest, ADamagedFileMeansOffAndIsSaidOnce) {
  folder_.write("consent.toml", "diagnostics = \n");
  EXPECT_FALSE(consent_.isDiagnosticSubmissionAllowed());
  EXPECT_FALSE(consent_.isDiagnosticSubmissionAllowed());
  ASSERT_EQ(log_.lines().size(), 1U);
  EXPECT_EQ(log_.lines()[0].level, LogLevel::error);
  EXPECT_EQ(log_.lines()[0].text.find(
                "FileConsent(isDiagnosticSubmissionAllowed): " + folder_.path("consent.toml") + ":1: "),
            0U);
}

TEST_F(FileConsentTest, AnythingButTrueMeansOff) {
  for (const char* text : {"diagnostics = 1\n", "diagnostics = \"true\"\n", "diagnostic = true\n",
                           "[x]\ndiagnostics = true\n"}) {
    folder_.write("consent.toml", text);
    log_.clear();
    EXPECT_FALSE(FileConsent(folder_.path(), log_).isDiagnosticSubmissionAllowed()) << text;
    EXPECT_EQ(log_.lines().size(), 1U) << text;
  }
}

TEST_F(FileConsentTest, AFileThatOthersCanWriteMeansOff) {
  ASSERT_FALSE(FileConsent::store(folder_.path(), true));
  ASSERT_EQ(::chmod(folder_.path("consent.toml").c_str(), 0666), 0);
  EXPECT_FALSE(consent_.isDiagnosticSubmissionAllowed());
  EXPECT_EQ(log_.lines().size(), 1U);
}

TEST_F(FileConsentTest, StoringNamesWhatFails) {
  const auto error = FileConsent::store(folder_.path("none"), true);
  ASSERT_TRUE(error);
  EXPECT_NE(error->localizedDescription().find(folder_.path("none/consent.toml")), std::string::npos);
}

}  // namespace
}  // namespace tarnel
