#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include "testing/private_instance.h"

// Who is let in: the program that is set-group-id to the entitled group, and nobody who pretends to be it.

namespace tarnel::test {
namespace {

using ::testing::HasSubstr;
using ::testing::Not;

// Nobody else's: numbers without names.
constexpr Account kUser{61001, 61001};
constexpr gid_t kTrustedGroup = 61002;

class IdentityTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "only root can make a program set-group-id and act as other users";
    struct statvfs files {};
    ASSERT_EQ(::statvfs(folder.path().c_str(), &files), 0);
    if ((files.f_flag & (ST_NOSUID | ST_NOEXEC)) != 0) {
      GTEST_SKIP() << folder.path() << " lies on a file system without set-group-id programs; set TMPDIR";
    }
    install("plain", 0755);
    install("trusted", 02755);
    folder.copyFrom(TARNEL_IDENTITY_PRELOAD, "preload.so", 0755);
    instance.setEntitlements("[[grant]]\nentitlement = \"com.orvane.private.tarneld\"\ngroup = " +
                             std::to_string(kTrustedGroup) + "\n");
    // Everybody may knock.
    ::chmod(instance.folder().path("run").c_str(), 0755);
    ASSERT_TRUE(instance.start());
  }

  // A copy of the probe; set-group-id to the trusted group when the mode says so.
  void install(const char* name, mode_t mode) {
    folder.copyFrom(TARNEL_IDENTITY_PROBE, name, 0755);
    ASSERT_EQ(::chown(folder.path(name).c_str(), 0, (mode & 02000) != 0 ? kTrustedGroup : 0), 0);
    ASSERT_EQ(::chmod(folder.path(name).c_str(), mode), 0);
  }
  ProcessOptions probe(const char* name, std::vector<std::string> arguments) const {
    ProcessOptions options;
    options.program = folder.path(name);
    options.arguments = std::move(arguments);
    options.account = kUser;
    return options;
  }
  std::string call(const char* name) const {
    return runProcess(probe(name, {"call", instance.socketPath()})).output;
  }

  TestFolder folder;
  PrivateInstance instance;
};

TEST_F(IdentityTest, TheSetGroupIdProgramIsLetInAndAnotherIsNot) {
  EXPECT_EQ(call("trusted"), "accepted\n");
  EXPECT_EQ(call("plain"), "refused\n");
  instance.waitForLog("does not have required tarnel entitlement. Closing connection...");
}

TEST_F(IdentityTest, ASupplementaryGroupDoesNotCount) {
  auto options = probe("plain", {"call", instance.socketPath()});
  options.supplementaryGroups = {kTrustedGroup};
  EXPECT_EQ(runProcess(options).output, "refused\n");
  // As the effective one it would.
  options.account = Account{kUser.uid, kTrustedGroup};
  EXPECT_EQ(runProcess(options).output, "accepted\n");
}

TEST_F(IdentityTest, ConnectingBeforeBecomingTheTrustedProgramDoesNotHelp) {
  instance.daemon().signal(SIGSTOP);
  ChildProcess attacker(probe("plain", {"exec", instance.socketPath(), folder.path("trusted")}));
  const bool becameTrusted = attacker.waitForOutput("running\n");
  instance.daemon().signal(SIGCONT);
  ASSERT_TRUE(becameTrusted) << attacker.output() << attacker.errors();
  attacker.closeInput();
  EXPECT_TRUE(attacker.waitForOutput("refused\n")) << attacker.output();
  EXPECT_THAT(attacker.output(), Not(HasSubstr("accepted")));
}

TEST_F(IdentityTest, PreloadingIntoTheTrustedProgramDoesNotWork) {
  const auto output = [this](const char* name) {
    auto options = probe(name, {"call", instance.socketPath()});
    options.environment = {"LD_PRELOAD=" + folder.path("preload.so"),
                           "ASAN_OPTIONS=verify_asan_link_order=0"};
    return runProcess(options).output;
  };
  EXPECT_EQ(output("trusted"), "accepted\n") << "the loader ignores it there";
  EXPECT_EQ(output("plain"), "preloaded\nrefused\n") << "where it works, nothing is gained";
}

TEST_F(IdentityTest, TheTrustedProgramsConnectionCannotBeStolen) {
  const auto stolen = runProcess(probe("plain", {"steal", instance.socketPath(), folder.path("trusted")}));
  EXPECT_EQ(stolen.output, "the victim was accepted\nnothing was stolen\n") << stolen.errors;
  // From a program without the mark it can, by its parent: what is stolen there is worth nothing.
  const auto worthless = runProcess(probe("plain", {"steal", instance.socketPath(), folder.path("plain")}));
  EXPECT_EQ(worthless.output, "the victim was refused\na socket was stolen\n") << worthless.errors;
}

TEST_F(IdentityTest, AnExecutableAloneEntitlesNobody) {
  instance.stop();
  instance.setEntitlements("[[grant]]\nentitlement = \"com.orvane.private.tarneld\"\nexecutable = \"" +
                           folder.path("plain") + "\"\n");
  ASSERT_TRUE(instance.start());
  instance.waitForLog(
      "executable alone proves nothing, because a user can make another program look like it; add group, "
      "user or "
      "unit; this grant is not used");
  EXPECT_EQ(call("plain"), "refused\n");
  EXPECT_EQ(call("trusted"), "refused\n");
}

TEST_F(IdentityTest, AnExecutableNarrowsWhatAUserMay) {
  instance.stop();
  const auto grant = [this](const std::string& program) {
    instance.setEntitlements(
        "[[grant]]\nentitlement = \"com.orvane.private.tarneld\"\nuser = 65534\nexecutable = \"" + program +
        "\"\n");
    ASSERT_TRUE(instance.start());
  };
  const auto callAsTheDaemonsUser = [this] {
    auto options = probe("plain", {"call", instance.socketPath()});
    options.account = unprivilegedAccount();
    return runProcess(options).output;
  };
  grant(folder.path("plain"));
  EXPECT_EQ(callAsTheDaemonsUser(), "accepted\n");
  instance.stop();
  grant(folder.path("another"));
  EXPECT_EQ(callAsTheDaemonsUser(), "refused\n");
}

}  // namespace
}  // namespace tarnel::test
