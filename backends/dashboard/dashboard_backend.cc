#include "backends/dashboard/dashboard_backend.h"

#include <algorithm>
#include <new>
#include <utility>

#include "backends/https/profile_reader.h"
#include "util/socket_address.h"

// How a dashboard backend begins and what it does on its session's thread.

namespace tarnel {
namespace {

using std::chrono::milliseconds;

constexpr milliseconds kDefaultPeriod{500};
// A timer needs a period, and one of days would be none.
constexpr milliseconds kShortestPeriod{1};
constexpr milliseconds kLongestPeriod{3600000};
constexpr milliseconds kTimerLeeway{100};

// Any value asks for reliable delivery, whatever its kind; only one with a number says how often.
milliseconds periodFrom(Log& log, const std::string& name, const Value& reliable) {
  if (!reliable.hasInteger()) {
    TARNEL_LOG(log, warning,
               "DashboardBackend(initWithName): %s: reliable is no number: delivery is reliable, and its "
               "period %lld ms",
               name.c_str(), static_cast<long long>(kDefaultPeriod.count()));
    return kDefaultPeriod;
  }
  const auto* large = reliable.unsignedInteger();
  const int64_t wanted =
      large == nullptr ? reliable.int64Value() : static_cast<int64_t>(std::min<uint64_t>(*large, INT64_MAX));
  const int64_t period = std::clamp(wanted, kShortestPeriod.count(), kLongestPeriod.count());
  if (period != wanted) {
    TARNEL_LOG(log, warning,
               "DashboardBackend(initWithName): %s: reliable is %lld ms, which no timer takes, and counts as "
               "%lld ms",
               name.c_str(), static_cast<long long>(wanted), static_cast<long long>(period));
  }
  return milliseconds(period);
}

// Of any kind: what has no number is 0.
uint16_t portFrom(Log& log, const std::string& name, const Value& port) {
  if (!port.hasInteger()) {
    TARNEL_LOG(log, warning, "DashboardBackend(initWithName): %s: port is no number and counts as 0",
               name.c_str());
  }
  return port.uint16Value();
}

MaybeString copied(const std::string* text) {
  return text == nullptr ? MaybeString() : MaybeString(*text);
}

}  // namespace

// What a profile says about its server.
struct DashboardBackend::Server {
  std::string ip;
  uint16_t port = 0;
  MaybeString displayURL;
  MaybeString postURL;
  std::optional<milliseconds> reliable;
};

std::shared_ptr<DashboardBackend> DashboardBackend::initWithName(const Dependencies& dependencies,
                                                                 const std::string& name,
                                                                 const MaybeDictionary& profile,
                                                                 const MaybeString& productFamily) {
  const auto* ip = profile ? findString(*profile, "ip") : nullptr;
  const auto* port = profile ? profile->find("port") : nullptr;
  return initWithName(dependencies, name, profile, copied(ip), port == nullptr ? 0 : port->uint16Value(),
                      productFamily);
}

std::shared_ptr<DashboardBackend> DashboardBackend::initWithName(const Dependencies& dependencies,
                                                                 const std::string& name,
                                                                 const MaybeString& serverIP,
                                                                 uint16_t serverPort,
                                                                 const MaybeString& productFamily) {
  if (!serverIP) return nullptr;
  return initWithName(dependencies, name, MaybeDictionary(), serverIP, serverPort, productFamily);
}

std::shared_ptr<DashboardBackend> DashboardBackend::initWithName(
    const Dependencies& dependencies, const std::string& name, const MaybeDictionary& profile,
    const MaybeString& serverIP, uint16_t serverPort, const MaybeString& productFamily) {
  std::optional<Server> profileServer;
  if (profile) {
    profileServer = serverFromProfile(dependencies, name, *profile);
    if (!profileServer) return nullptr;
  }
  auto socket = dependencies.datagramSockets.create();
  if (!socket) {
    TARNEL_LOG(dependencies.log, error, "DashboardBackend(initWithName): socket() failed (%d)",
               static_cast<int>(socket.error().code()));
    return nullptr;
  }
  auto backend = std::make_shared<DashboardBackend>(Private{}, dependencies, name, profile, productFamily,
                                                    std::move(*socket));
  if (backend->begin(profileServer, serverIP, serverPort)) return backend;
  backend->giveUp();
  return nullptr;
}

std::optional<DashboardBackend::Server> DashboardBackend::serverFromProfile(const Dependencies& dependencies,
                                                                            const std::string& name,
                                                                            const Dictionary& profile) {
  ProfileReader reader(dependencies.log, name, "initWithName", "DashboardBackend");
  const auto section = reader.section(profile);
  const auto* ip = section.findString("ip");
  if (ip == nullptr) {
    TARNEL_LOG(dependencies.log, error, "DashboardBackend(initWithName): can't resolve server IP");
    return std::nullopt;
  }
  const auto* port = profile.find("port");
  if (port == nullptr) {
    TARNEL_LOG(dependencies.log, error, "DashboardBackend(initWithName): can't resolve server port");
    return std::nullopt;
  }
  Server server{.ip = *ip,
                .port = portFrom(dependencies.log, name, *port),
                .displayURL = copied(section.findString("display_url")),
                .postURL = copied(section.findString("post_url")),
                .reliable = std::nullopt};
  if (const auto* reliable = profile.find("reliable")) {
    server.reliable = periodFrom(dependencies.log, name, *reliable);
  }
  return server;
}

DashboardBackend::DashboardBackend(Private, const Dependencies& dependencies, const std::string& name,
                                   const MaybeDictionary& profile, const MaybeString& productFamily,
                                   std::unique_ptr<DatagramSocket> made)
    : TarnelBackend(dependencies, name, profile, productFamily), socket(std::move(made)) {
  socket->suppressBrokenPipeSignal();
}

std::shared_ptr<DashboardBackend> DashboardBackend::self() {
  return std::static_pointer_cast<DashboardBackend>(shared_from_this());
}

bool DashboardBackend::begin(const std::optional<Server>& profileServer, const MaybeString& serverIP,
                             uint16_t serverPort) {
  auto& log = dependencies().log;
  networkProcQueue = dependencies().workQueues.makeQueue("com.orvane.Tarnel.networkProc");
  if (networkProcQueue == nullptr) {
    TARNEL_LOG(log, error, "DashboardBackend(initWithName): can't create work queue.");
    return false;
  }
  if (profileServer) {
    usingProfile = true;
    setDisplayURL(profileServer->displayURL);
    postURL = profileServer->postURL;
    if (profileServer->reliable) useReliableUDP();
    return connectAndStartTimer(socketAddress(profileServer->ip, profileServer->port),
                                profileServer->reliable.value_or(kDefaultPeriod));
  }
  if (!serverIP) {
    TARNEL_LOG(log, error, "DashboardBackend(initWithName): initWitName with all null params.");
    return false;
  }
  useReliableUDP();
  return connectAndStartTimer(socketAddress(*serverIP, serverPort), kDefaultPeriod);
}

bool DashboardBackend::connectAndStartTimer(const Ipv4Address& address, std::chrono::nanoseconds period) {
  auto& log = dependencies().log;
  if (socket->connectTo(address) != 0) {
    TARNEL_LOG(log, error, "DashboardBackend(initWithName): socket connect() failed.");
    return false;
  }
  timer = networkProcQueue->makeTimer(period, kTimerLeeway);
  if (timer == nullptr) {
    TARNEL_LOG(log, error, "DashboardBackend(initWithName): can't create timer source.");
    return false;
  }
  startReading();
  timer->start([backend = self()] { backend->myPeriodicTask(); },
               [backend = self()] {
                 if (!backend->reliableUDP) backend->closeSocket();
               });
  return true;
}

// Gives back what a failed initializer took. A descriptor with a source is closed by the source's cancel
// handler, which only a started one has.
void DashboardBackend::giveUp() {
  if (readSource == nullptr) return closeSocket();
  startReading();
  readSource->cancel();
}

void DashboardBackend::closeSocket() {
  socket->close();
}

MaybeString DashboardBackend::sendMessage(const MaybeDictionary& payload, const TimeValue& timestamp,
                                          Method method, RespCode respCode, EventID eventID) {
  auto& log = dependencies().log;
  std::unique_ptr<DashboardBuffer> buffer;
  try {
    buffer = std::make_unique<DashboardBuffer>();
  } catch (const std::bad_alloc&) {
    TARNEL_LOG(log, error, "DashboardBackend(sendMessage): can't malloc.");
    return std::nullopt;
  }
  const DashboardHeader header{.selfVersionMajor = selfVersionMajor(),
                               .compType = compType(),
                               .timestamp = timestamp,
                               .sessionID = sessionID(),
                               .clientVersion = clientVersion(),
                               .method = method,
                               .respCode = respCode,
                               .udid = udid(),
                               .eventID = eventID,
                               .isReliable = reliableUDP,
                               .isServerFromProfile = usingProfile};
  const size_t length =
      writeDashboardDatagram(header, payload ? dashboardText(*payload) : std::string(), *buffer);
  auto line = writeLocalLog({buffer->data(), length});
  if (handedOver.fetch_add(1) >= kMaxHandedOver) {
    handedOver.fetch_sub(1);
    if (!isDropping.exchange(true)) {
      TARNEL_LOG(log, warning,
                 "DashboardBackend(sendMessage): %s: %u datagrams wait for the work queue; more are dropped",
                 name().c_str(), kMaxHandedOver);
    }
    return line;
  }
  isDropping.store(false);
  networkProcQueue->async([backend = self(), bytes = std::move(buffer), length, eventID] {
    backend->handedOver.fetch_sub(1);
    backend->tryToSendMsg(*bytes, length, eventID);
  });
  return line;
}

void DashboardBackend::cleanup() {
  networkProcQueue->async([backend = self()] {
    if (backend->messageQueue.empty()) {
      backend->cleanupSources();
    } else {
      backend->cleanupState = CleanupState::requested;
    }
  });
}

}  // namespace tarnel
