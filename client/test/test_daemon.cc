#include "client/test/test_daemon.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>
#include <systemd/sd-id128.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <future>
#include <stdexcept>
#include <string_view>
#include <utility>

#include "ipc/dbus/dbus_codec.h"
#include "ipc/protocol/wire.h"

namespace tarnel::test {
namespace {

void require(bool holds, const char* what) {
  if (!holds) throw std::runtime_error(what);
}

template <class T>
T value(Result<T> result) {
  if (!result) throw std::runtime_error(result.error().description());
  return std::move(*result);
}

Received readMessage(sd_bus_message* call) {
  Received received;
  require(sd_bus_message_read(call, "qq", &received.category, &received.type) > 0, "numbers");
  return received;
}

std::vector<Received> readBatch(sd_bus_message* call) {
  std::vector<Received> batch;
  require(sd_bus_message_enter_container(call, 'a', "(qquaa{sv})") > 0, "batch");
  while (sd_bus_message_enter_container(call, 'r', "qquaa{sv}") > 0) {
    Received one = readMessage(call);
    require(sd_bus_message_read_basic(call, 'u', &one.flag) > 0, "flag");
    one.payload = value(wire::readMaybeDictionary(call));
    batch.push_back(std::move(one));
    sd_bus_message_exit_container(call);
  }
  for (Received& one : batch) one.together = batch.size();
  return batch;
}

std::vector<Received> readCall(sd_bus_message* call) {
  const std::string_view member = sd_bus_message_get_member(call);
  Received one;
  if (member == wire::kSendMessages.name) return readBatch(call);
  if (member == wire::kSetSessionInfo.name) {
    one.sessionInfo = value(wire::readMaybeDictionary(call));
    one.userInfo = value(wire::readMaybeDictionary(call));
    one.array = value(wire::readMaybeArray(call));
    int hasAggregation = 0;
    require(sd_bus_message_read_basic(call, 'b', &hasAggregation) > 0, "flag");
    one.hasAggregation = hasAggregation != 0;
  } else if (member == wire::kFetchStates.name) {
    one.userInfo = value(wire::readMaybeDictionary(call));
  } else if (member == wire::kSendMessage.name) {
    one = readMessage(call);
    one.payload = value(wire::readMaybeDictionary(call));
  } else if (member == wire::kSendMessageDictionary.name) {
    one.payload = value(wire::readDictionary(call));
  } else if (member == wire::kUploadLogData.name) {
    one.array = value(wire::readArray(call));
  } else if (member == wire::kSendSingleMessage.name) {
    auto sessionInfo = value(wire::readMaybeDictionary(call));
    auto userInfo = value(wire::readMaybeDictionary(call));
    one = readMessage(call);
    one.sessionInfo = std::move(sessionInfo);
    one.userInfo = std::move(userInfo);
    one.payload = value(wire::readMaybeDictionary(call));
  }
  return {std::move(one)};
}

MaybeSentObject sentFor(const Received& message) {
  if (message.type == 13) return SentObject(Error("TarnelErrorDomain", 503, "switched off"));
  if (message.type == 14) return std::nullopt;
  return SentObject("sent " + std::to_string(message.category) + "/" + std::to_string(message.type));
}

void writeAnswer(sd_bus_message* reply, std::string_view member, const std::vector<Received>& calls) {
  if (member == wire::kStartConfig.name) {
    wire::appendMaybeNames(reply, std::vector<std::string>{"httppost", "dravik"});
  } else if (member == wire::kFetchStates.name) {
    wire::appendMaybeNames(reply, std::nullopt);
  } else if (member == wire::kFetchDisplayURL.name) {
    wire::appendMaybeString(reply, "URL not available");
  } else if (member == wire::kSendMessages.name) {
    sd_bus_message_open_container(reply, 'a', "av");
    for (const Received& call : calls) wire::appendMaybeSentObject(reply, sentFor(call));
    sd_bus_message_close_container(reply);
  } else if (member == wire::kFlushMessages.name) {
    wire::appendMaybeString(reply, "flushed");
    wire::appendMaybeError(reply, Error("TarnelErrorDomain", -1, "No backends available to send message"));
  } else if (member == wire::kUploadLogData.name) {
    const int success = 1;
    sd_bus_message_append_basic(reply, 'b', &success);
    wire::appendMaybeError(reply, std::nullopt);
  } else if (member == wire::kUploadFile.name) {
    sd_bus_message_append(reply, "b", 1);
  } else if (member == wire::kSendSingleMessage.name) {
    wire::appendMaybeString(reply, "finished");
  } else if (member != wire::kSetSessionInfo.name) {
    wire::appendMaybeSentObject(reply, sentFor(calls.front()));
  }
}

UniqueFd listenAt(const std::string& path) {
  UniqueFd listener(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  ::unlink(path.c_str());
  require(::bind(listener.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0, "bind");
  require(::listen(listener.get(), 16) == 0, "listen");
  return listener;
}

}  // namespace

ScratchFolder::ScratchFolder() {
  std::string name = (std::filesystem::temp_directory_path() / "tarnel-client-XXXXXX").string();
  require(::mkdtemp(name.data()) != nullptr, "mkdtemp");
  path_ = name;
}

ScratchFolder::~ScratchFolder() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

void TestDaemon::BusCloser::operator()(sd_bus* bus) const noexcept {
  sd_bus_close_unref(bus);
}

TestDaemon::TestDaemon(std::string path)
    : path_(std::move(path)), listener_(listenAt(path_)), wake_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
  thread_ = std::thread([this] { run(); });
}

TestDaemon::~TestDaemon() {
  {
    const std::lock_guard lock(mutex_);
    isEnding_ = true;
  }
  nudge();
  thread_.join();
}

void TestDaemon::nudge() {
  const uint64_t one = 1;
  require(::write(wake_.get(), &one, sizeof one) == sizeof one, "nudge");
}

void TestDaemon::post(std::function<void()> task) {
  std::promise<void> done;
  auto finished = done.get_future();
  {
    const std::lock_guard lock(mutex_);
    tasks_.emplace_back([&task, &done] {
      task();
      done.set_value();
    });
  }
  nudge();
  finished.wait();
}

void TestDaemon::dropConnections() {
  post([this] { peers_.clear(); });
}

void TestDaemon::die() {
  post([this] {
    peers_.clear();
    listener_ = UniqueFd();
    ::unlink(path_.c_str());
  });
}

void TestDaemon::callClients(const MaybeDictionary& messageInfo, double timestamp, uint16_t category,
                             uint16_t type, const MaybeDictionary& payload) {
  post([this, &messageInfo, timestamp, category, type, &payload] {
    for (Peer& peer : peers_) {
      sd_bus_message* call = nullptr;
      sd_bus_message_new_method_call(peer.bus.get(), &call, nullptr, wire::kReplyPath, wire::kReplyInterface,
                                     wire::kSendMessageToClient.name);
      wire::appendMaybeDictionary(call, messageInfo);
      sd_bus_message_append(call, "dqq", timestamp, category, type);
      wire::appendMaybeDictionary(call, payload);
      sd_bus_message_set_expect_reply(call, 0);
      sd_bus_send(peer.bus.get(), call, nullptr);
      sd_bus_message_unref(call);
    }
  });
}

void TestDaemon::askToDelete(const std::string& fileURL) {
  post([this, &fileURL] {
    for (Peer& peer : peers_) {
      sd_bus_message* call = nullptr;
      sd_bus_message_new_method_call(peer.bus.get(), &call, nullptr, wire::kReplyPath, wire::kReplyInterface,
                                     wire::kDeleteFile.name);
      sd_bus_message_append(call, "s", fileURL.c_str());
      sd_bus_message_set_expect_reply(call, 0);
      sd_bus_send(peer.bus.get(), call, nullptr);
      sd_bus_message_unref(call);
    }
  });
}

std::vector<Received> TestDaemon::waitFor(size_t count) {
  std::unique_lock lock(mutex_);
  if (!changed_.wait_for(lock, std::chrono::seconds(30),
                         [this, count] { return received_.size() >= count; })) {
    throw std::runtime_error("only " + std::to_string(received_.size()) + " calls came");
  }
  return received_;
}

std::vector<Received> TestDaemon::received() {
  const std::lock_guard lock(mutex_);
  return received_;
}

size_t TestDaemon::connectionCount() {
  const std::lock_guard lock(mutex_);
  return connections_;
}

void TestDaemon::record(std::vector<Received> calls) {
  const std::lock_guard lock(mutex_);
  std::move(calls.begin(), calls.end(), std::back_inserter(received_));
  changed_.notify_all();
}

int TestDaemon::handle(sd_bus_message* call) {
  if (sd_bus_message_is_method_call(call, wire::kSessionInterface, nullptr) <= 0) return 0;
  const std::string member = sd_bus_message_get_member(call);
  std::vector<Received> calls = readCall(call);
  const bool wantsReply = sd_bus_message_get_expect_reply(call) > 0;
  for (Received& one : calls) {
    one.member = member;
    one.wantsReply = wantsReply;
  }
  sd_bus_message* reply = nullptr;
  if (wantsReply && !isSilent) {
    if (refuses || saysNoReply) {
      const sd_bus_error error = SD_BUS_ERROR_MAKE_CONST(
          saysNoReply ? wire::kErrorNoReply : wire::kErrorInvalidArguments, "because of the test");
      sd_bus_message_new_method_error(call, &reply, &error);
    } else {
      sd_bus_message_new_method_return(call, &reply);
      if (answersNonsense) {
        sd_bus_message_append(reply, "s", "nonsense");
      } else {
        writeAnswer(reply, member, calls);
      }
    }
  }
  record(std::move(calls));
  if (reply != nullptr) sd_bus_send(sd_bus_message_get_bus(call), reply, nullptr);
  sd_bus_message_unref(reply);
  return 1;
}

void TestDaemon::accept() {
  UniqueFd socket(::accept4(listener_.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
  if (!socket || closesAtOnce) return;
  sd_id128_t id{};
  sd_id128_randomize(&id);
  sd_bus* bus = nullptr;
  require(sd_bus_new(&bus) >= 0, "bus");
  Peer& peer = peers_.emplace_back();
  peer.bus.reset(bus);
  sd_bus_set_fd(bus, socket.get(), socket.get());
  socket.release();
  sd_bus_set_server(bus, 1, id);
  sd_bus_negotiate_fds(bus, 1);
  sd_bus_add_filter(
      bus, nullptr,
      [](sd_bus_message* call, void* self, sd_bus_error*) {
        return static_cast<TestDaemon*>(self)->handle(call);
      },
      this);
  peer.isGone = sd_bus_start(bus) < 0;
}

void TestDaemon::serve(Peer& peer) {
  while (!peer.isGone && !stopsReading) {
    const int result = sd_bus_process(peer.bus.get(), nullptr);
    peer.isGone = result < 0 || sd_bus_is_open(peer.bus.get()) <= 0;
    if (result <= 0) return;
  }
}

void TestDaemon::runTasks() {
  std::vector<std::function<void()>> tasks;
  {
    const std::lock_guard lock(mutex_);
    tasks.swap(tasks_);
  }
  for (const auto& task : tasks) task();
}

void TestDaemon::run() {
  while (true) {
    for (Peer& peer : peers_) serve(peer);
    peers_.remove_if([](const Peer& peer) { return peer.isGone; });
    std::vector<pollfd> polled{{wake_.get(), POLLIN, 0}, {stopsAccepting ? -1 : listener_.get(), POLLIN, 0}};
    for (const Peer& peer : peers_) {
      const int events = sd_bus_get_events(peer.bus.get());
      polled.push_back({stopsReading ? -1 : sd_bus_get_fd(peer.bus.get()),
                        static_cast<short>(events < 0 ? POLLIN : events), 0});
    }
    {
      const std::lock_guard lock(mutex_);
      if (isEnding_) return;
      connections_ = peers_.size();
    }
    ::poll(polled.data(), polled.size(), -1);
    if (polled[0].revents != 0) {
      uint64_t count = 0;
      [[maybe_unused]] const ssize_t got = ::read(wake_.get(), &count, sizeof count);
      runTasks();
    }
    if (polled[1].revents != 0 && listener_) accept();
  }
}

}  // namespace tarnel::test
