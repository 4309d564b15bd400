#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <array>
#include <filesystem>
#include <fstream>
#include <functional>
#include <latch>
#include <tuple>
#include <vector>

#include "platform/linux/ipc/ipc_test_support.h"

// Files that clients hand over with their calls.

namespace tarnel {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

// The body of UploadFile: a text, and which of the descriptors.
std::string uploadBody(const std::string& fileURL, uint32_t index = 0) {
  const auto size = static_cast<uint32_t>(fileURL.size());
  std::string body(reinterpret_cast<const char*>(&size), 4);
  body += fileURL + '\0';
  while (body.size() % 4 != 0) body += '\0';
  return body.append(reinterpret_cast<const char*>(&index), 4);
}

std::string rawUpload(const std::string& fileURL, uint32_t announced = 1, uint32_t serial = 1) {
  return rawCall("UploadFile", uploadBody(fileURL), "sh", UINT32_MAX, serial, announced);
}

class IpcFilesTest : public ::testing::Test {
 protected:
  std::string write(const std::string& name, const std::string& text) const {
    std::string path = service.folder().path() + '/' + name;
    std::ofstream(path) << text;
    return path;
  }
  static UniqueFd open(const std::string& path, int flags = O_RDONLY) {
    UniqueFd file(::open(path.c_str(), flags | O_CLOEXEC));
    EXPECT_TRUE(file) << path;
    return file;
  }
  // What every upload does with its file.
  void onFile(std::function<void(ClientFile&)> use) {
    service.prepare = [this, use = std::move(use)](RecordingSession& session) {
      session.uploadFile = [this, use](const std::string& token) {
        const auto file = service.clientFiles().consume(token);
        if (file != nullptr) use(*file);
        return file != nullptr;
      };
    };
    service.start();
  }
  std::optional<bool> upload(BusClient& client, const std::string& path, const UniqueFd& file) {
    const auto reply = client.call("UploadFile", "sh", path.c_str(), file.get());
    int success = -1;
    if (reply == nullptr || sd_bus_message_read(reply.get(), "b", &success) <= 0) return std::nullopt;
    return success == 1;
  }
  // The texts of all calls of the client's object that have come.
  static std::vector<std::string> deletions(BusClient& client) {
    std::vector<std::string> texts;
    sd_bus_message* message = nullptr;
    while (sd_bus_process(client.bus(), &message) > 0) {
      const BusMessage held(message);
      const char* text = nullptr;
      if (message == nullptr ||
          sd_bus_message_is_method_call(message, wire::kReplyInterface, wire::kDeleteFile.name) <= 0) {
        continue;
      }
      EXPECT_STREQ(sd_bus_message_get_path(message), wire::kReplyPath);
      EXPECT_EQ(sd_bus_message_get_expect_reply(message), 0);
      EXPECT_GE(sd_bus_message_read(message, "s", &text), 0);
      texts.emplace_back(text);
    }
    return texts;
  }
  std::string refusal(const std::string& token) {
    EXPECT_EQ(service.clientFiles().consume(token), nullptr);
    return service.log().lines().back().text;
  }

  Service service;
};

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

TEST_F(IpcFilesTest, DescriptorsFindTheirMessagesHoweverTheBytesAreCut) {
  std::vector<std::string> contents;
  onFile([&contents](ClientFile& file) { contents.push_back(*file.contents()); });
  const auto one = open(write("1", "one"));
  const auto two = open(write("2", "two"));
  const RawClient client(service.path());
  client.authenticateForDescriptors();
  // Behind other messages, in one piece.
  EXPECT_TRUE(client.writeWith(rawCall("StartConfig") + rawUpload("/1") + rawCall("StartConfig"), one.get()));
  EXPECT_TRUE(eventually([&] { return service.session()->count() == 3; }));
  // Byte by byte.
  const auto call = rawUpload("/2");
  EXPECT_TRUE(client.writeWith(call.substr(0, 1), two.get()));
  for (const char byte : call.substr(1)) EXPECT_TRUE(client.write({&byte, 1}));
  EXPECT_TRUE(eventually([&] { return service.session()->count() == 4; }));
  // For two messages at once.
  EXPECT_TRUE(client.writeWith(rawUpload("/1") + rawUpload("/1", 1, 2), one.get(), 2));
  EXPECT_TRUE(eventually([&] { return service.session()->count() == 6; }));
  service.stop();
  EXPECT_THAT(contents, ElementsAre("one", "two", "one", "one"));
}

TEST_F(IpcFilesTest, ADescriptorThatIsAnnouncedAndMissingEndsTheConnection) {
  onFile([](ClientFile&) {});
  const RawClient client(service.path());
  client.authenticateForDescriptors();
  EXPECT_TRUE(client.write(rawUpload("/x")));
  EXPECT_TRUE(isClosedByPeer(client.fd()));
  const RawClient few(service.path());
  few.authenticateForDescriptors();
  EXPECT_TRUE(few.writeWith(rawUpload("/x", 5), 0, 5));
  EXPECT_TRUE(isClosedByPeer(few.fd()));
  EXPECT_TRUE(service.logged("a message announces 5 descriptors, and 4 came; at most 4 may"));
  EXPECT_EQ(service.session(0), nullptr);
}

TEST_F(IpcFilesTest, ACallWithoutItsDescriptorIsRefused) {
  onFile([](ClientFile&) {});
  BusClient client(service.path());
  auto call = client.newCall("UploadFile");
  EXPECT_GE(sd_bus_message_append(call.get(), "s", "/x"), 0);
  EXPECT_EQ(client.call(call), nullptr);
  EXPECT_EQ(client.errorText, "UploadFile takes the arguments \"sh\", not \"s\"");
  const RawClient raw(service.path());
  raw.authenticateForDescriptors();
  EXPECT_TRUE(raw.write(rawCall("UploadFile", uploadBody("/x"), "sh")));
  EXPECT_TRUE(raw.writeWith(rawUpload("/x", 2), 0, 2));
  EXPECT_TRUE(raw.write(rawCall("StartConfig")));
  EXPECT_TRUE(eventually([&] { return service.accepted() == 2 && service.session(1)->count() == 1; }));
  EXPECT_THAT(service.session(1)->calls(), ElementsAre("startConfig"));
}

TEST_F(IpcFilesTest, TheDescriptorIsNamedByTheOnlyIndexThereIs) {
  onFile([](ClientFile&) {});
  const auto file = open(write("x", "x"));
  const RawClient client(service.path());
  client.authenticateForDescriptors();
  const auto upload = [](uint32_t index) {
    return rawCall("UploadFile", uploadBody("/x", index), "sh", UINT32_MAX, 1, 1);
  };
  EXPECT_TRUE(client.writeWith(upload(1), file.get()));
  // Also when the index comes in pieces.
  const std::string call = upload(0x01000000);
  EXPECT_TRUE(client.writeWith(call.substr(0, call.size() - 2), file.get()));
  std::string answers;
  std::array<char, 4096> piece{};
  const auto readUntil = [&](const std::string& text) {
    while (answers.find(text) == std::string::npos) {
      const auto got = recv(client.fd().get(), piece.data(), piece.size(), 0);
      if (got <= 0) return false;
      answers.append(piece.data(), static_cast<size_t>(got));
    }
    return true;
  };
  EXPECT_TRUE(
      readUntil("UploadFile names the descriptor by the index 1; one came with the message, and its "
                "index is 0"))
      << answers;
  EXPECT_TRUE(client.write(call.substr(call.size() - 2, 1)));
  EXPECT_TRUE(client.write(call.substr(call.size() - 1)));
  EXPECT_TRUE(readUntil("by the index 16777216;")) << answers;
  EXPECT_EQ(service.session()->count(), 0U);
  EXPECT_TRUE(client.writeWith(upload(0), file.get()));
  EXPECT_TRUE(eventually([&] { return service.session()->count() == 1; }));
}

// The bus library would leave it open, with nobody to close it.
TEST_F(IpcFilesTest, TheDescriptorOfAMalformedMessageIsClosed) {
  onFile([](ClientFile&) {});
  const auto file = open(write("x", "x"));
  auto call = rawUpload("/x");
  const size_t path = call.find("/com/orvane");
  ASSERT_NE(path, std::string::npos);
  call[path] = '!';
  const size_t before = openDescriptors();
  for (int i = 0; i < 20; ++i) {
    const RawClient client(service.path());
    client.authenticateForDescriptors();
    EXPECT_TRUE(client.writeWith(call, file.get()));
    EXPECT_TRUE(isClosedByPeer(client.fd()));
  }
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 20; }));
  EXPECT_TRUE(eventually([before] { return openDescriptors() <= before; }));
}

TEST_F(IpcFilesTest, WithoutNegotiationNoDescriptorIsTaken) {
  onFile([](ClientFile&) {});
  const RawClient client(service.path());
  client.authenticate();
  EXPECT_TRUE(client.writeWith(rawUpload("/x"), 0));
  EXPECT_TRUE(isClosedByPeer(client.fd()));
}

// A call whose answer takes its time must not keep descriptors open meanwhile.
TEST_F(IpcFilesTest, NoOtherCallTakesDescriptors) {
  std::vector<SentReply> held;
  service.prepare = [&held](RecordingSession& session) {
    session.answerSend = [&held](SentReply reply) { held.push_back(std::move(reply)); };
  };
  service.start();
  const auto file = open(write("x", "x"));
  const RawClient client(service.path());
  client.authenticateForDescriptors();
  EXPECT_TRUE(client.write(rawCall("StartConfig")));
  EXPECT_TRUE(eventually([&] { return service.accepted() == 1 && service.session()->count() == 1; }));
  const size_t before = openDescriptors();
  const std::string body = std::string("\1\0\2\0\0\0\0\0", 8);
  for (uint32_t i = 0; i < 50; ++i) {
    EXPECT_TRUE(
        client.writeWith(rawCall("SendMessage", body, "qqaa{sv}", UINT32_MAX, i + 1, 4), file.get(), 4));
    EXPECT_TRUE(client.writeWith(rawCall("FinishSession", "", "", UINT32_MAX, i + 1, 1), file.get()));
  }
  EXPECT_TRUE(client.write(rawCall("StartConfig")));
  EXPECT_TRUE(eventually([&] { return service.session()->count() == 2; }));
  EXPECT_EQ(openDescriptors(), before);
  service.stop();
  EXPECT_THAT(held, ::testing::IsEmpty());
}

TEST_F(IpcFilesTest, DescriptorsThatNoMessageAnnouncesAreToldOnce) {
  service.start();
  const RawClient client(service.path());
  client.authenticateForDescriptors();
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(client.writeWith(rawCall("StartConfig"), 0, 3));
  EXPECT_TRUE(eventually([&] { return service.accepted() == 1 && service.session()->count() == 3; }));
  service.stop();
  size_t lines = 0;
  for (const auto& line : service.log().lines()) {
    if (line.text.find("that no message announces are closed") != std::string::npos) ++lines;
  }
  EXPECT_EQ(lines, 1U);
}

}  // namespace
}  // namespace tarnel
