#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "testing/private_instance.h"
#include "testing/storebag_server.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// A daemon that starts on damaged, unreadable or foreign files names each with its line and the remedy, and
// goes on wherever that is safe.

namespace tarnel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

class FilesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    storebags.connect(instance);
    instance.setConsent(true);
    const Dictionary entry = clientEntry("http://127.0.0.1:1/", "http://127.0.0.1:1/");
    storebags.serve("brevan", storebag("1", {{"httppost", profile({entry})}}));
  }

  std::string path(const std::string& name) const { return instance.folder().path(name); }
  void expectLogged(const std::vector<std::string>& parts) {
    for (const std::string& part : parts) instance.waitForLog(part);
  }
  void expectService() {
    TestSession session(instance, {});
    EXPECT_THAT(session.backends(), ElementsAre("httppost"));
    EXPECT_TRUE(session.send(1, 2).ok());
  }
  void expectNobodyIsLetIn() {
    TestSession session(instance, {});
    EXPECT_EQ(session.started.status.code, TARNEL_ERROR_REFUSED) << session.started.status.message;
  }

  StorebagServer storebags;
  PrivateInstance instance;
};

TEST_F(FilesTest, ADamagedConfigurationLeavesTheDefaults) {
  // The country is not known then, which the entry admits.
  instance.setConfiguration("[limits]\nconnections = 10\nconnections_per_user = = 3\n");
  instance.folder().write("config/tarneld.d/20.toml", "[limits]\nconnections = \"many\"\nspeed = 3\n");
  ASSERT_TRUE(instance.start());
  expectLogged(
      {path("config/tarneld.toml") + ":3: ", "nothing of this file is used until that is mended",
       path("config/tarneld.d/20.toml") + ":2: limits.connections must be an integer from 1 to 1000000",
       path("config/tarneld.d/20.toml") + ":3: unknown key limits.speed; it is ignored"});
  expectService();
}

TEST_F(FilesTest, ADamagedGrantLetsNobodyIn) {
  const std::string file = path("config/entitlements.d/10.toml");
  const std::string entitlement = "entitlement = \"com.orvane.private.tarneld\"\n";
  const struct {
    std::string text;
    std::string complaint;
  } cases[] = {
      {"[[grant]\n" + entitlement, ":1: "},
      {"[[grant]]\n" + entitlement, ":1: the grant names nobody; add group, user or unit"},
      {"[[grant]]\n" + entitlement + "user = \"no-such-user\"\n", ":3: there is no user \"no-such-user\""},
      {"[[grant]]\n" + entitlement + "user = -1\n", ":3: user is no valid number"},
      {"[[grant]]\n" + entitlement + "user = " + std::to_string(::geteuid()) + "\nprogram = \"/bin/sh\"\n",
       ":4: unknown key program"},
      {"[[grant]]\n" + entitlement + "executable = \"/usr/bin/env\"\n",
       ":1: executable alone proves nothing"},
      {"[[grant]]\nuser = " + std::to_string(::geteuid()) + "\n", ":1: the grant has no entitlement"},
  };
  for (const auto& [text, complaint] : cases) {
    SCOPED_TRACE(text);
    instance.setEntitlements(text);
    ASSERT_TRUE(instance.start());
    expectLogged({file + complaint});
    expectNobodyIsLetIn();
    instance.stop();
  }
}

TEST_F(FilesTest, ADamagedGrantLeavesTheOthersInForce) {
  instance.folder().write("config/entitlements.d/05.toml", "not toml at all");
  instance.folder().write("config/entitlements.d/20.toml", "\xff\xfe");
  ASSERT_TRUE(instance.start());
  expectLogged(
      {path("config/entitlements.d/05.toml") + ":1: ", path("config/entitlements.d/20.toml") + ":1: "});
  expectService();
}

TEST_F(FilesTest, WhatOthersMayWriteIsNotUsed) {
  instance.folder().write("config/entitlements.d/10.toml",
                          instance.folder().read("config/entitlements.d/10.toml"), 0666);
  ASSERT_TRUE(instance.start());
  expectLogged({path("config/entitlements.d/10.toml") +
                ": is not used, because it can be written by its group or by others; change that with: chmod "
                "go-w " +
                path("config/entitlements.d/10.toml")});
  expectNobodyIsLetIn();
  instance.stop();

  instance.folder().write("config/entitlements.d/10.toml",
                          instance.folder().read("config/entitlements.d/10.toml"));
  ::chmod(path("config/entitlements.d").c_str(), 0777);
  ASSERT_TRUE(instance.start());
  expectLogged({"its directory can be written by its group or by others"});
  expectNobodyIsLetIn();
}

TEST_F(FilesTest, WhatBelongsToSomebodyElseIsNotUsed) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root can give files away";
  const std::string file = path("config/entitlements.d/10.toml");
  ASSERT_EQ(::chown(file.c_str(), 61001, 61001), 0);
  ASSERT_TRUE(instance.start());
  expectLogged(
      {file +
           ": is not used, because it belongs to user 61001, who is neither root nor the user this runs as",
       "change that with: chown root " + file});
  expectNobodyIsLetIn();
}

TEST_F(FilesTest, UnreadableFilesAreNamed) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs files that the daemon's user may not read";
  for (const char* name :
       {"config/tarneld.toml", "config/trust.d/x.pem", "config/settings/com.orvane.tarnel.toml"}) {
    instance.folder().write(name, instance.folder().read(name) + "\n", 0);
    ASSERT_EQ(::chown(path(name).c_str(), 0, 0), 0);
  }
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {});
  EXPECT_TRUE(session.started.ok());
  for (const char* name :
       {"config/tarneld.toml", "config/trust.d/x.pem", "config/settings/com.orvane.tarnel.toml"}) {
    expectLogged({path(name) + ": cannot be opened: Permission denied"});
  }
}

TEST_F(FilesTest, DamagedSettingsAreMovedAside) {
  const std::string own = "state/settings/com.orvane.tarnel.toml";
  instance.folder().makeDirectory("state/settings", 0700);
  instance.folder().write(own, "a = 1\nb = \n\"uuid:", 0600);
  ASSERT_TRUE(instance.start());
  expectService();
  // The identifiers were new, and storing them is what moves the file.
  expectLogged({path(own) + ":2: ", "it will be moved aside when the next value is stored",
                path(own) + " was damaged and is kept as " + path(own) + ".damaged-1"});
  EXPECT_EQ(instance.folder().read(own + ".damaged-1"), "a = 1\nb = \n\"uuid:");
  EXPECT_THAT(instance.folder().read(own), HasSubstr("dnu:respect"));
}

TEST_F(FilesTest, DamagedSettingsOfTheAdministratorCountAsNone) {
  instance.folder().write("config/settings/com.orvane.tarnel.toml", "tarnel_storebag_url = \"http\n");
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {});
  EXPECT_TRUE(session.started.ok());
  expectLogged(
      {path("config/settings/com.orvane.tarnel.toml") + ":1: ", "; it is ignored until it is mended"});
  instance.expectAlive();
}

TEST_F(FilesTest, CertificatesThatAreNoneAreNamed) {
  instance.folder().write("config/trust.d/a.pem", "hello");
  instance.folder().write("config/trust.d/b.pem",
                          "-----BEGIN CERTIFICATE-----\nAAAA\n-----END CERTIFICATE-----\n");
  instance.folder().makeDirectory("config/trust.d/c.pem");
  ASSERT_TRUE(instance.start());
  expectLogged({path("config/trust.d/a.pem") + ": holds no certificate in PEM form",
                path("config/trust.d/b.pem") + ": certificate 1 is no PEM certificate",
                path("config/trust.d/c.pem") + ": is not a regular file"});
  expectService();
}

TEST_F(FilesTest, DamagedConsentIsNoConsent) {
  for (const char* text :
       {"diagnostics = \"yes\"\n", "diagnostics = true true\n", "diagnostic = true\n", "\xff"}) {
    SCOPED_TRACE(text);
    instance.folder().write("config/consent.toml", text);
    ASSERT_TRUE(instance.start());
    EXPECT_THAT(TestSession(instance, {}).backends(), IsEmpty());
    expectLogged({path("config/consent.toml") + ":1: "});
    instance.stop();
  }
}

TEST_F(FilesTest, DamagedDeviceFactsCountAsUnknown) {
  instance.folder().write("config/device.toml",
                          "ProductType = 3\nDeviceName = \"Testbox\"\nColour = \"red\"\n");
  ASSERT_TRUE(instance.start());
  expectService();
  expectLogged({path("config/device.toml") + ":1: ", path("config/device.toml") + ":3: unknown key Colour"});
}

TEST_F(FilesTest, WithoutAUsableBundleNoStorebagVerifiesAndTheLogSaysWhy) {
  const auto expectNoStorebag = [this] {
    ASSERT_TRUE(instance.start());
    TestSession session(instance, {});
    EXPECT_TRUE(session.started.ok()) << session.started.status.message;
    EXPECT_FALSE(session.started.names);
    instance.stop();
  };
  instance.setBundle(path("nowhere"));
  expectNoStorebag();
  expectLogged({path("nowhere") + "/publicKey.der: cannot be opened", "TARNEL_BUNDLE"});
  instance.folder().write("bundle/publicKey.der", "this is no key");
  instance.setBundle(path("bundle"));
  expectNoStorebag();
  expectLogged({path("bundle") + "/publicKey.der: ", "TARNEL_BUNDLE"});
}

TEST_F(FilesTest, DirectoriesThatAreMissingAreMade) {
  for (const char* name : {"run", "state", "logs"}) instance.folder().remove(name);
  ASSERT_TRUE(instance.start());
  expectService();
  EXPECT_THAT(instance.folder().read("state/settings/com.orvane.tarnel.toml"), HasSubstr("dnu:respect"));
}

TEST_F(FilesTest, AStateDirectoryThatCannotBeWrittenIsNamedAndReportingGoesOn) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs a directory that the daemon's user may not write";
  ASSERT_EQ(::chown(path("state").c_str(), 0, 0), 0);
  ASSERT_TRUE(instance.start());
  expectService();
  expectLogged({path("state") + ": cannot be written by user ", "change that with: chown "});
  instance.expectAlive();
}

TEST_F(FilesTest, AStaleSocketIsReplacedAndAnythingElseIsLeftAlone) {
  instance.folder().write("run/com.orvane.tarneld", "somebody's file");
  const auto end = instance.launch().waitForEnd();
  ASSERT_TRUE(end);
  EXPECT_EQ(end->status, 1);
  expectLogged({"main: the service com.orvane.tarneld cannot be opened: ", "exists and is not a socket"});
  EXPECT_EQ(instance.folder().read("run/com.orvane.tarneld"), "somebody's file");
  instance.folder().remove("run/com.orvane.tarneld");
  ASSERT_TRUE(instance.start());
  instance.kill();
  EXPECT_TRUE(instance.folder().exists("run/com.orvane.tarneld"));
  ASSERT_TRUE(instance.start());
  expectService();
}

}  // namespace
}  // namespace tarnel::test
