#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <memory>
#include <string>

#include "ipc/server/ipc_test_support.h"
#include "tarnel/tarnel.h"

// The library against the daemon's own IPC service.

namespace tarnel {
namespace {

using namespace std::chrono_literals;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

constexpr auto kLong = 30s;

client::Options optionsFor(const Service& service) {
  client::Options options;
  options.socketPath = service.path();
  options.linger = kLong;
  return options;
}

TEST(ClientAndService, EveryCallOfTheInterfaceIsUnderstoodAndAnswered) {
  Service service;
  service.start();
  client::Session session(optionsFor(service));
  const auto info = client::Dictionary().set("sessionID", 7);
  ASSERT_TRUE(
      session.setSessionInfo(info, client::Dictionary().set("clientName", "c"), client::Array().append("f")));
  EXPECT_THAT(*session.startConfigAndWait(kLong).names, ElementsAre("httppost", "dashboard"));
  EXPECT_EQ(session.fetchStatesAndWait({}, kLong).names, std::nullopt);
  EXPECT_EQ(session.fetchDisplayURLAndWait(kLong).text, "URL not available");
  EXPECT_TRUE(session.sendMessageAndWait(1, 2, info, client::Flag::normal, kLong).text);
  EXPECT_TRUE(session.sendMessageAndWait(3, 4, info, client::Flag::important, kLong).text);
  EXPECT_TRUE(session.sendMessageDictionaryAndWait(client::Dictionary().set("category", 1), kLong).text);
  EXPECT_EQ(session.flushAndWait(kLong).error->description, "No backends available to send message");
  EXPECT_EQ(session.finishAndWait(kLong).error->code, 503);
  EXPECT_TRUE(session.uploadLogDataAndWait(client::Array().append("line"), kLong).success);
  EXPECT_FALSE(session.uploadFileAndWait("/etc/passwd", kLong).success);
  const auto single = session.sendSingleMessageAndWait(info, {}, 5, 6, {}, kLong);
  EXPECT_TRUE(single.ok()) << single.status.message;
  EXPECT_EQ(single.text, std::nullopt);
  EXPECT_EQ(service.session()->count(), 12U);
}

TEST(ClientAndService, AThousandMessagesArriveInOrderWithAndWithoutAnswers) {
  Service service;
  service.start();
  {
    client::Session session(optionsFor(service));
    std::atomic<int> answered{0};
    for (uint16_t i = 0; i < 1000; ++i) {
      client::Completion completion;
      if (i % 2 == 0)
        completion = [&answered](const client::Reply& reply) { answered += reply.ok() ? 1 : 0; };
      ASSERT_TRUE(session.sendMessage(1, i, {}, client::Flag::normal, completion));
    }
    ASSERT_TRUE(session.drain(kLong));
    EXPECT_EQ(answered, 500);
    const auto calls = service.session()->calls();
    ASSERT_EQ(calls.size(), 1000U);
    for (size_t i = 0; i < 1000; ++i) EXPECT_THAT(calls[i], HasSubstr("1 " + std::to_string(i) + " none"));
  }
}

TEST(ClientAndService, AReplyThatNeverComesIsTold) {
  Service service;
  service.prepare = [](RecordingSession& session) {
    session.answerSend = [](const SentReply&) {};  // lets go of it
  };
  service.start();
  client::Session session(optionsFor(service));
  const auto reply = session.sendMessageAndWait(1, 1, {}, client::Flag::normal, kLong);
  EXPECT_EQ(reply.status.code, TARNEL_ERROR_NO_REPLY) << reply.status.message;
}

TEST(ClientAndService, AClientWithoutTheEntitlementIsToldSo) {
  Service service;
  service.entitlements().grants = false;
  service.start();
  client::Session session(optionsFor(service));
  const auto configured = session.startConfigAndWait(kLong);
  EXPECT_EQ(configured.status.code, TARNEL_ERROR_REFUSED);
  EXPECT_THAT(configured.status.message, HasSubstr("lacks the entitlement com.orvane.private.tarneld"));
}

TEST(ClientAndService, AggregationReachesTheClient) {
  Service service;
  service.start();
  std::promise<std::pair<int64_t, std::string>> seen;
  std::promise<void> ended;
  auto options = optionsFor(service);
  options.onAggregatedMessage = [&seen](client::DictionaryView info, double, uint16_t, uint16_t,
                                        client::DictionaryView payload) {
    seen.set_value({info.find("sessionID").toInt64(), std::string(payload.find("k").toString())});
  };
  options.onAggregationEnd = [&ended] { ended.set_value(); };
  client::Session session(std::move(options));
  ASSERT_TRUE(session.startConfigAndWait(kLong).ok());
  const auto proxy = service.connection(0)->remoteObjectProxyWithErrorHandler([](const Error&) {});
  ASSERT_NE(proxy, nullptr);
  proxy->sendMessageToClient(Dictionary{{"sessionID", 4}}, 1.5, 2, 3, Dictionary{{"k", "v"}});
  proxy->sendMessageToClient(std::nullopt, 0.0, 0, 0, std::nullopt);
  EXPECT_EQ(seen.get_future().get(), std::make_pair(int64_t{4}, std::string("v")));
  ended.get_future().wait();
}

TEST(ClientAndService, TheLargestCallThatTheLibraryAcceptsIsAccepted) {
  Service service;
  service.start();
  client::Session session(optionsFor(service));
  size_t length = (1U << 20U) - 200;
  client::Reply reply;
  do {
    --length;
    reply = session.sendMessageAndWait(1, 1, client::Dictionary().set("s", std::string(length, 'x')),
                                       client::Flag::normal, kLong);
  } while (reply.status.code == TARNEL_ERROR_TOO_LARGE);
  EXPECT_TRUE(reply.ok()) << reply.status.message;
}

TEST(ClientAndService, TheServiceGoingAwayIsAnInterruption) {
  auto service = std::make_unique<Service>();
  service->start();
  std::promise<client::Disconnection> told;
  auto options = optionsFor(*service);
  options.onInterruption = [&told](const client::Disconnection& d) { told.set_value(d); };
  client::Session session(std::move(options));
  ASSERT_TRUE(session.startConfigAndWait(kLong).ok());
  service.reset();
  EXPECT_EQ(told.get_future().get().why.code, TARNEL_ERROR_INTERRUPTED);
}

// Files that the library hands over; what the daemon does with each is `use`.
class FilesAndService : public ::testing::Test {
 protected:
  void onFile(std::function<void(ClientFile&)> use) { service.startOnFiles(std::move(use)); }
  std::string write(const std::string& name, const std::string& text = "text") const {
    std::string path = service.folder().path() + '/' + name;
    std::ofstream(path) << text;
    return path;
  }
  static bool exists(const std::string& path) { return std::filesystem::exists(path); }

  Service service;
};

TEST_F(FilesAndService, AFileIsHandedOverAndDeletedBeforeTheCompletionRuns) {
  const auto path = write("a b\xFF.log", "contents");
  onFile([](ClientFile& file) {
    EXPECT_EQ(*file.contents(), "contents");
    file.requestDeletion();
  });
  client::Session session(optionsFor(service));
  std::promise<bool> isGone;
  ASSERT_TRUE(session.uploadFile(path, [&](const client::Reply& reply) {
    EXPECT_TRUE(reply.success);
    isGone.set_value(!exists(path));
  }));
  EXPECT_TRUE(isGone.get_future().get());
  EXPECT_THAT(service.session()->calls(),
              ElementsAre("uploadFile file://" + service.folder().path() + "/a%20b%FF.log"));
}

TEST_F(FilesAndService, AProgramThatIsStartedMeanwhileInheritsNoFile) {
  const auto path = write("x");
  onFile([&path](ClientFile&) {
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
      std::error_code gone;
      if (std::filesystem::read_symlink(entry, gone) != path) continue;
      EXPECT_EQ(fcntl(std::stoi(entry.path().filename()), F_GETFD) & FD_CLOEXEC, FD_CLOEXEC);
    }
  });
  client::Session session(optionsFor(service));
  EXPECT_TRUE(session.uploadFileAndWait(path, kLong).success);
}

TEST_F(FilesAndService, WithoutTheWishTheFileStays) {
  const auto path = write("x");
  onFile([](ClientFile&) {});
  client::Session session(optionsFor(service));
  EXPECT_TRUE(session.uploadFileAndWait(path, kLong).success);
  EXPECT_TRUE(exists(path));
}

TEST_F(FilesAndService, WithoutACompletionTheFileIsDeletedAsWell) {
  const auto path = write("x");
  onFile([](ClientFile& file) { file.requestDeletion(); });
  client::Session session(optionsFor(service));
  EXPECT_TRUE(session.uploadFile(path));
  EXPECT_TRUE(session.drain(kLong));
  EXPECT_FALSE(exists(path));
}

TEST_F(FilesAndService, AnotherFileOfTheSameNameIsKept) {
  const auto path = write("x");
  onFile([this, &path](ClientFile& file) {
    std::filesystem::rename(write("y", "another"), path);
    file.requestDeletion();
  });
  client::Session session(optionsFor(service));
  EXPECT_TRUE(session.uploadFileAndWait(path, kLong).success);
  std::string text;
  std::ifstream(path) >> text;
  EXPECT_EQ(text, "another");
}

TEST_F(FilesAndService, ALinkThatTakesItsPlaceIsKept) {
  const auto path = write("x");
  onFile([this, &path](ClientFile& file) {
    std::filesystem::rename(path, path + ".moved");
    std::filesystem::create_symlink(path + ".moved", path);
    file.requestDeletion();
  });
  client::Session session(optionsFor(service));
  EXPECT_TRUE(session.uploadFileAndWait(path, kLong).success);
  EXPECT_TRUE(std::filesystem::is_symlink(path));
  EXPECT_TRUE(exists(path + ".moved"));
}

TEST_F(FilesAndService, TheFolderOfTheCallCounts) {
  const auto path = write("x");
  onFile([](ClientFile& file) { file.requestDeletion(); });
  client::Session session(optionsFor(service));
  const auto before = std::filesystem::current_path();
  std::filesystem::current_path(service.folder().path());
  EXPECT_TRUE(session.uploadFile("x"));
  std::filesystem::current_path(before);
  EXPECT_TRUE(session.drain(kLong));
  EXPECT_FALSE(exists(path));
}

TEST_F(FilesAndService, WhatIsNoReadableRegularFileIsRefusedAtOnce) {
  onFile([](ClientFile&) { ADD_FAILURE(); });
  client::Session session(optionsFor(service));
  const auto folder = service.folder().path();
  const auto fifo = folder + "/fifo";
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  std::filesystem::create_symlink(write("x"), folder + "/link");
  const auto refusal = [&session](const std::string& path) {
    const auto status = session.uploadFile(path);
    EXPECT_EQ(status.code, TARNEL_ERROR_FILE) << path;
    return status.message;
  };
  EXPECT_EQ(refusal(folder), folder + " is no regular file: only those are uploaded");
  EXPECT_EQ(refusal(fifo), fifo + " is no regular file: only those are uploaded");
  EXPECT_EQ(refusal("/dev/null"), "/dev/null is no regular file: only those are uploaded");
  EXPECT_EQ(refusal(folder + "/link"), folder + "/link is a symbolic link: give the path of the file itself");
  EXPECT_EQ(refusal(folder + "/missing"), folder + "/missing cannot be opened: No such file or directory");
  EXPECT_EQ(session.uploadFile("").code, TARNEL_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(tarnel_session_upload_file(session.handle(), nullptr, nullptr, nullptr),
            TARNEL_ERROR_INVALID_ARGUMENT);
  EXPECT_STREQ(tarnel_last_error(), "the path is empty");
}

TEST_F(FilesAndService, SeveralUploadsAreToldApart) {
  const auto kept = write("1", "keep");
  const auto gone = write("2", "delete");
  onFile([](ClientFile& file) {
    if (*file.contents() == "delete") file.requestDeletion();
  });
  client::Session session(optionsFor(service));
  EXPECT_TRUE(session.uploadFile(kept));
  EXPECT_TRUE(session.uploadFile(gone));
  EXPECT_TRUE(session.uploadFile(kept));
  EXPECT_TRUE(session.drain(kLong));
  EXPECT_TRUE(exists(kept));
  EXPECT_FALSE(exists(gone));
}

TEST_F(FilesAndService, NoFileStaysOpenAndTheirNumberIsBounded) {
  const auto path = write("x");
  std::promise<void> goOn;
  auto mayGoOn = goOn.get_future().share();
  onFile([mayGoOn](ClientFile&) { mayGoOn.wait(); });
  client::Session session(optionsFor(service));
  ASSERT_TRUE(session.startConfigAndWait(kLong).ok());
  const size_t before = openDescriptors();
  for (int i = 0; i < 64; ++i) EXPECT_TRUE(session.uploadFile(path)) << i;
  const auto status = session.uploadFile(path);
  EXPECT_EQ(status.code, TARNEL_ERROR_QUEUE_FULL);
  EXPECT_EQ(status.message, "64 files of this process wait to be uploaded: wait for answers");
  goOn.set_value();
  EXPECT_TRUE(session.drain(kLong));
  ASSERT_TRUE(session.startConfigAndWait(kLong).ok());
  EXPECT_EQ(openDescriptors(), before);
  EXPECT_TRUE(session.uploadFileAndWait(path, kLong).success);
}

// A second session's call that is late says when the time for answers is over.
TEST_F(FilesAndService, NeitherUploadsNorCallsBehindThemAreEverLate) {
  std::promise<void> goOn;
  std::promise<void> end;
  auto mayGoOn = goOn.get_future().share();
  auto mayEnd = end.get_future().share();
  service.prepare = [mayGoOn, mayEnd](RecordingSession& session) {
    session.onCall = [mayGoOn, mayEnd](const std::string& call) {
      if (call.starts_with("upload")) mayGoOn.wait();
      if (call.starts_with("flush")) mayEnd.wait();
    };
  };
  service.start();
  auto options = optionsFor(service);
  options.replyTimeout = 100ms;
  client::Session ofFile(options);
  EXPECT_TRUE(ofFile.uploadFile(write("x")));
  client::Session ofLogData(options);
  EXPECT_TRUE(ofLogData.uploadLogData(client::Array().append("line"), {}));
  std::promise<tarnel_status> behindFile;
  std::promise<tarnel_status> behindLogData;
  const auto tell = [](std::promise<tarnel_status>& to) {
    return [&to](const client::Reply& reply) { to.set_value(reply.status.code); };
  };
  EXPECT_TRUE(ofFile.startConfig(tell(behindFile)));
  EXPECT_TRUE(ofLogData.startConfig(tell(behindLogData)));
  client::Session other(options);
  EXPECT_EQ(other.flushAndWait(kLong).status.code, TARNEL_ERROR_TIMED_OUT);
  goOn.set_value();
  EXPECT_EQ(behindFile.get_future().get(), TARNEL_OK);
  EXPECT_EQ(behindLogData.get_future().get(), TARNEL_OK);
  // Afterwards the time counts again.
  for (client::Session* session : {&ofFile, &ofLogData}) {
    const auto flushed = std::make_shared<std::promise<tarnel_status>>();
    EXPECT_TRUE(
        session->flush([flushed](const client::Reply& reply) { flushed->set_value(reply.status.code); }));
    auto late = flushed->get_future();
    if (late.wait_for(kLong) == std::future_status::ready) {
      EXPECT_EQ(late.get(), TARNEL_ERROR_TIMED_OUT);
    } else {
      ADD_FAILURE() << "the time does not count";
    }
  }
  end.set_value();
}

TEST_F(FilesAndService, AnUploadThatIsCutOffTellsSoAndKeepsTheFile) {
  const auto path = write("x");
  std::promise<void> isUnderWay;
  std::promise<void> goOn;
  onFile([&](ClientFile& file) {
    isUnderWay.set_value();
    goOn.get_future().wait();
    file.requestDeletion();
  });
  auto options = optionsFor(service);
  options.linger = 0ms;
  std::promise<tarnel_status> told;
  {
    client::Session session(options);
    ASSERT_TRUE(
        session.uploadFile(path, [&told](const client::Reply& reply) { told.set_value(reply.status.code); }));
    isUnderWay.get_future().wait();
  }
  EXPECT_EQ(told.get_future().get(), TARNEL_ERROR_CLOSED);
  goOn.set_value();
  EXPECT_TRUE(eventually([this] { return service.invalidations() == 1; }));
  EXPECT_TRUE(exists(path));
  EXPECT_TRUE(service.logged("was uploaded and is kept: "));
}

}  // namespace
}  // namespace tarnel
