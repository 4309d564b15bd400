#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "platform/fake/fake_log.h"
#include "platform/linux/configuration/toml_settings_store.h"
#include "tools/tarnelctl/acting_as_owner.h"
#include "tools/tarnelctl/commands/consent_command.h"
#include "tools/tarnelctl/commands/log_command.h"
#include "tools/tarnelctl/commands/settings_command.h"
#include "tools/tarnelctl/commands/storebag_command.h"

// The commands that need no daemon, over real files in a folder of the test's own.

namespace tarnel::ctl {
namespace {

namespace fs = std::filesystem;

class CommandTest : public testing::Test {
 protected:
  CommandTest() {
    fs::create_directories(home_ + "/config/settings");
    fs::create_directories(home_ + "/state");
  }
  ~CommandTest() override { fs::remove_all(home_); }

  static std::string makeHome() {
    std::string pattern = (fs::temp_directory_path() / "tarnelctl-test.XXXXXX").string();
    return mkdtemp(pattern.data());
  }
  std::string path(const std::string& name) const { return home_ + "/" + name; }
  void write(const std::string& name, const std::string& text) const { std::ofstream(path(name)) << text; }
  std::string out() const { return out_.str(); }
  std::string err() const { return err_.str(); }
  void clear() {
    out_.str("");
    err_.str("");
  }

  const std::string home_ = makeHome();
  std::ostringstream out_;
  std::ostringstream err_;
  Terminal terminal_{out_, err_};
  fake::FakeLog log_;
  TomlSettingsStore store_{path("config"), path("state"), log_};
};

TEST_F(CommandTest, SettingsAreSetReadListedAndUnset) {
  SettingsOptions options{.domain = "com.orvane.tarnel", .key = "environmentType", .value = "4"};
  EXPECT_EQ(setSetting(options, store_, terminal_), ExitStatus::ok);
  EXPECT_EQ(getSetting(options, store_, terminal_), ExitStatus::ok);
  EXPECT_EQ(out(), "4\n");
  clear();
  EXPECT_EQ(listSettings({}, store_, terminal_), ExitStatus::ok);
  EXPECT_EQ(out(), "com.orvane.tarnel  environmentType = 4  (int, own)\n");
  clear();
  options.json = true;
  EXPECT_EQ(getSetting(options, store_, terminal_), ExitStatus::ok);
  EXPECT_NE(out().find("\"layer\": \"own\""), std::string::npos) << out();
  EXPECT_EQ(unsetSetting(options, store_, terminal_), ExitStatus::ok);
  clear();
  EXPECT_EQ(getSetting(options, store_, terminal_), ExitStatus::failed);
  EXPECT_EQ(err(),
            "tarnelctl: com.orvane.tarnel has no key environmentType: see tarnelctl settings list "
            "com.orvane.tarnel\n");
}

TEST_F(CommandTest, ASettingThatTheAdministratorHidesIsPointedOut) {
  write("config/settings/d.toml", "k = 1\n");
  EXPECT_EQ(setSetting({.domain = "d", .key = "k", .value = "2"}, store_, terminal_), ExitStatus::ok);
  EXPECT_EQ(err(), "tarnelctl: stored, but the administrator's file " + path("config/settings/d.toml") +
                       " decides: k = 1\n");
}

TEST_F(CommandTest, ABadValueIsAUsageError) {
  const SettingsOptions options{.domain = "d", .key = "k", .value = "x", .type = "int"};
  EXPECT_EQ(setSetting(options, store_, terminal_), ExitStatus::usage);
  EXPECT_EQ(err(), "tarnelctl: 'x' is no integer of 64 bits\n");
}

TEST_F(CommandTest, ConsentIsOffUntilTurnedOn) {
  EXPECT_EQ(showConsent(path("config"), false, terminal_), ExitStatus::ok);
  EXPECT_EQ(out(), "Submission of diagnostics is off.\n");
  EXPECT_EQ(storeConsent(path("config"), path("state"), true, store_, terminal_), ExitStatus::ok);
  clear();
  EXPECT_EQ(showConsent(path("config"), true, terminal_), ExitStatus::ok);
  EXPECT_EQ(out(), "{\"diagnostics\":true}\n");
  EXPECT_EQ(storeConsent(path("config"), path("state"), false, store_, terminal_), ExitStatus::ok);
  clear();
  EXPECT_EQ(showConsent(path("config"), false, terminal_), ExitStatus::ok);
  EXPECT_EQ(out(), "Submission of diagnostics is off.\n");
}

TEST_F(CommandTest, AChangeOfConsentForgetsTheIdentifierOfBefore) {
  for (const bool allowed : {false, true}) {
    store_.setObject("com.orvane.tarnel", "dnu:respect", "agreed");
    store_.setObject("com.orvane.tarnel", "dnu:withheld", "withheld");
    EXPECT_EQ(storeConsent(path("config"), path("state"), allowed, store_, terminal_), ExitStatus::ok);
    EXPECT_EQ(store_.objectForKey("com.orvane.tarnel", "dnu:respect").has_value(), allowed);
    EXPECT_EQ(store_.objectForKey("com.orvane.tarnel", "dnu:withheld").has_value(), !allowed);
  }
}

TEST_F(CommandTest, AnIdentifierThatCannotBeForgottenIsReported) {
  store_.setObject("com.orvane.tarnel", "dnu:respect", "agreed");
  fs::remove(path("state/settings/com.orvane.tarnel.lock"));
  fs::create_directory(path("state/settings/com.orvane.tarnel.lock"));
  EXPECT_EQ(storeConsent(path("config"), path("state"), false, store_, terminal_), ExitStatus::failed);
  EXPECT_NE(err().find("tarnelctl: the identifier of before could not be forgotten: " +
                       path("state/settings/com.orvane.tarnel.lock")),
            std::string::npos)
      << err();
  EXPECT_NE(err().find("; mend that and run this command again\n"), std::string::npos) << err();
  clear();
  EXPECT_EQ(showConsent(path("config"), false, terminal_), ExitStatus::ok);
  EXPECT_EQ(out(), "Submission of diagnostics is off.\n");
}

TEST_F(CommandTest, ConsentBeforeTheFirstStartMakesNoSettings) {
  for (const bool allowed : {false, true}) {
    EXPECT_EQ(storeConsent(path("config"), path("state"), allowed, store_, terminal_), ExitStatus::ok);
  }
  EXPECT_TRUE(fs::is_empty(path("state")));
}

TEST_F(CommandTest, AFailedChangeNamesTheRemedy) {
  EXPECT_EQ(storeConsent(path("none"), path("state"), true, store_, terminal_), ExitStatus::failed);
  EXPECT_NE(err().find("; install the daemon, or name its directory in CONFIGURATION_DIRECTORY\n"),
            std::string::npos)
      << err();
}

// A new key's bundle is of the client library's version, not of a storebag's.
TEST_F(CommandTest, ABundleHasTheVersionOfTheClientLibrary) {
  ASSERT_EQ(makeStorebagKey({.output = path("keys"), .bits = 2048}, terminal_), ExitStatus::ok) << err();
  std::string version;
  std::ifstream(path("keys/bundle/version")) >> version;
  EXPECT_EQ(version, "8.0");
}

TEST_F(CommandTest, RootActsAsTheOwnerAndComesBack) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root";
  ASSERT_EQ(::chmod(home_.c_str(), 0755), 0);
  ASSERT_EQ(::chown(path("state").c_str(), 65534, 65534), 0);
  {
    const ActingAsOwner owner(path("state"));
    EXPECT_EQ(::geteuid(), 65534U);
    EXPECT_EQ(::getegid(), 65534U);
    // What the owner may not do, this may not do on their behalf.
    write("config/settings/x", "forged");
    EXPECT_FALSE(fs::exists(path("config/settings/x")));
  }
  EXPECT_EQ(::geteuid(), 0U);
  EXPECT_EQ(::getegid(), 0U);
  const ActingAsOwner nobody(path("missing"));
  EXPECT_EQ(::geteuid(), 0U);
}

TEST_F(CommandTest, StorebagsAreMadeSignedVerifiedAndShown) {
  ASSERT_EQ(makeStorebagKey({.output = path("keys"), .bits = 2048}, terminal_), ExitStatus::ok) << err();
  struct stat info {};
  ASSERT_EQ(stat(path("keys/storebag-key.pem").c_str(), &info), 0);
  EXPECT_EQ(info.st_mode & 0777U, 0600U);
  EXPECT_EQ(makeStorebagKey({.output = path("keys"), .bits = 2048}, terminal_), ExitStatus::failed);

  ASSERT_EQ(newStorebag({.output = path("bag.json"), .version = "7"}, terminal_), ExitStatus::ok) << err();
  EXPECT_EQ(newStorebag({.output = path("bag.json")}, terminal_), ExitStatus::failed);
  for (const bool binary : {false, true}) {
    const StorebagOptions sign{.input = path("bag.json"),
                               .output = path("bag.signed"),
                               .key = path("keys/storebag-key.pem"),
                               .binary = binary,
                               .force = true};
    clear();
    ASSERT_EQ(signStorebag(sign, terminal_), ExitStatus::ok) << err();
    EXPECT_TRUE(err().starts_with("warning: {{LAB_URL}}: only tarnel-lab puts an address there")) << err();
    clear();
    const StorebagOptions verify{.input = path("bag.signed"), .key = path("keys/bundle")};
    EXPECT_EQ(verifyStorebag(verify, terminal_), ExitStatus::ok) << err();
    EXPECT_EQ(out(), "signature holds, version 7\n");
    clear();
    EXPECT_EQ(showStorebag(verify, terminal_), ExitStatus::ok);
    EXPECT_EQ(err(), "signature holds\n");
    EXPECT_NE(out().find("\"version\": \"7\""), std::string::npos) << out();
  }
}

TEST_F(CommandTest, ThePlaceholderForAPortIsNamedBeforeTheDocumentFailsAtIt) {
  std::ofstream(path("bag.json")) << "{\"port\": {{LAB_DATAGRAM_PORT}}}";
  EXPECT_EQ(signStorebag({.input = path("bag.json"), .key = path("none")}, terminal_), ExitStatus::failed);
  EXPECT_TRUE(err().starts_with(
      "warning: {{LAB_DATAGRAM_PORT}}: only tarnel-lab puts a port there, as it serves a plain document: "
      "write the port of your server\ntarnelctl: " +
      path("bag.json") + ": "))
      << err();
}

TEST_F(CommandTest, AForeignKeyDoesNotVerify) {
  ASSERT_EQ(makeStorebagKey({.output = path("a"), .bits = 2048}, terminal_), ExitStatus::ok);
  ASSERT_EQ(makeStorebagKey({.output = path("b"), .bits = 2048}, terminal_), ExitStatus::ok);
  ASSERT_EQ(newStorebag({.output = path("bag.json"), .postURL = "https://reports.example"}, terminal_),
            ExitStatus::ok);
  clear();
  ASSERT_EQ(signStorebag({.input = path("bag.json"), .output = path("s"), .key = path("a/storebag-key.pem")},
                         terminal_),
            ExitStatus::ok)
      << err();
  EXPECT_EQ(err().find("warning"), std::string::npos) << err();
  clear();
  EXPECT_EQ(verifyStorebag({.input = path("s"), .key = path("b/bundle/publicKey.der")}, terminal_),
            ExitStatus::failed);
  EXPECT_NE(err().find("signature: "), std::string::npos) << err();
}

TEST_F(CommandTest, ADocumentWithErrorsIsNotSignedUnlessForced) {
  ASSERT_EQ(makeStorebagKey({.output = path("a"), .bits = 2048}, terminal_), ExitStatus::ok);
  write("bag.json", R"({"seed":{}})");
  StorebagOptions options{.input = path("bag.json"), .output = path("s"), .key = path("a/storebag-key.pem")};
  clear();
  EXPECT_EQ(signStorebag(options, terminal_), ExitStatus::failed);
  EXPECT_NE(err().find("error:   version: "), std::string::npos) << err();
  options.force = true;
  EXPECT_EQ(signStorebag(options, terminal_), ExitStatus::ok);
}

TEST_F(CommandTest, LogShowsTheNewestFile) {
  EXPECT_EQ(showMessageLog({.directory = path("none")}, terminal_), ExitStatus::failed);
  EXPECT_EQ(err(), "tarnelctl: no message log in " + path("none") + ": nothing was sent in the last day\n");
  fs::create_directories(path("log"));
  write("log/tarneld_1_messageLog.diag", "(old) 1\n");
  fs::last_write_time(path("log/tarneld_1_messageLog.diag"),
                      fs::file_time_type::clock::now() - std::chrono::hours(1));
  write("log/tarneld_1_2_messageLog.diag", "four parts\n");
  write("log/tarneld_2_messageLog.diag", "(new) 1\n(new) 2\n(new) 3\n");
  EXPECT_EQ(showMessageLog({.directory = path("log"), .lines = 2}, terminal_), ExitStatus::ok);
  EXPECT_EQ(out(), "(new) 2\n(new) 3\n");
  clear();
  EXPECT_EQ(showMessageLog({.directory = path("log"), .path = true}, terminal_), ExitStatus::ok);
  EXPECT_EQ(out(), path("log/tarneld_2_messageLog.diag") + "\n");
}

TEST(LastLinesTest, CutsAtLineBeginnings) {
  EXPECT_EQ(lastLines("a\nb\nc\n", 0), "a\nb\nc\n");
  EXPECT_EQ(lastLines("a\nb\nc\n", 1), "c\n");
  EXPECT_EQ(lastLines("a\nb\nc", 2), "b\nc");
  EXPECT_EQ(lastLines("a\n", 5), "a\n");
  EXPECT_EQ(lastLines("", 1), "");
}

}  // namespace
}  // namespace tarnel::ctl
