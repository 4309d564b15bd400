// The running lab over real sockets and TLS on loopback.
#include "tools/lab/lab.h"

#include <arpa/inet.h>
#include <curl/curl.h>
#include <gmock/gmock.h>
#include <poll.h>
#include <sys/socket.h>

#include <filesystem>
#include <fstream>
#include <future>

#include "platform/document.h"
#include "platform/fake/fake_clock.h"
#include "tools/lab/certificate_authority.h"
#include "tools/lab/http_message.h"
#include "tools/lab/test_post.h"
#include "tools/storebag/file_io.h"
#include "tools/storebag/signed_storebag.h"
#include "tools/storebag/storebag_template.h"

namespace tarnel::lab {
namespace {

using ::testing::AnyOf;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::SizeIs;

size_t appendTo(char* bytes, size_t size, size_t count, void* target) {
  static_cast<std::string*>(target)->append(bytes, size * count);
  return size * count;
}

// One connection that is kept, as the daemon keeps it.
class Client {
 public:
  explicit Client(std::string caFile)
      : caFile_(std::move(caFile)), handle_(curl_easy_init(), curl_easy_cleanup) {}

  struct Reply {
    CURLcode code = CURLE_OK;
    std::string problem;
    long status = 0;
    std::string head;
    std::string body;
  };

  Reply get(const std::string& url, const std::vector<std::string>& headers = {}) {
    return perform(url, headers, nullptr);
  }
  Reply post(const std::string& url, const HttpRequest& request) {
    std::vector<std::string> headers;
    for (const auto& [name, value] : request.headers) headers.push_back(name + ": " + value);
    return perform(url, headers, &request.body);
  }
  void setMethod(const char* method) { method_ = method; }

 private:
  Reply perform(const std::string& url, const std::vector<std::string>& headers, const std::string* body) {
    Reply reply;
    char problem[CURL_ERROR_SIZE] = "";
    curl_slist* list = nullptr;
    for (const std::string& header : headers) list = curl_slist_append(list, header.c_str());
    CURL* handle = handle_.get();
    curl_easy_reset(handle);
    curl_easy_setopt(handle, CURLOPT_URL, url.c_str());
    curl_easy_setopt(handle, CURLOPT_CAINFO, caFile_.c_str());
    curl_easy_setopt(handle, CURLOPT_HTTPHEADER, list);
    curl_easy_setopt(handle, CURLOPT_TIMEOUT, 30L);
    curl_easy_setopt(handle, CURLOPT_NOPROXY, "*");
    curl_easy_setopt(handle, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(handle, CURLOPT_ERRORBUFFER, problem);
    curl_easy_setopt(handle, CURLOPT_WRITEFUNCTION, appendTo);
    curl_easy_setopt(handle, CURLOPT_WRITEDATA, &reply.body);
    curl_easy_setopt(handle, CURLOPT_HEADERFUNCTION, appendTo);
    curl_easy_setopt(handle, CURLOPT_HEADERDATA, &reply.head);
    if (body != nullptr) {
      curl_easy_setopt(handle, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(body->size()));
      curl_easy_setopt(handle, CURLOPT_POSTFIELDS, body->c_str());
    }
    if (method_ != nullptr) curl_easy_setopt(handle, CURLOPT_CUSTOMREQUEST, method_);
    reply.code = curl_easy_perform(handle);
    reply.problem = problem;
    curl_easy_getinfo(handle, CURLINFO_RESPONSE_CODE, &reply.status);
    curl_slist_free_all(list);
    return reply;
  }

  const std::string caFile_;
  const char* method_ = nullptr;
  std::unique_ptr<CURL, decltype(&curl_easy_cleanup)> handle_;
};

class LabTest : public ::testing::Test {
 protected:
  LabTest() {
    std::filesystem::remove_all(folder_);
    // The certificates must hold for the real time, too.
    clock_.set({.seconds = std::time(nullptr), .microseconds = 0});
    options_.directory = folder_ + "/lab";
    options_.port = 0;
    options_.controlPort = 0;
  }
  ~LabTest() override {
    lab_.reset();
    std::filesystem::remove_all(folder_);
  }

  void start() {
    // Making a large key takes long: each test process makes one.
    static const std::string kKeyText = [] {
      const std::string path = ::testing::TempDir() + "tarnel_lab_test_key.pem";
      EXPECT_FALSE(StorebagKey::generate(2048)->save(path));
      return *readFile(path, 10'000);
    }();
    ASSERT_FALSE(makeDirectory(options_.directory, 0755));
    const std::string keyFile = options_.directory + "/storebag-key.pem";
    if (!pathExists(keyFile)) {
      ASSERT_FALSE(writeFile(keyFile, kKeyText, 0600));
    }
    Result<std::unique_ptr<Lab>> lab = Lab::start(options_, console_, clock_);
    ASSERT_TRUE(lab) << lab.error().localizedDescription();
    lab_ = *std::move(lab);
    status_ = lab_->status();
  }
  std::string at(const char* key) const { return *findString(status_, key); }
  Client client() const { return Client(at("caFile")); }
  void putStorebag(const std::string& name, const std::string& version) const {
    StorebagTemplate from;
    from.version = version;
    ASSERT_FALSE(writeFile(at("storebagFolder") + "/" + name + ".json",
                           writeTextDocument(newStorebagTemplate(from)), 0644));
  }
  std::shared_ptr<const RsaPublicKey> publicKey() const {
    const std::string der = *readFile(at("bundle") + "/publicKey.der", 10'000);
    return RsaPublicKey::fromDer({reinterpret_cast<const uint8_t*>(der.data()), der.size()});
  }
  void misbehave(const std::string& query) const {
    EXPECT_EQ(client().get(at("controlURL") + "/misbehave?" + query).status, 200) << query;
  }
  static std::string field(const Client::Reply& reply, const std::string& name) {
    const size_t at = reply.head.find(name + ": ");
    if (at == std::string::npos) return "";
    const size_t begin = at + name.size() + 2;
    return reply.head.substr(begin, reply.head.find("\r\n", begin) - begin);
  }
  FileDescriptor connectTo(const std::string& url) const {
    const auto port = static_cast<uint16_t>(std::stoi(url.substr(url.rfind(':') + 1)));
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(port);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    FileDescriptor socket(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    EXPECT_EQ(::connect(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    return socket;
  }
  // All that comes until the end; a reset ends it, too.
  static std::string readAll(const FileDescriptor& socket) {
    std::string text;
    char buffer[4096];
    for (;;) {
      pollfd entry{.fd = socket.get(), .events = POLLIN, .revents = 0};
      if (::poll(&entry, 1, 60'000) <= 0) return text + "(nothing more came)";
      const ssize_t count = ::recv(socket.get(), buffer, sizeof buffer, 0);
      if (count <= 0) return text;
      text.append(buffer, static_cast<size_t>(count));
    }
  }

  const std::string folder_ =
      ::testing::TempDir() + "tarnel_lab_" + ::testing::UnitTest::GetInstance()->current_test_info()->name();
  fake::FakeClock clock_;
  std::unique_ptr<std::FILE, decltype(&std::fclose)> output_{std::tmpfile(), std::fclose};
  Console console_{output_.get(), output_.get(), ConsoleStyle::text, false, clock_};
  LabOptions options_;
  std::unique_ptr<Lab> lab_;
  Dictionary status_;
};

TEST_F(LabTest, ServesASignedStorebagThatTheBundlesKeyVerifies) {
  start();
  putStorebag("brevan", "1.0");
  Client daemon = client();
  for (const char* path : {"/storebags/brevan", "/bags/alder/brevan", "/storebags/alder/brevan"}) {
    const Client::Reply reply = daemon.get(at("url") + path + "?version=8.0");
    ASSERT_EQ(reply.code, CURLE_OK) << reply.problem;
    EXPECT_EQ(reply.status, 200);
    EXPECT_EQ(field(reply, "Cache-Control"), "max-age=60");
    const Result<Value> inner = verifySignedStorebag(reply.body, *publicKey());
    ASSERT_TRUE(inner) << inner.error().description();
    EXPECT_THAT(writeTextDocument(*inner), HasSubstr("\"post_url\":\"" + at("eventsURL") + "\""));
  }
}

TEST_F(LabTest, NotModifiedIsAnEmptyBodyWithTheDate) {
  start();
  putStorebag("brevan", "1.0");
  Client daemon = client();
  const std::string url = at("storebagURL") + "/brevan?version=8.0";
  const std::string date = field(daemon.get(url), "Last-Modified");
  ASSERT_NE(date, "");
  const Client::Reply same = daemon.get(url, {"If-Modified-Since: " + date});
  EXPECT_EQ(same.status, 304);
  EXPECT_EQ(same.body, "");
  EXPECT_EQ(field(same, "Last-Modified"), date);
  putStorebag("brevan", "2.0");
  const Client::Reply changed = daemon.get(url, {"If-Modified-Since: " + date});
  EXPECT_EQ(changed.status, 200);
  EXPECT_THAT(writeTextDocument(*verifySignedStorebag(changed.body, *publicKey())),
              HasSubstr("\"version\":\"2.0\""));
}

TEST_F(LabTest, PostsArriveOnDiskAndAtTheControlAddress) {
  start();
  Client daemon = client();
  const Array events = {goodEvent(1), goodEvent(2)};
  EXPECT_EQ(daemon.post(at("eventsURL"), goodRequest(goodMessage(events), true)).status, 200);
  EXPECT_EQ(daemon.post(at("realtimeURL"), goodRequest(goodMessage({goodEvent(3)}))).status, 200);
  const Client::Reply shown = client().get(at("controlURL") + "/arrivals?last=1");
  const Result<Value> document = parseDocument(shown.body);
  ASSERT_TRUE(document);
  const Array& arrivals = *findArray(*document->dictionary(), "arrivals");
  ASSERT_THAT(arrivals, SizeIs(1));
  EXPECT_EQ(*findString(*arrivals[0].dictionary(), "path"), "/v1/realtime");
  EXPECT_EQ(*findArray(*arrivals[0].dictionary(), "problems"), Array{}) << shown.body;
  const std::string lines = *readFile(at("eventsFile"), 1U << 20U);
  EXPECT_EQ(std::count(lines.begin(), lines.end(), '\n'), 3);
  const Result<Value> first = parseDocument(lines.substr(0, lines.find('\n')));
  EXPECT_EQ(*first->dictionary()->find("event"), Value(goodEvent(1)));
  EXPECT_EQ(*findString(*findDictionary(*first->dictionary(), "headers"), "Content-Encoding"), "gzip");
  EXPECT_EQ(lab_->status().find("events")->int64Value(), 3);
  EXPECT_EQ(lab_->status().find("postsWithProblems")->int64Value(), 0);
}

TEST_F(LabTest, BodiesThatAreTooLargeAreRefusedWithoutHoldingThem) {
  start();
  HttpRequest request = goodRequest(goodMessage({}));
  request.body.assign((16U << 20U) + 1, ' ');
  setHeader(request, "Content-Length", std::to_string(request.body.size()));
  setHeader(request, "Expect", "");
  const Client::Reply reply = client().post(at("eventsURL"), request);
  EXPECT_THAT(reply.status, AnyOf(413, 0)) << reply.problem;
  setHeader(request, "Content-Length", "");
  request.headers.emplace_back("Transfer-Encoding", "chunked");
  EXPECT_THAT(client().post(at("eventsURL"), request).status, AnyOf(413, 0));
  EXPECT_EQ(lab_->status().find("events")->int64Value(), 0);
}

TEST_F(LabTest, MisbehavesAsToldAndNoLonger) {
  start();
  putStorebag("brevan", "1.0");
  const std::string url = at("storebagURL") + "/brevan";
  Client daemon = client();
  misbehave("status=503&count=2");
  EXPECT_EQ(daemon.get(url).status, 503);
  EXPECT_EQ(daemon.get(url).status, 503);
  EXPECT_EQ(daemon.get(url).status, 200);
  misbehave("empty=1");
  EXPECT_EQ(daemon.get(url).body, "");
  misbehave("break-signature=1");
  EXPECT_FALSE(verifySignedStorebag(daemon.get(url).body, *publicKey()));
  misbehave("for=events&status=599");
  EXPECT_EQ(daemon.get(url).status, 200);
  EXPECT_EQ(daemon.post(at("eventsURL"), goodRequest(goodMessage({goodEvent(1)}))).status, 599);
  EXPECT_TRUE(verifySignedStorebag(daemon.get(url).body, *publicKey()));
}

TEST_F(LabTest, ResetsTheConnectionAtTheByteItIsToldTo) {
  start();
  putStorebag("brevan", "1.0");
  const std::string url = at("storebagURL") + "/brevan";
  misbehave("reset=1");
  Client::Reply reply = client().get(url);
  EXPECT_THAT(reply.problem, HasSubstr("reset by peer"));
  EXPECT_EQ(reply.head + reply.body, "");
  misbehave("reset-after=300");
  reply = client().get(url);
  EXPECT_NE(reply.code, CURLE_OK);
  EXPECT_EQ(reply.head.size() + reply.body.size(), 300U);
}

TEST_F(LabTest, StoppingEndsAnswersThatHangOrNeverEnd) {
  start();
  putStorebag("brevan", "1.0");
  misbehave("hang=1");
  misbehave("endless=1");
  const std::string url = at("storebagURL") + "/brevan";
  const std::string caFile = at("caFile");
  auto hanging = std::async(std::launch::async, [&url, &caFile] { return Client(caFile).get(url); });
  while (findArray(lab_->status(), "misbehaviours")->size() > 1) std::this_thread::yield();
  auto endless = std::async(std::launch::async, [&url, &caFile] { return Client(caFile).get(url); });
  while (!findArray(lab_->status(), "misbehaviours")->empty()) std::this_thread::yield();
  const auto begun = std::chrono::steady_clock::now();
  lab_->stop();
  hanging.wait();
  EXPECT_NE(endless.get().body.size(), 0U);
  EXPECT_LT(std::chrono::steady_clock::now() - begun, std::chrono::seconds(10));
}

TEST_F(LabTest, AsksForTheStopThroughTheControlAddress) {
  start();
  pollfd entry{.fd = lab_->stopRequestedFd(), .events = POLLIN, .revents = 0};
  EXPECT_EQ(::poll(&entry, 1, 0), 0);
  // As "curl -X POST" sends it: without a body and without its length.
  const FileDescriptor socket = connectTo(at("controlURL"));
  const std::string request = "POST /stop HTTP/1.1\r\nHost: 127.0.0.1\r\nConnection: close\r\n\r\n";
  ASSERT_EQ(::send(socket.get(), request.data(), request.size(), 0), static_cast<ssize_t>(request.size()));
  EXPECT_THAT(readAll(socket), HasSubstr("\"stopping\": true"));
  EXPECT_EQ(::poll(&entry, 1, 0), 1);
}

TEST_F(LabTest, OtherMethodsAreRefusedAndTheConnectionEnds) {
  start();
  Client stranger = client();
  stranger.setMethod("DELETE");
  const Client::Reply reply = stranger.get(at("url") + "/storebags/brevan");
  EXPECT_EQ(reply.status, 405);
  EXPECT_EQ(field(reply, "Connection"), "close");
  EXPECT_EQ(client().get(at("url") + "/" + std::string(1100, 'a')).status, 414);
}

TEST_F(LabTest, AHeadWithoutEndIsCutOff) {
  start();
  const FileDescriptor socket = connectTo(at("controlURL"));
  const std::string begin = "GET /status HTTP/1.1\r\nHost: 127.0.0.1\r\n";
  ::send(socket.get(), begin.data(), begin.size(), MSG_NOSIGNAL);
  const std::string line = "X-More: " + std::string(1000, 'x') + "\r\n";
  size_t sent = 0;
  while (sent < (64U << 20U) && ::send(socket.get(), line.data(), line.size(), MSG_NOSIGNAL) > 0)
    sent += line.size();
  EXPECT_LT(sent, 64U << 20U);
}

TEST_F(LabTest, ClientsThatCannotTalkToItAreNamedWithTheRemedy) {
  start();
  const FileDescriptor socket = connectTo(at("url"));
  const std::string request = "GET / HTTP/1.1\r\n\r\n";
  ::send(socket.get(), request.data(), request.size(), MSG_NOSIGNAL);
  readAll(socket);
  const CertificateFiles others = {.authority = folder_ + "/a",
                                   .authorityKey = folder_ + "/b",
                                   .server = folder_ + "/c",
                                   .serverKey = folder_ + "/d"};
  ASSERT_TRUE(ensureCertificates(others, {"localhost"}, std::time(nullptr)));
  EXPECT_EQ(Client(others.authority).get(at("url")).code, CURLE_PEER_FAILED_VERIFICATION);
  lab_->stop();
  console_.flush();
  std::rewind(output_.get());
  std::string text(65536, '\0');
  text.resize(std::fread(text.data(), 1, text.size(), output_.get()));
  EXPECT_THAT(text, HasSubstr("write https://"));
  EXPECT_THAT(text, HasSubstr("copy the lab's ca.pem to the client's trust.d folder"));
}

TEST_F(LabTest, ManyClientsAtOnce) {
  start();
  putStorebag("brevan", "1.0");
  const std::string url = at("storebagURL") + "/brevan";
  const std::string events = at("eventsURL");
  const std::string caFile = at("caFile");
  std::vector<std::thread> threads;
  std::atomic<int> good = 0;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&good, &url, &events, &caFile] {
      Client daemon(caFile);
      for (int round = 0; round < 5; ++round) {
        good += daemon.get(url).status == 200 ? 1 : 0;
        good += daemon.post(events, goodRequest(goodMessage({goodEvent(round)}), true)).status == 200 ? 1 : 0;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(good, 80);
  EXPECT_EQ(lab_->status().find("events")->int64Value(), 40);
  const std::string lines = *readFile(at("eventsFile"), 1U << 24U);
  EXPECT_EQ(std::count(lines.begin(), lines.end(), '\n'), 40);
}

TEST_F(LabTest, ASecondStartReusesEverythingAndWritesTheReadyFile) {
  start();
  const std::string authority = *readFile(at("caFile"), 10'000);
  const std::string key = *readFile(at("bundle") + "/publicKey.der", 10'000);
  lab_.reset();
  options_.readyFile = folder_ + "/ready.json";
  start();
  EXPECT_EQ(*readFile(at("caFile"), 10'000), authority);
  EXPECT_EQ(*readFile(at("bundle") + "/publicKey.der", 10'000), key);
  const Result<Value> ready = parseDocument(*readFile(options_.readyFile, 10'000));
  ASSERT_TRUE(ready);
  EXPECT_EQ(*findString(*ready->dictionary(), "storebagURL"), at("storebagURL"));
}

TEST_F(LabTest, WhatKeepsItFromStartingIsNamedWithItsRemedy) {
  start();
  const auto problem = [this](const LabOptions& options) {
    const Result<std::unique_ptr<Lab>> lab = Lab::start(options, console_, clock_);
    return lab ? std::string() : lab.error().localizedDescription();
  };
  LabOptions other = options_;
  EXPECT_THAT(problem(other), HasSubstr("another tarnel-lab uses " + at("directory") + "; end it"));
  other.directory = folder_ + "/other";
  ASSERT_FALSE(makeDirectory(other.directory, 0755));
  std::filesystem::copy_file(at("directory") + "/storebag-key.pem", other.directory + "/storebag-key.pem");
  const auto portOf = [](const std::string& url) {
    return static_cast<uint16_t>(std::stoi(url.substr(url.rfind(':') + 1)));
  };
  other.port = portOf(at("url"));
  EXPECT_THAT(problem(other),
              HasSubstr("Address already in use; end the other program, or choose another port with "
                        "--port"));
  other.port = 0;
  other.controlPort = portOf(at("controlURL"));
  EXPECT_THAT(problem(other), HasSubstr("choose another port with --control-port"));
  other.controlPort = 0;
  other.listen = "localhost";
  EXPECT_THAT(problem(other), HasSubstr("\"localhost\" is no numeric address"));
  other.listen = "127.0.0.1";
  ASSERT_FALSE(writeFile(other.directory + "/storebag-key.pem", "nonsense", 0600));
  EXPECT_THAT(problem(other), HasSubstr("storebag-key.pem: not an unencrypted private key"));
  other.directory = "/dev/null/lab";
  EXPECT_THAT(problem(other), HasSubstr("choose a folder that you may write with --directory"));
}

}  // namespace
}  // namespace tarnel::lab
