#pragma once

#include <dirent.h>
#include <gtest/gtest.h>
#include <sys/eventfd.h>
#include <systemd/sd-event.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "ipc/protocol/wire.h"
#include "ipc/server/ipc_test_clients.h"
#include "ipc/server/sd_bus_listener.h"
#include "platform/fake/fake_log.h"

// The real service on a socket of a temporary folder.

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

inline size_t openDescriptors() {
  DIR* folder = opendir("/proc/self/fd");
  size_t count = 0;
  while (readdir(folder) != nullptr) ++count;
  closedir(folder);
  return count;
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
  // What answers an upload; without it, false.
  std::function<bool(const std::string& token)> uploadFile;

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
  void uploadFileAtPath(std::string fileURL, std::string extensionToken, SuccessReply reply) override {
    note("uploadFile " + fileURL);
    reply(uploadFile && uploadFile(extensionToken));
  }
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
  // Set before start(): whether connections get an object to call.
  bool exportsObjects = true;
  // Set before start(): what starts the threads of connections.
  ConnectionRegistry::CreateThread createThread = pthread_create;
  // How often memory was given back.
  std::atomic<size_t> trims{0};
  // What the listener said at its end.
  std::atomic<size_t> callsLeftBehind{0};

  Service& start() {
    std::promise<MaybeError> resumed;
    thread_ = std::thread([this, &resumed] { run(resumed); });
    const MaybeError error = resumed.get_future().get();
    EXPECT_FALSE(error) << error->description();
    return *this;
  }
  // Starts it so that every upload that has a file hands it to `use`, and is a success.
  void startOnFiles(std::function<void(ClientFile&)> use) {
    prepare = [this, use = std::move(use)](RecordingSession& session) {
      session.uploadFile = [this, use](const std::string& token) {
        const auto file = clientFiles().consume(token);
        if (file != nullptr) use(*file);
        return file != nullptr;
      };
    };
    start();
  }
  void stop() {
    if (!thread_.joinable()) return;
    // What this thread did with the listener comes before its end, for all to see.
    locked([] { return 0; });
    eventfd_write(quit_.get(), 1);
    thread_.join();
  }

  std::string path() const { return folder_.socket(); }
  const TemporaryFolder& folder() const { return folder_; }
  fake::FakeLog& log() { return *log_; }
  ClientFileRegistry& clientFiles() { return *clientFiles_; }
  FakeEntitlements& entitlements() { return *entitlements_; }
  SdBusListener& listener() { return *listener_; }
  size_t accepted() const {
    return locked([this] { return accepted_.size(); });
  }
  size_t rejected() const {
    return locked([this] { return rejected_; });
  }
  // Connections whose resume() was false.
  size_t notServed() const {
    return locked([this] { return notServed_; });
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
    if (exportsObjects) connection->setExportedObject(session);
    connection->setRemoteObjectInterface();
    connection->setInterruptionHandler([this] { locked([this] { return ++interruptions_; }); });
    // Keeps the session until it has run, as the daemon's does.
    connection->setInvalidationHandler([this, session] { locked([this] { return ++invalidations_; }); });
    locked([&] {
      accepted_.push_back({connection, session});
      return 0;
    });
    if (connection->resume()) return true;
    locked([this] { return ++notServed_; });
    return false;
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
    options.clientFiles = clientFiles_;
    options.createThread = createThread;
    options.trimHeap = [this] { ++trims; };
    options.callsLeftBehind = [this](size_t calls) { callsLeftBehind = calls; };
    listener_ = std::make_unique<SdBusListener>(event, std::move(options), entitlements_, log_);
    listener_->setDelegate(this);
    resumed.set_value(listener_->resume());
    sd_event_loop(event);
    locked([] { return 0; });
    listener_.reset();
    sd_event_unref(event);
  }

  TemporaryFolder folder_;
  IpcLimits limits_;
  std::function<PeerCredentials(int)> readCredentials_;
  const UniqueFd quit_{eventfd(0, EFD_CLOEXEC)};
  const std::shared_ptr<fake::FakeLog> log_ = std::make_shared<fake::FakeLog>();
  const std::shared_ptr<ClientFileRegistry> clientFiles_ = std::make_shared<ClientFileRegistry>(*log_);
  const std::shared_ptr<FakeEntitlements> entitlements_ = std::make_shared<FakeEntitlements>();
  std::unique_ptr<SdBusListener> listener_;

  mutable std::mutex mutex_;
  std::vector<Accepted> accepted_;
  size_t rejected_ = 0;
  size_t notServed_ = 0;
  size_t invalidations_ = 0;
  size_t interruptions_ = 0;
  std::thread thread_;
};

}  // namespace tarnel
