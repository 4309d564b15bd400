#pragma once

#include <arpa/inet.h>
#include <curl/curl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>

#include <cstdio>
#include <ctime>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "base/unique_fd.h"
#include "formats/cryptography.h"
#include "formats/document.h"
#include "platform/fake/fake_clock.h"
#include "tools/files/file_io.h"
#include "tools/lab/lab.h"
#include "tools/receiving/http_message.h"
#include "tools/storebag/storebag_key.h"
#include "tools/storebag/storebag_template.h"

// The running lab over real sockets and TLS on loopback, and a client of it.

namespace tarnel::lab {

inline size_t appendTo(char* bytes, size_t size, size_t count, void* target) {
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
  UniqueFd connectTo(const std::string& url) const {
    const auto port = static_cast<uint16_t>(std::stoi(url.substr(url.rfind(':') + 1)));
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(port);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    UniqueFd socket(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    EXPECT_EQ(::connect(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    return socket;
  }
  // All that comes until the end; a reset ends it, too.
  static std::string readAll(const UniqueFd& socket) {
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

}  // namespace tarnel::lab
