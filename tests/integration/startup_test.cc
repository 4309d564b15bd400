#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <filesystem>
#include <future>

#include "testing/lab_process.h"
#include "testing/private_instance.h"
#include "testing/programs.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// How the daemon starts, what it may still do then, and how it ends.

namespace tarnel::test {
namespace {

namespace fs = std::filesystem;

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::Not;

constexpr char kProfile[] = "config/sandbox.d/com.orvane.tarneld.profile";

class StartupTest : public ::testing::Test {
 protected:
  void SetUp() override {
    lab.reset();
    lab.connect(instance);
    instance.setConsent(true);
    const Dictionary entry = clientEntry(lab.eventsURL(), lab.realtimeURL());
    lab.serve("brevan", storebag("1", {{"httppost", profile({entry})}}));
  }

  // Expects that the daemon refuses to start for a reason, with nothing opened.
  void expectRefusal(const std::string& reason) {
    const auto end = instance.launch().waitForEnd();
    ASSERT_TRUE(end);
    EXPECT_EQ(end->status, 255);
    EXPECT_THAT(instance.log(), HasSubstr("<3>tarneld["));
    EXPECT_THAT(instance.log(), HasSubstr("main: sandbox_init() fails: "));
    EXPECT_THAT(instance.log(), HasSubstr(reason));
    EXPECT_THAT(instance.log(), Not(HasSubstr("Listener resumes")));
    EXPECT_FALSE(fs::exists(instance.socketPath()));
  }
  void expectService() {
    TestSession session(instance, {});
    EXPECT_THAT(session.backends(), ElementsAre("httppost"));
    EXPECT_TRUE(session.send(1, 2).ok());
  }

  LabProcess& lab = LabProcess::shared();
  PrivateInstance instance;
};

TEST_F(StartupTest, WithoutItsProfileItDoesNotStart) {
  instance.folder().remove(kProfile);
  expectRefusal(instance.folder().path(kProfile));
}

TEST_F(StartupTest, WithADamagedProfileItDoesNotStart) {
  instance.folder().write(kProfile, "[files]\nread = [\"/usr\"]\nwrite_everything = [\"/\"]\n");
  expectRefusal(instance.folder().path(kProfile) + ":3");
}

TEST_F(StartupTest, WithAProfileThatOthersMayWriteItDoesNotStart) {
  instance.folder().write(kProfile, instance.folder().read(kProfile), 0666);
  expectRefusal("chmod go-w ");
}

TEST_F(StartupTest, WithAProfileThatConfinesNothingItDoesNotStart) {
  instance.folder().write(kProfile,
                          "[files]\nread_write = [\"/\"]\n[network]\nfamilies = [\"unix\", \"inet\"]\n");
  expectRefusal(":2: \"/\" opens the whole file system; correct the profile");
}

TEST_F(StartupTest, ItIsReadyWhenItsSocketTakesClients) {
  ASSERT_TRUE(instance.start());
  instance.waitForLog("<6>tarneld[");
  instance.waitForLog("main: Listener resumes with sandbox, start loop.");
  expectService();
  EXPECT_EQ(fs::status(instance.socketPath()).permissions(), fs::perms(0666));
  instance.stop();
  EXPECT_FALSE(fs::exists(instance.socketPath())) << "an orderly end leaves no socket behind";
}

TEST_F(StartupTest, ASecondDaemonLeavesTheFirstAlone) {
  ASSERT_TRUE(instance.start());
  ProcessOptions second;
  second.program = kTarneld;
  second.environment = instance.environment();
  second.account = unprivilegedAccount();
  const auto finished = runProcess(second);
  EXPECT_EQ(finished.end.status, 1);
  EXPECT_THAT(finished.errors, HasSubstr("another daemon is listening at " + instance.socketPath()));
  expectService();
}

TEST_F(StartupTest, ItTakesOverTheSocketThatTheServiceManagerPasses) {
  const std::string path = instance.folder().path("passed");
  const UniqueFd listening(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  ASSERT_EQ(::bind(listening.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  ASSERT_EQ(::listen(listening.get(), 16), 0);
  // A client that comes before the daemon is served by it.
  auto options = optionsFor(instance);
  options.socketPath = path;
  client::Session early(options);
  ASSERT_TRUE(early.setSessionInfo(sessionInfo({}), userInfo("Meetwell", "video-call")));
  std::promise<client::Reply> answered;
  ASSERT_TRUE(early.startConfig([&answered](const client::Reply& reply) { answered.set_value(reply); }));
  instance.launch({listening.get()});
  ASSERT_TRUE(instance.waitUntilReady()) << instance.log();
  auto answer = answered.get_future();
  ASSERT_EQ(answer.wait_until(Deadline().end()), std::future_status::ready);
  EXPECT_THAT(answer.get().names.value_or(std::vector<std::string>()), ElementsAre("httppost"));
  EXPECT_FALSE(fs::exists(instance.socketPath())) << "it makes none of its own";
  instance.stop();
  EXPECT_TRUE(fs::exists(path)) << "and leaves the one it was given";
}

TEST_F(StartupTest, AConfinedDaemonCannotWriteWhereItsProfileDoesNotAllow) {
  // Where everybody may write, if it were not for the sandbox.
  const TestFolder outside;
  ::chmod(outside.path().c_str(), 0777);
  const std::string logs = "logs/var/mobile/Library/Logs/Faultkeep";
  instance.folder().makeDirectory(logs);
  fs::create_directory_symlink(outside.path(), instance.folder().path(logs + "/Retired"));
  ASSERT_TRUE(instance.start());
  expectService();
  lab.waitForEvents(2);
  EXPECT_TRUE(fs::is_empty(outside.path())) << "nothing gets there";
  instance.waitForLog("writeToLogFile: Failed to create new tarneld log file ");
  instance.expectAlive();
}

TEST_F(StartupTest, MessagesThatWereAcceptedArePostedBeforeAnOrderlyEnd) {
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {.batch = true});
  for (uint16_t type = 11; type < 31; ++type) ASSERT_TRUE(session.send(4, type).ok());
  EXPECT_TRUE(lab.events().empty());
  instance.stop();
  EXPECT_EQ(lab.waitForEvents(22).size(), 22U);
}

TEST_F(StartupTest, AClientIsToldThatTheDaemonEndedAndMayComeBack) {
  ASSERT_TRUE(instance.start());
  std::promise<void> interrupted;
  auto options = optionsFor(instance);
  options.onInterruption = [&interrupted](const client::Disconnection&) { interrupted.set_value(); };
  TestSession session(std::move(options), {});
  EXPECT_THAT(session.backends(), ElementsAre("httppost"));
  instance.stop();
  ASSERT_EQ(interrupted.get_future().wait_until(Deadline().end()), std::future_status::ready);
  ASSERT_TRUE(instance.start());
  ASSERT_TRUE(session.session.reconnect());
  ASSERT_TRUE(session.session.setSessionInfo(sessionInfo({}), userInfo("Meetwell", "video-call")));
  EXPECT_THAT(*session.session.startConfigAndWait(kDeadline).names, ElementsAre("httppost"));
}

TEST_F(StartupTest, AnIdleDaemonEndsWhenItIsToldTo) {
  instance.setConfiguration("[locale]\ncountry = \"DE\"\n[limits]\nidle_exit_seconds = 1\n");
  ASSERT_TRUE(instance.start());
  expectService();
  const auto end = instance.daemon().waitForEnd();
  ASSERT_TRUE(end);
  EXPECT_EQ(end->status, 0);
}

TEST_F(StartupTest, ArgumentsAreRefusedWithAHint) {
  ProcessOptions options;
  options.program = kTarneld;
  options.arguments = {"--verbose"};
  const auto finished = runProcess(options);
  EXPECT_EQ(finished.end.status, 2);
  EXPECT_THAT(finished.errors, HasSubstr("unexpected argument '--verbose'"));
}

}  // namespace
}  // namespace tarnel::test
