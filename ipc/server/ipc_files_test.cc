#include "ipc/server/ipc_files_test_fixture.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <array>
#include <filesystem>
#include <fstream>
#include <functional>
#include <latch>
#include <thread>
#include <tuple>
#include <vector>

// Files that clients hand over with their calls.

namespace tarnel {
namespace {

using ::testing::ElementsAre;

TEST_F(IpcFilesTest, AFileIsReadThroughWhatTheClientOpened) {
  const auto path = write("a b.log", "contents");
  onFile([](ClientFile& file) {
    EXPECT_TRUE(file.isRegular());
    EXPECT_EQ(file.size(), 8U);
    EXPECT_EQ(*file.contents(), "contents");
    EXPECT_EQ(*file.contents(), "contents");
  });
  BusClient client(service.path());
  const auto file = open(path);
  lseek(file.get(), 5, SEEK_SET);  // where the client stands in it is its own business
  EXPECT_EQ(upload(client, "file:///a%20b.log", file), true);
  EXPECT_THAT(service.session()->calls(), ElementsAre("uploadFile file:///a%20b.log"));
  EXPECT_TRUE(deletions(client).empty());
}

TEST_F(IpcFilesTest, NoDescriptorOutlivesItsCall) {
  onFile([](ClientFile&) {});
  BusClient client(service.path());
  EXPECT_NE(client.call("StartConfig", ""), nullptr);
  const auto file = open(write("x", "x"));
  const size_t before = openDescriptors();
  for (int i = 0; i < 100; ++i) EXPECT_EQ(upload(client, "/x", file), true);
  EXPECT_NE(client.call("StartConfig", ""), nullptr);
  EXPECT_EQ(openDescriptors(), before);
}

TEST_F(IpcFilesTest, TheClientIsAskedToDeleteBeforeItIsAnswered) {
  onFile([](ClientFile& file) { file.requestDeletion(); });
  BusClient client(service.path());
  EXPECT_EQ(upload(client, "file:///x", open(write("x", "x"))), true);
  EXPECT_THAT(deletions(client), ElementsAre("file:///x"));
  EXPECT_FALSE(service.logged("is kept"));
}

TEST_F(IpcFilesTest, WhatChangedMeanwhileIsKept) {
  const auto path = write("x", "before");
  onFile([&path](ClientFile& file) {
    std::ofstream(path, std::ios::app) << " and after";
    EXPECT_EQ(*file.contents(), "before");  // what it was when the client handed it over
    file.requestDeletion();
  });
  BusClient client(service.path());
  EXPECT_EQ(upload(client, "/x", open(path)), true);
  EXPECT_TRUE(deletions(client).empty());
  EXPECT_TRUE(service.log().contains(
      LogLevel::warning, "ClientFiles: /x was uploaded and is kept: it changed while it was uploaded"));
}

// Size and time of the last change each tell, down to the nanosecond.
TEST_F(IpcFilesTest, EverySignOfAChangeKeepsTheFile) {
  const auto path = write("x", "before");
  const timespec before{1000, 500};
  std::function<void()> change;
  onFile([&change](ClientFile& file) {
    change();
    file.requestDeletion();
  });
  const auto setTime = [&path](timespec time) {
    const std::array<timespec, 2> times{timespec{0, UTIME_OMIT}, time};
    EXPECT_EQ(utimensat(AT_FDCWD, path.c_str(), times.data(), 0), 0);
  };
  BusClient client(service.path());
  for (const auto& [size, time, isKept] : std::vector<std::tuple<off_t, timespec, bool>>{
           {6, {1000, 500}, false}, {6, {1001, 500}, true}, {6, {1000, 501}, true}, {5, {1000, 500}, true}}) {
    EXPECT_EQ(truncate(path.c_str(), 6), 0);
    setTime(before);
    change = [&path, &setTime, size = size, time = time] {
      EXPECT_EQ(truncate(path.c_str(), size), 0);
      setTime(time);
    };
    EXPECT_EQ(upload(client, "/x", open(path)), true);
    EXPECT_EQ(deletions(client).empty(), isKept) << size << ' ' << time.tv_sec << ' ' << time.tv_nsec;
  }
}

// The client would not find the file at its path, and leave what it finds alone.
TEST_F(IpcFilesTest, WhatLostANameMeanwhileIsKeptAndTold) {
  const auto path = write("x", "uploaded");
  const auto next = write("next", "not uploaded");
  onFile([&path, &next](ClientFile& file) {
    EXPECT_EQ(*file.contents(), "uploaded");
    std::filesystem::rename(next, path);
    file.requestDeletion();
  });
  BusClient client(service.path());
  EXPECT_EQ(upload(client, "/x", open(path)), true);
  EXPECT_TRUE(deletions(client).empty());
  EXPECT_TRUE(service.log().contains(LogLevel::warning,
                                     "ClientFiles: /x was uploaded and is kept: a name of it was deleted, or "
                                     "given to another file"));
}

TEST_F(IpcFilesTest, MoreNamesAndOtherNamesAreNoChange) {
  const auto path = write("x", "x");
  const auto moved = service.folder().path() + "/moved";
  onFile([&path, &moved](ClientFile& file) {
    std::filesystem::rename(path, moved);
    std::filesystem::create_hard_link(moved, moved + ".2");
    file.requestDeletion();
  });
  BusClient client(service.path());
  EXPECT_EQ(upload(client, "/x", open(path)), true);
  EXPECT_THAT(deletions(client), ElementsAre("/x"));
  EXPECT_FALSE(service.logged("is kept"));
}

// A program that the process starts inherits nothing of it.
TEST_F(IpcFilesTest, NoDescriptorOfAFileIsInheritable) {
  const auto path = write("x", "x");
  onFile([&path](ClientFile&) {
    size_t count = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
      std::error_code gone;
      if (std::filesystem::read_symlink(entry, gone) != path) continue;
      ++count;
      EXPECT_EQ(fcntl(std::stoi(entry.path().filename()), F_GETFD) & FD_CLOEXEC, FD_CLOEXEC);
    }
    EXPECT_GE(count, 2U) << "the client's and the daemon's";
  });
  BusClient client(service.path());
  EXPECT_EQ(upload(client, "/x", open(path)), true);
}

TEST_F(IpcFilesTest, WhatShrinksIsReadAsFarAsItGoes) {
  const auto path = write("x", "long before");
  onFile([&path](ClientFile& file) {
    EXPECT_EQ(truncate(path.c_str(), 4), 0);
    EXPECT_EQ(file.size(), 11U);
    EXPECT_EQ(*file.contents(), "long");
  });
  BusClient client(service.path());
  EXPECT_EQ(upload(client, "/x", open(path)), true);
}

TEST_F(IpcFilesTest, WhatIsNoRegularFileIsNeverRead) {
  onFile([](ClientFile& file) {
    EXPECT_FALSE(file.isRegular());
    EXPECT_FALSE(file.contents());
  });
  const auto fifo = service.folder().path() + "/fifo";
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  std::array<int, 2> pair{};
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair.data()), 0);
  const UniqueFd one(pair[0]);
  const UniqueFd other(pair[1]);
  BusClient client(service.path());
  EXPECT_EQ(upload(client, "/fifo", open(fifo, O_RDWR)), true);  // blocks whoever reads it
  EXPECT_EQ(upload(client, "/folder", open(service.folder().path())), true);
  EXPECT_EQ(upload(client, "/device", open("/dev/zero")), true);
  EXPECT_EQ(upload(client, "/socket", one), true);
}

TEST_F(IpcFilesTest, WhatCannotBeReadSaysWhy) {
  const auto path = write("x", "x");
  onFile([](ClientFile& file) {
    EXPECT_TRUE(file.isRegular());
    const auto contents = file.contents();
    ASSERT_FALSE(contents);
    EXPECT_EQ(contents.error().localizedDescription(), "Bad file descriptor");
  });
  BusClient client(service.path());
  EXPECT_EQ(upload(client, "/x", open(path, O_WRONLY)), true);
  EXPECT_EQ(upload(client, "/x", open(path, O_PATH)), true);
}

TEST_F(IpcFilesTest, ATokenIsGoodOnceAndUntilItsCallEnds) {
  std::string kept;
  service.prepare = [this, &kept](RecordingSession& session) {
    session.uploadFile = [this, &kept](const std::string& token) {
      EXPECT_EQ(token.size(), 32U);
      EXPECT_NE(token, kept);
      kept = token;
      const auto file = service.clientFiles().consume(token);
      EXPECT_NE(file, nullptr);
      EXPECT_EQ(refusal(token), "ClientFiles: An extension token is refused: it was used before");
      return true;
    };
  };
  service.start();
  BusClient client(service.path());
  EXPECT_EQ(upload(client, "/x", open(write("x", "x"))), true);
  const std::string first = kept;
  // The answer may be here before its call has ended; the next call only begins after that.
  EXPECT_EQ(upload(client, "/x", open(write("x", "x"))), true);
  const char* const ended =
      "ClientFiles: An extension token is refused: no file was handed over with it, or its call has ended";
  EXPECT_EQ(refusal(first), ended);
  EXPECT_EQ(refusal(""), ended);
}

TEST_F(IpcFilesTest, ATokenOfAnotherConnectionIsRefused) {
  std::latch isOffered(1);
  std::latch isTried(1);
  std::string stolen;
  service.prepare = [&](RecordingSession& session) {
    session.uploadFile = [&](const std::string& token) {
      if (stolen.empty()) {
        stolen = token;
        isOffered.count_down();
        isTried.wait();
        return service.clientFiles().consume(token) != nullptr;  // it is still the owner's
      }
      const auto file = service.clientFiles().consume(stolen);
      isTried.count_down();
      return file != nullptr;
    };
  };
  service.start();
  const auto file = open(write("x", "x"));
  std::thread owner([&] {
    BusClient client(service.path());
    EXPECT_EQ(upload(client, "/x", file), true);
  });
  isOffered.wait();
  BusClient thief(service.path());
  EXPECT_EQ(upload(thief, "/x", file), false);
  owner.join();
  EXPECT_TRUE(service.log().contains(
      LogLevel::error, "ClientFiles: An extension token is refused: it belongs to another connection"));
}

TEST_F(IpcFilesTest, AClientThatDiesMeanwhileKeepsItsFile) {
  std::latch isUnderWay(1);
  std::latch isDead(1);
  onFile([&](ClientFile& file) {
    isUnderWay.count_down();
    isDead.wait();
    EXPECT_EQ(*file.contents(), "x");
    file.requestDeletion();
  });
  {
    const RawClient client(service.path());
    client.authenticateForDescriptors();
    EXPECT_TRUE(client.writeWith(rawUpload("/x"), open(write("x", "x")).get()));
    isUnderWay.wait();
  }
  isDead.count_down();
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 1; }));
  EXPECT_TRUE(service.logged("ClientFiles: /x was uploaded and is kept: cannot call the client: "));
}

}  // namespace
}  // namespace tarnel
