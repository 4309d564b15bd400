#include "client/src/connection.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string_view>
#include <utility>

#include "client/src/options.h"
#include "client/src/request_codec.h"
#include "ipc/dbus/dbus_codec.h"
#include "ipc/protocol/wire.h"

namespace tarnel::core {
namespace {

// Messages handled before the caller's side gets a turn again.
constexpr int kRoundsPerTurn = 64;
// A day. How long an upload takes is the network's business; the daemon ends those that make no progress.
constexpr uint64_t kUploadTimeoutMicroseconds = uint64_t{86'400} * 1'000'000;

Outcome lost() {
  return failure(TARNEL_ERROR_INTERRUPTED,
                 "the connection to the daemon was lost: reconnect and configure the session again");
}

// Uploads travel alone.
bool isUpload(const std::vector<Request>& requests) {
  const auto kind = requests.front().kind;
  return kind == Request::Kind::uploadFile || kind == Request::Kind::uploadLogData;
}

bool isDisconnect(int error) {
  return error == ECONNRESET || error == EPIPE || error == ENOTCONN || error == ECONNABORTED ||
         error == ESHUTDOWN || error == ECONNREFUSED;
}

}  // namespace

Dialled dial(const std::string& path) {
  Dialled dialled;
  dialled.socket = UniqueFd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!dialled.socket) {
    dialled.outcome =
        failure(TARNEL_ERROR_SYSTEM, std::string("no socket could be opened: ") + strerrordesc_np(errno));
    return dialled;
  }
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  if (::connect(dialled.socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) {
    return dialled;
  }
  const int error = errno;
  if (error == EAGAIN || error == EINTR || error == EINPROGRESS) {
    dialled.isBusy = true;
  } else if (error == ENOENT || error == ECONNREFUSED || error == ENOTDIR) {
    const char* remedy = path == kDefaultSocketPath
                             ? ": start it with systemctl start tarneld"
                             : ": start the daemon of that instance, or name another socket (TARNEL_SOCKET)";
    dialled.outcome = failure(TARNEL_ERROR_NO_DAEMON, "no daemon is listening at " + path + remedy);
  } else if (error == EACCES || error == EPERM) {
    dialled.isRefused = true;
    dialled.outcome = failure(TARNEL_ERROR_REFUSED, "this user may not connect to " + path + ": " +
                                                        strerrordesc_np(error) + " (see tarneld.conf(5))");
  } else {
    dialled.outcome =
        failure(TARNEL_ERROR_SYSTEM, "cannot connect to " + path + ": " + strerrordesc_np(error));
  }
  return dialled;
}

void Connection::BusCloser::operator()(sd_bus* bus) const noexcept {
  sd_bus_close_unref(bus);
}

Connection::Connection(Host& host, std::chrono::milliseconds replyTimeout)
    : host_(host), replyTimeoutMicroseconds_(static_cast<uint64_t>(replyTimeout.count()) * 1000) {}

Connection::~Connection() = default;

Outcome Connection::start(UniqueFd socket) {
  static const sd_bus_vtable kVtable[] = {
      SD_BUS_VTABLE_START(0),
      SD_BUS_METHOD(
          wire::kSendMessageToClient.name, wire::kSendMessageToClient.arguments,
          wire::kSendMessageToClient.result,
          [](sd_bus_message* message, void* self, sd_bus_error* error) {
            return onAggregated(message, self, error);
          },
          SD_BUS_VTABLE_UNPRIVILEGED),
      SD_BUS_METHOD(
          wire::kDeleteFile.name, wire::kDeleteFile.arguments, wire::kDeleteFile.result,
          [](sd_bus_message* message, void* self, sd_bus_error* error) {
            return onDeleteFile(message, self, error);
          },
          SD_BUS_VTABLE_UNPRIVILEGED),
      SD_BUS_VTABLE_END,
  };
  sd_bus* bus = nullptr;
  int result = sd_bus_new(&bus);
  if (result >= 0) {
    bus_.reset(bus);
    result = sd_bus_set_fd(bus, socket.get(), socket.get());
  }
  if (result >= 0) {
    socket.release();
    result = sd_bus_negotiate_fds(bus, 1);
  }
  if (result >= 0) {
    result = sd_bus_add_object_vtable(bus, nullptr, wire::kReplyPath, wire::kReplyInterface, kVtable, this);
  }
  if (result >= 0) result = sd_bus_start(bus);
  if (result >= 0 || isDisconnect(-result)) return {};  // process() will find it
  return failure(TARNEL_ERROR_SYSTEM,
                 std::string("no connection could be made: ") + strerrordesc_np(-result));
}

Outcome Connection::process() {
  hasMoreInput_ = false;
  for (int round = 0; round < kRoundsPerTurn; ++round) {
    const int result = sd_bus_process(bus_.get(), nullptr);
    if (result < 0 && !isDisconnect(-result)) {
      return failure(TARNEL_ERROR_PROTOCOL, std::string("what listens at the socket broke the protocol: ") +
                                                strerrordesc_np(-result));
    }
    if (result < 0 || sd_bus_is_open(bus_.get()) <= 0) return lost();
    if (result == 0) return {};
  }
  hasMoreInput_ = true;
  return {};
}

bool Connection::isReady() const {
  return sd_bus_is_ready(bus_.get()) > 0;
}

bool Connection::canSend() const {
  return isReady() && (events() & POLLOUT) == 0;
}

Outcome Connection::send(std::vector<Request> requests) {
  BusMessage message;
  const auto encoded = makeCall(bus_.get(), requests, message);
  if (encoded.ok()) return transmit(std::move(requests), std::move(message));
  if (requests.size() == 1) {
    host_.answered(requests.front(), Answer{encoded, {}, {}, false, {}});
    return {};
  }
  // One that cannot be encoded must not take the others with it.
  for (Request& request : requests) {
    std::vector<Request> alone;
    alone.push_back(std::move(request));
    if (auto outcome = send(std::move(alone)); !outcome.ok()) return outcome;
  }
  return {};
}

Outcome Connection::transmit(std::vector<Request> requests, BusMessage message) {
  // An upload is known until it is answered: meanwhile the daemon may ask for the file's deletion, and calls
  // behind it have to wait.
  const bool wantsReply =
      isUpload(requests) || requests.front().kind == Request::Kind::barrier ||
      std::any_of(requests.begin(), requests.end(), [](const Request& r) { return bool(r.completion); });
  const uint64_t sequence = ++lastSequence_;
  int result = 0;
  if (!wantsReply) {
    sd_bus_message_set_expect_reply(message.get(), 0);
    lastUnconfirmed_ = sequence;
    result = sd_bus_send(bus_.get(), message.get(), nullptr);
  } else {
    for (Request& request : requests) {  // encoded: only what the answer needs is kept
      request.sessionInfo.reset();
      request.userInfo.reset();
      request.dictionary.reset();
      request.array.reset();
    }
    unanswered_ += requests.size();
    if (isUpload(requests)) ++uploads_;
    Call& call = calls_.emplace_back(Call{this, sequence, std::move(requests), false, {}});
    call.self = std::prev(calls_.end());
    result = sd_bus_call_async(
        bus_.get(), nullptr, message.get(),
        [](sd_bus_message* reply, void* held, sd_bus_error* error) { return onReply(reply, held, error); },
        &call, uploads_ > 0 ? kUploadTimeoutMicroseconds : replyTimeoutMicroseconds_);
  }
  return result < 0 ? lost() : Outcome{};
}

std::vector<Request> Connection::takeUnanswered() {
  std::vector<Request> requests;
  requests.reserve(unanswered_);
  for (Call& call : calls_) {
    std::move(call.requests.begin(), call.requests.end(), std::back_inserter(requests));
  }
  bus_.reset();  // it still refers to the calls
  calls_.clear();
  unanswered_ = 0;
  uploads_ = 0;
  return requests;
}

int Connection::descriptor() const {
  return sd_bus_get_fd(bus_.get());
}

short Connection::events() const {
  const int events = sd_bus_get_events(bus_.get());
  return events < 0 ? short{POLLIN} : static_cast<short>(events);
}

uint64_t Connection::dueAt() const {
  if (hasMoreInput_) return 0;
  uint64_t due = UINT64_MAX;
  return sd_bus_get_timeout(bus_.get(), &due) < 0 ? UINT64_MAX : due;
}

int Connection::onReply(sd_bus_message* reply, void* held, void*) noexcept {
  auto& call = *static_cast<Call*>(held);
  call.connection->handleReply(call, reply);
  return 1;
}

void Connection::handleReply(Call& call, sd_bus_message* reply) {
  lastConfirmed_ = std::max(lastConfirmed_, call.sequence);
  if (call.requests.front().kind == Request::Kind::barrier && call.self != calls_.begin()) {
    call.isAnswered = true;
    return;
  }
  std::vector<Answer> answers = readAnswers(reply, call.requests);
  std::vector<Request> requests = std::move(call.requests);
  unanswered_ -= requests.size();
  if (isUpload(requests)) --uploads_;
  calls_.erase(call.self);
  for (size_t i = 0; i < requests.size(); ++i) host_.answered(requests[i], answers[i]);
  passBarriers();
}

void Connection::passBarriers() {
  while (!calls_.empty() && calls_.front().isAnswered) {
    std::vector<Request> requests = std::move(calls_.front().requests);
    unanswered_ -= requests.size();
    calls_.pop_front();
    for (Request& request : requests) host_.answered(request, Answer());
  }
}

// The daemon can only name a file that it was given and has not answered for.
int Connection::onDeleteFile(sd_bus_message* message, void* self, void*) noexcept {
  const char* fileURL = nullptr;
  const int result = sd_bus_message_read(message, "s", &fileURL);
  if (result < 0) return result;
  for (Call& call : static_cast<Connection*>(self)->calls_) {
    auto& file = call.requests.front().file;
    if (file == nullptr || file->fileURL() != fileURL) continue;
    file->deleteIfSame();
    break;
  }
  return sd_bus_reply_method_return(message, "");
}

int Connection::onAggregated(sd_bus_message* message, void* self, void*) noexcept {
  double timestamp = 0;
  uint16_t category = 0;
  uint16_t type = 0;
  auto messageInfo = wire::readMaybeDictionary(message);
  if (!messageInfo) return -EINVAL;
  const int result = sd_bus_message_read(message, "dqq", &timestamp, &category, &type);
  if (result < 0) return result;
  auto payload = wire::readMaybeDictionary(message);
  if (!payload) return -EINVAL;
  static_cast<Connection*>(self)->host_.aggregated(*messageInfo, timestamp, category, type, *payload);
  return sd_bus_reply_method_return(message, "");
}

}  // namespace tarnel::core
