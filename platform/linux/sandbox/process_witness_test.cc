#include "platform/linux/sandbox/process_witness.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "ipc/server/peer_process.h"
#include "platform/linux/sandbox/linux_sandbox.h"
#include "testing/linux_test_support.h"

namespace tarnel {
namespace {

std::string self() {
  return std::filesystem::read_symlink("/proc/self/exe").string();
}

TEST(ProcessWitness, SaysWhatAProcessRuns) {
  auto witness = ProcessWitness::start();
  ASSERT_TRUE(witness);
  EXPECT_EQ((*witness)->executable(::getpid()), self());
  EXPECT_FALSE((*witness)->executable(0));
  EXPECT_FALSE((*witness)->executable(-1));
  EXPECT_EQ((*witness)->executable(::getpid()), self());
}

TEST(ProcessWitness, SeesForAConfinedProcessWhatThatCannotSeeItself) {
  const TemporaryFolder folder;
  folder.write("sandbox.d/test.profile", "[files]\nread = [\"/proc\", \"/usr\", \"/lib\"]\n");
  const pid_t outside = ::getpid();
  const std::string said = runInChild([&folder, outside] {
    auto witness = ProcessWitness::start();
    if (!witness) return witness.error().description();
    LinuxSandbox sandbox(folder.path(), {});
    if (auto failure = sandbox.enter("test")) return *failure;
    return executableOfProcess(outside).value_or("unseen") + " " +
           (*witness)->executable(outside).value_or("unseen");
  });
  EXPECT_EQ(said, "unseen " + self());
}

}  // namespace
}  // namespace tarnel
