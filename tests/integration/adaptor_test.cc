#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/bundles/trusted_folder_test_support.h"
#include "testing/lab_process.h"
#include "testing/private_instance.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// The sample adaptor in the confined daemon.

namespace tarnel::test {
namespace {

namespace fs = std::filesystem;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::StartsWith;

constexpr char kBundle[] =
    "System/Library/PrivateFrameworks/PlexorServices.framework/Frameworks/QMXPerformance.framework";

class AdaptorTest : public ::testing::Test {
 protected:
  void SetUp() override {
    lab.reset();
    lab.connect(instance);
    instance.setConsent(true);
    const Dictionary https = profile({clientEntry(lab.eventsURL(), lab.realtimeURL())});
    lab.serve("calvisto", storebag("1", {{"httppost", https}, {"dravik", Dictionary()}}));
    lab.serve("brevan", storebag("1", {{"httppost", https}}));
    root.makeDirectory(kBundle);
    root.copy(SAMPLE_ADAPTOR, std::string(kBundle) + "/QMXPerformance.so");
    instance.setConfiguration("[locale]\ncountry = \"DE\"\n[bundles]\nroot = \"" + root.path() + "\"\n");
    instance.addVariable("SAMPLE_ADAPTOR_FILE=" + written);
  }
  std::vector<std::string> lines() const {
    std::ifstream stream(written);
    std::vector<std::string> all;
    for (std::string line; std::getline(stream, line);) all.push_back(line);
    return all;
  }
  std::vector<std::string> waitForLines(size_t count) const {
    const Deadline deadline;
    while (lines().size() < count && !deadline.passed()) std::this_thread::yield();
    return lines();
  }
  // Each instance of the sample adaptor holds the file open until it is destroyed.
  size_t instances() const {
    size_t count = 0;
    for (const auto& entry :
         fs::directory_iterator("/proc/" + std::to_string(instance.daemon().pid()) + "/fd")) {
      std::error_code gone;
      if (fs::read_symlink(entry, gone) == written) ++count;
    }
    return count;
  }
  bool waitForInstances(size_t count) const {
    const Deadline deadline;
    while (instances() != count && !deadline.passed()) std::this_thread::yield();
    return instances() == count;
  }

  LabProcess& lab = LabProcess::shared();
  PrivateInstance instance;
  const TrustedFolder root{TrustedFolder::For::everybody};
  const std::string written = instance.folder().path("logs/written");
};

TEST_F(AdaptorTest, AnInstanceLivesAsLongAsItsSessionAndGetsItsMessages) {
  ASSERT_TRUE(instance.start());
  client::Dictionary payload;
  payload.set("codec", "opus").set("loss", 0.5);
  {
    TestSession session(instance, {.clientType = 7});
    EXPECT_THAT(session.backends(), Contains("dravik"));
    EXPECT_EQ(instances(), 1U);
    EXPECT_TRUE(session.send(3, 4, payload.view()).ok());
    TestSession second(instance, {.clientType = 7});
    EXPECT_EQ(instances(), 2U);
    EXPECT_TRUE(second.send(65535, 65535).ok());
    EXPECT_TRUE(session.session.finishAndWait(kDeadline).ok());
  }
  EXPECT_TRUE(waitForInstances(0));
  std::vector<std::string> first;
  for (const std::string& line : lines()) {
    if (line.starts_with("1 ")) first.push_back(line);
  }
  EXPECT_THAT(first, ElementsAre(StartsWith("1 0/0 Locale=\"DE\""), "1 3/4 codec=\"opus\" loss=0.5",
                                 "1 0/2 no payload", "1 0/1 StorebagVersion=\"1\""));
  EXPECT_THAT(lines(), Contains("2 65535/65535 no payload"));
  // A message without a session has an instance of its own.
  client::Session single(optionsFor(instance));
  EXPECT_EQ(
      single.sendSingleMessageAndWait(sessionInfo({.clientType = 7}), {}, 5, 6, payload, kDeadline).text,
      "finished");
  EXPECT_EQ(lines().back(), "3 5/6 codec=\"opus\" loss=0.5");
  EXPECT_EQ(instances(), 0U);
  instance.expectAlive();
}

// It blocks in its create until somebody reads what it writes.
TEST_F(AdaptorTest, AnAdaptorThatTakesLongDelaysItsOwnClientAlone) {
  ASSERT_TRUE(instance.start());
  ASSERT_EQ(::mkfifo(written.c_str(), 0600), 0);
  ASSERT_EQ(::chmod(written.c_str(), 0666), 0);
  client::Session stuck(optionsFor(instance));
  ASSERT_TRUE(stuck.setSessionInfo(sessionInfo({.clientType = 7}), {}));
  std::atomic<bool> hasStarted{false};
  ASSERT_TRUE(stuck.startConfig([&hasStarted](const client::Reply&) { hasStarted = true; }));
  instance.waitForLog("DravikBackend(initWithName): Loading Dravik adaptor class for client type 7");
  {
    TestSession other(instance, {.clientType = 8});
    for (uint16_t type = 1; type <= 20; ++type) EXPECT_TRUE(other.send(9, type).ok());
    EXPECT_TRUE(other.session.finishAndWait(kDeadline).ok());
  }
  EXPECT_FALSE(hasStarted);
  const UniqueFd reader(::open(written.c_str(), O_RDONLY | O_CLOEXEC));
  EXPECT_TRUE(stuck.drain(kDeadline));
  EXPECT_TRUE(hasStarted);
}

TEST_F(AdaptorTest, ABundleThatOthersCouldHavePutThereIsRefusedWithTheRemedy) {
  const std::string folder = root.path("System/Library");
  ASSERT_EQ(::chmod(folder.c_str(), 0777), 0);
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {.clientType = 7});
  instance.waitForLog("its directory " + folder +
                      " can be written by its group or by others; change that with: chmod go-w " + folder);
  EXPECT_TRUE(session.send(3, 4).ok());
  instance.waitForLog(
      "DravikBackend(sendMessage): Dravik adaptor (null) does not respond to forwarding selector "
      "sendMessageWithMethod:respCode:dict:");
  EXPECT_FALSE(fs::exists(written));
}

}  // namespace
}  // namespace tarnel::test
