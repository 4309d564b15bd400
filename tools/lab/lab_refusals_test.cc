// How the lab starts and ends, and what it refuses.
#include <gmock/gmock.h>

#include <chrono>
#include <future>
#include <thread>

#include "base/unique_fd.h"
#include "tools/lab/http/certificate_authority.h"
#include "tools/lab/lab_test_fixture.h"
#include "tools/receiving/test_post.h"

namespace tarnel::lab {
namespace {

using ::testing::AnyOf;
using ::testing::HasSubstr;

class LabRefusalsTest : public LabTest {};

TEST_F(LabRefusalsTest, BodiesThatAreTooLargeAreRefusedWithoutHoldingThem) {
  // The connection ends at the refusal: who is still sending may not come to read it (0), or only that it was
  // to go on (100).
  const auto isRefusal = AnyOf(413, 100, 0);
  start();
  HttpRequest request = goodRequest(goodMessage({}));
  request.body.assign((16U << 20U) + 1, ' ');
  setHeader(request, "Content-Length", std::to_string(request.body.size()));
  setHeader(request, "Expect", "");
  const Client::Reply reply = client().post(at("eventsURL"), request);
  EXPECT_THAT(reply.status, isRefusal) << reply.problem;
  setHeader(request, "Content-Length", "");
  request.headers.emplace_back("Transfer-Encoding", "chunked");
  EXPECT_THAT(client().post(at("eventsURL"), request).status, isRefusal);
  EXPECT_EQ(lab_->status().find("events")->int64Value(), 0);
}

TEST_F(LabRefusalsTest, StoppingEndsAnswersThatHangOrNeverEnd) {
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

TEST_F(LabRefusalsTest, AsksForTheStopThroughTheControlAddress) {
  start();
  pollfd entry{.fd = lab_->stopRequestedFd(), .events = POLLIN, .revents = 0};
  EXPECT_EQ(::poll(&entry, 1, 0), 0);
  // As "curl -X POST" sends it: without a body and without its length.
  const UniqueFd socket = connectTo(at("controlURL"));
  const std::string request = "POST /stop HTTP/1.1\r\nHost: 127.0.0.1\r\nConnection: close\r\n\r\n";
  ASSERT_EQ(::send(socket.get(), request.data(), request.size(), 0), static_cast<ssize_t>(request.size()));
  EXPECT_THAT(readAll(socket), HasSubstr("\"stopping\": true"));
  EXPECT_EQ(::poll(&entry, 1, 0), 1);
}

TEST_F(LabRefusalsTest, OtherMethodsAreRefusedAndTheConnectionEnds) {
  start();
  Client stranger = client();
  stranger.setMethod("DELETE");
  const Client::Reply reply = stranger.get(at("url") + "/storebags/brevan");
  EXPECT_EQ(reply.status, 405);
  EXPECT_EQ(field(reply, "Connection"), "close");
  EXPECT_EQ(client().get(at("url") + "/" + std::string(1100, 'a')).status, 414);
}

TEST_F(LabRefusalsTest, AHeadWithoutEndIsCutOff) {
  start();
  const UniqueFd socket = connectTo(at("controlURL"));
  const std::string begin = "GET /status HTTP/1.1\r\nHost: 127.0.0.1\r\n";
  ::send(socket.get(), begin.data(), begin.size(), MSG_NOSIGNAL);
  const std::string line = "X-More: " + std::string(1000, 'x') + "\r\n";
  size_t sent = 0;
  while (sent < (64U << 20U) && ::send(socket.get(), line.data(), line.size(), MSG_NOSIGNAL) > 0)
    sent += line.size();
  EXPECT_LT(sent, 64U << 20U);
}

TEST_F(LabRefusalsTest, ClientsThatCannotTalkToItAreNamedWithTheRemedy) {
  start();
  const UniqueFd socket = connectTo(at("url"));
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

TEST_F(LabRefusalsTest, ASecondStartReusesEverythingAndWritesTheReadyFile) {
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

TEST_F(LabRefusalsTest, WhatKeepsItFromStartingIsNamedWithItsRemedy) {
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
