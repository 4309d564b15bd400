#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <zlib.h>

#include <algorithm>
#include <atomic>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <future>
#include <memory>
#include <mutex>
#include <random>
#include <thread>

#include "testing/lab_process.h"
#include "testing/private_instance.h"
#include "testing/programs.h"
#include "testing/raw_http_server.h"
#include "testing/storebags.h"
#include "testing/test_session.h"

// Files of clients, from the client library through the confined daemon to a server.

namespace tarnel::test {
namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;

std::string gunzipped(std::string input) {
  z_stream stream{};
  inflateInit2(&stream, 31);
  std::string out(1U << 20U, '\0');
  stream.next_in = reinterpret_cast<Bytef*>(input.data());
  stream.avail_in = static_cast<uInt>(input.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  const int result = inflate(&stream, Z_FINISH);
  out.resize(stream.total_out);
  inflateEnd(&stream);
  return result == Z_STREAM_END ? out : "not gzip";
}

// A server for files that answers what the test says, and one that never answers.
class UploadTest : public ::testing::Test {
 protected:
  void SetUp() override {
    lab.reset();
    lab.connect(instance);
    instance.setConsent(true);
  }
  // The storebag of client type 8: files go to the address, messages to the lab.
  void serve(const std::string& postURL) const {
    lab.serve("brevan",
              storebag("1", {{"httppost", profile({clientEntry(lab.eventsURL(), lab.realtimeURL())})},
                             {"uploadserver", Dictionary{{"post_url", postURL}}}}));
  }
  RawHttpServer::Handler replying(std::string reply) {
    return RawHttpServer::answering([this, reply = std::move(reply)](const std::string& request) {
      const std::lock_guard lock(mutex_);
      requests_.push_back(request);
      return httpAnswer("200 OK", reply);
    });
  }
  std::vector<std::string> requests() const {
    const std::lock_guard lock(mutex_);
    return requests_;
  }
  std::string write(const std::string& name, const std::string& text) const {
    std::string path = instance.folder().path(name);
    std::ofstream(path) << text;
    return path;
  }
  // The most memory that the daemon ever held.
  size_t peakBytes() const {
    std::ifstream status("/proc/" + std::to_string(instance.daemon().pid()) + "/status");
    for (std::string word; status >> word;) {
      size_t kilobytes = 0;
      if (word == "VmHWM:" && status >> kilobytes) return kilobytes * 1024;
    }
    ADD_FAILURE() << "the process does not tell its memory";
    return 0;
  }
  static bool exists(const std::string& path) { return std::filesystem::exists(path); }
  FinishedProcess run(std::vector<std::string> arguments) const {
    ProcessOptions options;
    options.program = kTarnelctl;
    options.arguments = std::move(arguments);
    options.environment = instance.environment();
    return runProcess(options);
  }

  LabProcess& lab = LabProcess::shared();
  PrivateInstance instance;

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> requests_;
};

TEST_F(UploadTest, AFileArrivesAndIsDeletedWhenTheServerSaysSuccess) {
  const RawHttpServer server(replying("{\"result\": \"success\"}"));
  serve(server.url("/up"));
  ASSERT_TRUE(instance.start());
  const auto path = write("a b&c.log", "what went wrong");
  TestSession session(instance, {.sessionID = 77});
  EXPECT_THAT(session.backends(), ::testing::Contains("uploadserver"));
  const auto reply = session.session.uploadFileAndWait(path, kDeadline);
  ASSERT_TRUE(reply.ok()) << reply.status.message;
  EXPECT_TRUE(reply.success);
  EXPECT_FALSE(exists(path));
  ASSERT_EQ(requests().size(), 1U);
  const std::string request = requests()[0];
  EXPECT_THAT(request, StartsWith("POST /up?uuid="));
  EXPECT_THAT(request, HasSubstr("&sequence=77&description=Lumora%20AFRC%20log%20(Uploaded%20by%20QMX)"
                                 "&filename=a%20b&c.log.gz&raw=true HTTP/1.1\r\n"));
  EXPECT_THAT(request, HasSubstr("\r\nContent-Type: application/octet-stream\r\n"));
  EXPECT_THAT(request, HasSubstr("\r\nContent-Encoding: gzip\r\n"));
  EXPECT_EQ(gunzipped(request.substr(request.find("\r\n\r\n") + 4)), "what went wrong");
  EXPECT_THAT(instance.messageLog(), HasSubstr("[uploadFileWithURL] Upload succeeded for file file:///"));
  instance.expectAlive();
}

TEST_F(UploadTest, AFileThatTheServerDoesNotTakeStays) {
  const RawHttpServer server(replying("SUCCESS"));
  serve(server.url("/up"));
  ASSERT_TRUE(instance.start());
  const auto path = write("x.log", "text");
  TestSession session(instance, {});
  EXPECT_TRUE(session.session.uploadFileAndWait(path, kDeadline).success);
  EXPECT_TRUE(exists(path));
}

TEST_F(UploadTest, EmptyAndOversizedFilesAreRefused) {
  const RawHttpServer server(replying("success"));
  serve(server.url("/up"));
  instance.setConfiguration("[limits]\nmax_upload_bytes = 2000\n");
  ASSERT_TRUE(instance.start());
  TestSession session(instance, {});
  const auto empty = write("empty", "");
  EXPECT_FALSE(session.session.uploadFileAndWait(empty, kDeadline).success);
  instance.waitForLog("UploadBackend(uploadFileAtPath): Input file is empty");
  const auto large = write("large", std::string(2001, 'x'));
  EXPECT_FALSE(session.session.uploadFileAndWait(large, kDeadline).success);
  instance.waitForLog(large + " has 2001 bytes; at most 2000 are uploaded (limits.max_upload_bytes)");
  const auto fits = write("fits", std::string(2000, 'x'));
  EXPECT_TRUE(session.session.uploadFileAndWait(fits, kDeadline).success);
  EXPECT_TRUE(exists(empty));
  EXPECT_TRUE(exists(large));
  EXPECT_FALSE(exists(fits));
  EXPECT_EQ(requests().size(), 1U);
}

// An upload holds its own client; everybody else's messages go on, and so does the end of the daemon.
TEST_F(UploadTest, AnUploadThatHangsDelaysNobodyElse) {
  std::promise<void> hangs;
  const RawHttpServer server(RawHttpServer::hangingAfterRequest(hangs));
  serve(server.url("/up"));
  ASSERT_TRUE(instance.start());
  const auto path = write("x.log", "text");
  auto options = optionsFor(instance);
  options.linger = std::chrono::milliseconds(0);
  TestSession stuck(options, {.sessionID = 1});
  std::atomic<bool> isAnswered{false};
  ASSERT_TRUE(stuck.session.uploadFile(path, [&isAnswered](const client::Reply&) { isAnswered = true; }));
  hangs.get_future().wait();
  {
    TestSession other(instance, {.sessionID = 2});
    for (uint16_t type = 1; type <= 50; ++type)
      EXPECT_TRUE(other.send(9, static_cast<uint16_t>(type + 10)).ok());
    EXPECT_TRUE(other.session.finishAndWait(kDeadline).ok());
  }
  EXPECT_TRUE(lab.waitUntil([](const std::vector<Dictionary>& events) {
    return std::count_if(events.begin(), events.end(),
                         [](const Dictionary& event) { return kindOf(event).starts_with("9/"); }) == 50;
  }));
  EXPECT_FALSE(isAnswered);
  instance.expectAlive();
  instance.stop();
  EXPECT_TRUE(exists(path));
}

// What is under way at the same time is bounded; the others take turns, and none is lost. Each file is a
// block that the C library gives back when it is freed: without that, every thread would keep two of them.
TEST_F(UploadTest, ManyLargeUploadsTakeTurnsInBoundedMemory) {
  constexpr size_t kMiB = size_t{1} << 20U;
  constexpr size_t kUploads = 8;
  std::promise<void> allHaveCome;
  auto mayAnswer = allHaveCome.get_future().share();
  std::atomic<size_t> posts{0};
  const RawHttpServer server(RawHttpServer::answering([&posts, mayAnswer](const std::string&) {
    ++posts;
    mayAnswer.wait();
    return httpAnswer("200 OK", "success");
  }));
  serve(server.url("/up"));
  instance.setConfiguration("[limits]\nmax_upload_bytes = 6291456\n[http]\nmax_queued_bytes = 12582912\n");
  ASSERT_TRUE(instance.start());
  std::mt19937 random(1);
  std::string contents(5 * kMiB, '\0');
  std::generate(contents.begin(), contents.end(), [&random] { return static_cast<char>(random()); });
  std::vector<std::unique_ptr<TestSession>> sessions;
  std::vector<std::future<bool>> answers;
  for (uint32_t i = 0; i < kUploads; ++i) {
    sessions.push_back(std::make_unique<TestSession>(instance, SessionSetup{.sessionID = i}));
  }
  const size_t before = peakBytes();
  for (auto& session : sessions) {
    const auto told = std::make_shared<std::promise<bool>>();
    answers.push_back(told->get_future());
    const auto path = write("large" + std::to_string(answers.size()), contents);
    EXPECT_TRUE(session->session.uploadFile(
        path, [told](const client::Reply& reply) { told->set_value(reply.success); }));
  }
  const Deadline deadline;
  const char* const begun = "UploadBackend(uploadFileAtPath): Uploading file";
  while (instance.countInLog(begun) < kUploads && !deadline.passed()) std::this_thread::yield();
  EXPECT_LE(posts, 1U);
  allHaveCome.set_value();
  for (auto& answer : answers) EXPECT_TRUE(answer.get());
  EXPECT_EQ(posts, kUploads);
  if (kMemoryIsMeasurable) {
    // One file and its compressed copy, and as much again for everything else.
    EXPECT_LT(peakBytes() - before, 4 * contents.size());
  }
}

TEST_F(UploadTest, AClientThatDiesMeanwhileIsSurvivedAndKeepsItsFile) {
  std::promise<void> hasCome;
  std::promise<void> mayAnswer;
  const RawHttpServer server([&](RawConnection& connection) {
    connection.readRequest();
    hasCome.set_value();
    mayAnswer.get_future().wait();
    connection.write(httpAnswer("200 OK", "success"));
  });
  serve(server.url("/up"));
  ASSERT_TRUE(instance.start());
  const auto path = write("x.log", "text");
  ProcessOptions options;
  options.program = kTarnelctl;
  options.arguments = {"upload", "--client-type", "8", path};
  options.environment = instance.environment();
  {
    ChildProcess client(options);
    hasCome.get_future().wait();
    client.signal(SIGKILL);
    EXPECT_TRUE(client.waitForEnd());
  }
  mayAnswer.set_value();
  instance.waitForLog("was uploaded and is kept: ");
  EXPECT_TRUE(exists(path));
  TestSession other(instance, {});
  EXPECT_TRUE(other.send(1, 1).ok());
  instance.expectAlive();
}

TEST_F(UploadTest, TheToolUploadsAndSaysWhatBecameOfIt) {
  const RawHttpServer server(replying("success"));
  serve(server.url("/up"));
  instance.setConfiguration("[limits]\nmax_upload_bytes = 2000\n");
  ASSERT_TRUE(instance.start());
  const auto path = write("x.log", "text");
  const std::vector<std::string> arguments{"upload", "--client-type", "8", path};
  auto done = run(arguments);
  EXPECT_EQ(done.end.status, 0) << done.errors;
  EXPECT_THAT(done.output, HasSubstr("upload: the server took the file; it is deleted\n"));
  EXPECT_FALSE(exists(path));
  done = run(arguments);
  EXPECT_EQ(done.end.status, 1);
  EXPECT_EQ(done.errors, "tarnelctl: " + path + " cannot be read: No such file or directory\n");
  write("x.log", "");
  done = run(arguments);
  EXPECT_EQ(done.end.status, 1);
  EXPECT_EQ(done.errors, "tarnelctl: " + path + " is empty: only files that hold something are uploaded\n");
  write("x.log", std::string(2001, 'x'));
  done = run({"upload", "--json", "--client-type", "8", path});
  EXPECT_EQ(done.end.status, 1);
  EXPECT_THAT(done.output, HasSubstr("\"success\": false"));
  EXPECT_THAT(done.errors, HasSubstr("the file was not uploaded"));
  // The server takes files, not log records.
  done = run({"upload-log", "--client-type", "8", write("log", "{\"a\": 1}\n")});
  EXPECT_EQ(done.end.status, 1);
  EXPECT_THAT(done.errors, HasSubstr("the records were not uploaded"));
}

TEST_F(UploadTest, TheToolSaysThatAFileWasNotTaken) {
  const RawHttpServer server(replying("later"));
  serve(server.url("/up"));
  ASSERT_TRUE(instance.start());
  const auto path = write("x.log", "text");
  const auto done = run({"upload", "--client-type", "8", path});
  EXPECT_EQ(done.end.status, 1);
  EXPECT_THAT(
      done.errors,
      HasSubstr("the file is still there: the server was not reached or did not say that it took it"));
  EXPECT_TRUE(exists(path));
}

}  // namespace
}  // namespace tarnel::test
