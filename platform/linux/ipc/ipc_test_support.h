#pragma once

#include <gtest/gtest.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>
#include <systemd/sd-event.h>

#include <array>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <filesystem>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/fake/fake_log.h"
#include "platform/ipc/wire.h"
#include "platform/linux/ipc/connection_loop.h"
#include "platform/linux/ipc/sd_bus_listener.h"

// The real service on a socket of a temporary folder, with clients of every kind.

namespace tarnel {

// Waits for what another thread is about to make true.
inline bool eventually(const std::function<bool()>& isTrue) {
  const auto giveUp = std::chrono::steady_clock::now() + std::chrono::seconds(30);
  while (!isTrue()) {
    if (std::chrono::steady_clock::now() > giveUp) return false;
    std::this_thread::yield();
  }
  return true;
}

class TemporaryFolder {
 public:
  TemporaryFolder() {
    std::string pattern = (std::filesystem::temp_directory_path() / "ipcXXXXXX").string();
    path_ = mkdtemp(pattern.data());
  }
  ~TemporaryFolder() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  TemporaryFolder(const TemporaryFolder&) = delete;
  TemporaryFolder& operator=(const TemporaryFolder&) = delete;
  const std::string& path() const { return path_; }
  std::string socket() const { return path_ + '/' + wire::kServiceName; }

 private:
  std::string path_;
};

// The exported object. Records what arrives; answers at once unless told otherwise.
class RecordingSession final : public ClientSessionInterface {
 public:
  // Called for every operation with its name, before it is answered; may throw or wait.
  std::function<void(const std::string&)> onCall = [](const std::string&) {};
  // What answers a send; left in place, it gives the number of sends so far as a text.
  std::function<void(SentReply)> answerSend;

  std::vector<std::string> calls() const {
    const std::lock_guard lock(mutex_);
    return calls_;
  }
  size_t count() const {
    const std::lock_guard lock(mutex_);
    return calls_.size();
  }

  void setSessionInfo(MaybeDictionary sessionInfo, MaybeDictionary userInfo, std::optional<Array> frameworks,
                      bool hasAggregationBlock) override {
    note("setSessionInfo " + text(sessionInfo) + ' ' + text(userInfo) + ' ' +
         (frameworks ? description(*frameworks) : "none") + (hasAggregationBlock ? " yes" : " no"));
  }
  void startConfigWithCompletionHandler(NamesReply reply) override {
    note("startConfig");
    reply(std::vector<std::string>{"httppost", "dashboard"});
  }
  void fetchStatesWithUserInfo(MaybeDictionary userInfo, NamesReply reply) override {
    note("fetchStates " + text(userInfo));
    reply(std::nullopt);
  }
  void fetchDisplayURL(TextReply reply) override {
    note("fetchDisplayURL");
    reply("URL not available");
  }
  void sendMessageWithCategory(uint16_t category, uint16_t type, MaybeDictionary payload,
                               SentReply reply) override {
    const bool hasReply = static_cast<bool>(reply);
    note("send " + std::to_string(category) + ' ' + std::to_string(type) + ' ' + text(payload) +
         (hasReply ? "" : " noreply"));
    finishSend(std::move(reply));
  }
  void sendMessageWithDictionary(Dictionary message, SentReply reply) override {
    note("dictionary " + description(message));
    finishSend(std::move(reply));
  }
  void flushMessagesWithCompletion(FlushReply completion) override {
    note("flush");
    completion("text", Error("domain", -1, "No backends available to send message"));
  }
  void finishSessionWithReply(SentReply reply) override {
    note("finish");
    reply(SentObject(Error("domain", 503, "off")));
  }
  void uploadFileAtPath(std::string, std::string, SuccessReply) override {}
  void uploadLogData(Array logData, UploadReply completionHandler) override {
    note("uploadLogData " + description(logData));
    completionHandler(true, std::nullopt);
  }
  void sendMessageWithSessionInfo(MaybeDictionary sessionInfo, MaybeDictionary userInfo, uint16_t category,
                                  uint16_t type, MaybeDictionary payload, TextReply reply) override {
    note("single " + text(sessionInfo) + ' ' + text(userInfo) + ' ' + std::to_string(category) + ' ' +
         std::to_string(type) + ' ' + text(payload));
    reply(std::nullopt);
  }

 private:
  static std::string text(const MaybeDictionary& dictionary) {
    return dictionary ? description(*dictionary) : "none";
  }
  void note(const std::string& call) {
    {
      const std::lock_guard lock(mutex_);
      calls_.push_back(call);
    }
    onCall(call);
  }
  void finishSend(SentReply reply) {
    if (answerSend) {
      answerSend(std::move(reply));
    } else {
      reply(SentObject(std::to_string(count())));
    }
  }

  mutable std::mutex mutex_;
  std::vector<std::string> calls_;
};

class FakeEntitlements final : public Entitlements {
 public:
  std::atomic<bool> grants{true};
  bool holds(const PeerCredentials& peer, std::string_view entitlement) override {
    return grants && peer.uid == getuid() && entitlement == "com.orvane.private.tarneld";
  }
};

// Listener, event loop and delegate on a thread of their own.
class Service final : public IpcListenerDelegate {
  template <class F>
  auto locked(F f) const {
    const std::lock_guard lock(mutex_);
    return f();
  }

 public:
  struct Accepted {
    std::weak_ptr<IpcConnection> connection;
    std::weak_ptr<RecordingSession> session;
  };

  explicit Service(IpcLimits limits = {}, std::function<PeerCredentials(int)> readCredentials = nullptr)
      : limits_(limits), readCredentials_(std::move(readCredentials)) {}
  ~Service() override { stop(); }
  Service(const Service&) = delete;
  Service& operator=(const Service&) = delete;

  // Set before start(): prepares each new session.
  std::function<void(RecordingSession&)> prepare = [](RecordingSession&) {};

  Service& start() {
    std::promise<MaybeError> resumed;
    thread_ = std::thread([this, &resumed] { run(resumed); });
    const MaybeError error = resumed.get_future().get();
    EXPECT_FALSE(error) << error->description();
    return *this;
  }
  void stop() {
    if (!thread_.joinable()) return;
    eventfd_write(quit_.get(), 1);
    thread_.join();
  }

  std::string path() const { return folder_.socket(); }
  const TemporaryFolder& folder() const { return folder_; }
  fake::FakeLog& log() { return *log_; }
  FakeEntitlements& entitlements() { return *entitlements_; }
  SdBusListener& listener() { return *listener_; }
  size_t accepted() const {
    return locked([this] { return accepted_.size(); });
  }
  size_t rejected() const {
    return locked([this] { return rejected_; });
  }
  size_t invalidations() const {
    return locked([this] { return invalidations_; });
  }
  size_t interruptions() const {
    return locked([this] { return interruptions_; });
  }
  std::shared_ptr<IpcConnection> connection(size_t i) const {
    return locked([this, i] { return accepted_.at(i).connection.lock(); });
  }
  std::shared_ptr<RecordingSession> session(size_t i = 0) const {
    return locked([this, i] { return accepted_.at(i).session.lock(); });
  }
  bool logged(std::string_view part) const {
    for (const auto& line : log_->lines()) {
      if (line.text.find(part) != std::string::npos) return true;
    }
    return false;
  }

  bool shouldAcceptNewConnection(IpcListener&, std::shared_ptr<IpcConnection> connection) override {
    if (!connection->valueForEntitlement("com.orvane.private.tarneld")) {
      locked([this] { return ++rejected_; });
      return false;
    }
    auto session = std::make_shared<RecordingSession>();
    prepare(*session);
    connection->setExportedObject(session);
    connection->setRemoteObjectInterface();
    connection->setInterruptionHandler([this] { locked([this] { return ++interruptions_; }); });
    // Keeps the session until it has run, as the daemon's does.
    connection->setInvalidationHandler([this, session] { locked([this] { return ++invalidations_; }); });
    locked([&] {
      accepted_.push_back({connection, session});
      return 0;
    });
    connection->resume();
    return true;
  }

 private:
  void run(std::promise<MaybeError>& resumed) {
    sd_event* event = nullptr;
    sd_event_new(&event);
    sd_event_add_io(
        event, nullptr, quit_.get(), EPOLLIN,
        [](sd_event_source* source, int, uint32_t, void*) {
          return sd_event_exit(sd_event_source_get_event(source), 0);
        },
        nullptr);
    SdBusListener::Options options;
    options.runtimeDirectory = folder_.path();
    options.limits = limits_;
    options.readCredentials = readCredentials_;
    listener_ = std::make_unique<SdBusListener>(event, std::move(options), entitlements_, log_);
    listener_->setDelegate(this);
    resumed.set_value(listener_->resume());
    sd_event_loop(event);
    listener_.reset();
    sd_event_unref(event);
  }

  TemporaryFolder folder_;
  IpcLimits limits_;
  std::function<PeerCredentials(int)> readCredentials_;
  const UniqueFd quit_{eventfd(0, EFD_CLOEXEC)};
  const std::shared_ptr<fake::FakeLog> log_ = std::make_shared<fake::FakeLog>();
  const std::shared_ptr<FakeEntitlements> entitlements_ = std::make_shared<FakeEntitlements>();
  std::unique_ptr<SdBusListener> listener_;

  mutable std::mutex mutex_;
  std::vector<Accepted> accepted_;
  size_t rejected_ = 0;
  size_t invalidations_ = 0;
  size_t interruptions_ = 0;
  std::thread thread_;
};

inline UniqueFd connectTo(const std::string& path) {
  UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof(address.sun_path) - 1);
  if (connect(fd.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0) fd.reset();
  return fd;
}

// True when the peer has closed the socket, whatever it sent before.
inline bool isClosedByPeer(const UniqueFd& fd) {
  std::array<char, 4096> rest{};
  while (true) {
    const auto got = recv(fd.get(), rest.data(), rest.size(), 0);
    if (got == 0 || (got < 0 && errno == ECONNRESET)) return true;
    if (got < 0) return false;
  }
}

// A client without a bus library.
class RawClient {
 public:
  explicit RawClient(const std::string& path) : fd_(connectTo(path)) {
    EXPECT_TRUE(fd_);
    timeval limit{30, 0};
    setsockopt(fd_.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof(limit));
  }
  // False when the peer takes no more.
  bool write(std::string_view bytes) const {
    while (!bytes.empty()) {
      const auto sent = send(fd_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
      if (sent <= 0) return false;
      bytes.remove_prefix(static_cast<size_t>(sent));
    }
    return true;
  }
  void authenticate() const {
    EXPECT_TRUE(write(std::string("\0AUTH ANONYMOUS 74\r\nBEGIN\r\n", 27)));
    std::string answer;
    char c = 0;
    while (!answer.ends_with("\r\n") && recv(fd_.get(), &c, 1, 0) == 1) answer += c;
    EXPECT_TRUE(answer.starts_with("OK ")) << answer;
  }
  const UniqueFd& fd() const { return fd_; }
  void close() { fd_.reset(); }

 private:
  UniqueFd fd_;
};

// A method call's bytes, little endian, written by hand; bodySize may lie.
inline std::string rawCall(std::string_view member, std::string_view body = {},
                           std::string_view signature = {}, uint32_t bodySize = UINT32_MAX,
                           uint32_t serial = 1) {
  std::string fields;
  const auto field = [&fields](char code, char type, std::string_view text) {
    while (fields.size() % 8 != 0) fields += '\0';
    fields += code;
    fields += {'\1', type, '\0'};
    const auto size = static_cast<uint32_t>(text.size());
    if (type == 'g') {
      fields += static_cast<char>(size);
    } else {
      fields.append(reinterpret_cast<const char*>(&size), 4);
    }
    fields += text;
    fields += '\0';
  };
  field(1, 'o', wire::kSessionPath);
  field(2, 's', wire::kSessionInterface);
  field(3, 's', member);
  if (!signature.empty()) field(8, 'g', signature);
  std::string message("l\1\0\1", 4);
  const uint32_t claimed = bodySize == UINT32_MAX ? static_cast<uint32_t>(body.size()) : bodySize;
  const auto fieldBytes = static_cast<uint32_t>(fields.size());
  for (const uint32_t number : {claimed, serial, fieldBytes}) {
    message.append(reinterpret_cast<const char*>(&number), 4);
  }
  message += fields;
  while (message.size() % 8 != 0) message += '\0';
  return message.append(body);
}

// A client as another program's D-Bus library would be.
class BusClient {
 public:
  explicit BusClient(const std::string& path) {
    auto fd = connectTo(path);
    EXPECT_TRUE(fd);
    fd_ = fd.release();
    sd_bus* bus = nullptr;
    sd_bus_new(&bus);
    bus_.reset(bus);
    EXPECT_GE(sd_bus_set_fd(bus, fd_, fd_), 0);
    EXPECT_GE(sd_bus_start(bus), 0);
  }

  BusMessage newCall(const char* member) {
    sd_bus_message* call = nullptr;
    EXPECT_GE(sd_bus_message_new_method_call(bus_.get(), &call, nullptr, wire::kSessionPath,
                                             wire::kSessionInterface, member),
              0);
    return BusMessage(call);
  }
  // The answer, or null with the error's name and text kept.
  BusMessage call(const BusMessage& message) {
    sd_bus_error error = SD_BUS_ERROR_NULL;
    sd_bus_message* reply = nullptr;
    const int r = sd_bus_call(bus_.get(), message.get(), 30'000'000, &error, &reply);
    errorName = r >= 0 ? "" : error.name == nullptr ? std::strerror(-r) : error.name;
    errorText = error.message == nullptr ? "" : error.message;
    sd_bus_error_free(&error);
    return BusMessage(reply);
  }
  template <class... Arguments>
  BusMessage call(const char* member, const char* signature, Arguments... arguments) {
    auto message = newCall(member);
    EXPECT_GE(sd_bus_message_append(message.get(), signature, arguments...), 0);
    return call(message);
  }
  int post(const BusMessage& message) { return sd_bus_send(bus_.get(), message.get(), nullptr); }
  sd_bus* bus() { return bus_.get(); }
  int fd() const { return fd_; }

  std::string errorName;
  std::string errorText;

 private:
  struct Close {
    void operator()(sd_bus* bus) const { sd_bus_close_unref(bus); }
  };
  int fd_ = -1;
  std::unique_ptr<sd_bus, Close> bus_;
};

}  // namespace tarnel
