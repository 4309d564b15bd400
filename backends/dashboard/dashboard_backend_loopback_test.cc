#include <arpa/inet.h>
#include <poll.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <functional>
#include <map>
#include <set>

#include "backends/dashboard/dashboard_backend_fixture.h"
#include "base/unique_fd.h"
#include "platform/linux/queues/asio_work_queues.h"
#include "platform/linux/queues/udp_sockets.h"
#include "testing/waiting.h"

// Delivery over real UDP, through a network that loses, repeats, delays and reorders.

namespace tarnel {
namespace {

using fake::Datagram;

// A socket on the loopback interface.
class Peer {
 public:
  Peer() : fd_(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)) {
    const int room = 1 << 20;
    ::setsockopt(fd_.get(), SOL_SOCKET, SO_RCVBUF, &room, sizeof room);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    EXPECT_EQ(::bind(fd_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  }
  int fd() const { return fd_.get(); }
  uint16_t port() const {
    sockaddr_in address{};
    socklen_t length = sizeof address;
    ::getsockname(fd_.get(), reinterpret_cast<sockaddr*>(&address), &length);
    return ntohs(address.sin_port);
  }
  // The next datagram; nothing when there is none. Whoever sent it is answered from now on.
  std::optional<Datagram> receive() {
    Datagram datagram(2048);
    socklen_t length = sizeof from_;
    const auto size = ::recvfrom(fd_.get(), datagram.data(), datagram.size(), 0,
                                 reinterpret_cast<sockaddr*>(&from_), &length);
    if (size < 0) return std::nullopt;
    datagram.resize(static_cast<size_t>(size));
    return datagram;
  }
  void answer(const Datagram& datagram) {
    EXPECT_EQ(::sendto(fd_.get(), datagram.data(), datagram.size(), 0, reinterpret_cast<sockaddr*>(&from_),
                       sizeof from_),
              static_cast<ssize_t>(datagram.size()));
  }

 private:
  UniqueFd fd_;
  sockaddr_in from_{};
};

uint16_t eventOf(const Datagram& datagram) {
  return static_cast<uint16_t>(datagram.at(60) << 8U | datagram.at(61));
}

// One direction of a bad network. What happens to a datagram depends on its event and on how often the event
// came by: no test run differs from another.
class BadNetwork {
 public:
  BadNetwork(std::function<int(uint16_t event)> losses, std::function<void(const Datagram&)> deliver)
      : losses_(std::move(losses)), deliver_(std::move(deliver)) {}

  void pass(const Datagram& datagram) {
    const uint16_t event = eventOf(datagram);
    const int earlier = seen_[event]++;
    if (earlier < losses_(event)) {
      ++done_.lost;
      return;
    }
    if (event % 4 == 1) {
      held_.push_back(datagram);
      ++done_.delayed;
    } else {
      deliver_(datagram);
    }
    if (event % 3 == 0) {
      deliver_(datagram);
      ++done_.repeated;
    }
    if (held_.size() >= 5) release();
  }
  // The delayed ones, the last first.
  void release() {
    if (held_.size() > 1) ++done_.reordered;
    std::for_each(held_.rbegin(), held_.rend(), deliver_);
    held_.clear();
  }
  int passes(uint16_t event) { return seen_[event]; }
  // It was as bad as it should be, or the test shows nothing.
  void expectBad() const {
    EXPECT_GT(done_.lost, 0);
    EXPECT_GT(done_.repeated, 0);
    EXPECT_GT(done_.delayed, 0);
    EXPECT_GT(done_.reordered, 0);
  }

 private:
  std::function<int(uint16_t)> losses_;
  std::function<void(const Datagram&)> deliver_;
  std::map<uint16_t, int> seen_;
  std::vector<Datagram> held_;
  struct {
    int lost = 0, repeated = 0, delayed = 0, reordered = 0;
  } done_;
};

class DashboardBackendLoopbackTest : public DashboardBackendFixture {
 protected:
  DashboardBackendLoopbackTest() {
    world.workQueues.real = &queues;
    world.datagramSockets.real = &sockets;
  }

  std::shared_ptr<DashboardBackend> makeReliable(int period) {
    return make(Dictionary{{"ip", "127.0.0.1"}, {"port", peer.port()}, {"reliable", period}});
  }
  // Takes what arrives until `isDone`; `idle` runs when nothing arrives for a while.
  void pump(const std::function<void(const Datagram&)>& arrived, const std::function<void()>& idle,
            const std::function<bool()>& isDone) {
    constexpr int kQuiet = 5;
    const test::Deadline deadline;
    while (!isDone()) {
      ASSERT_FALSE(deadline.passed());
      pollfd wait{peer.fd(), POLLIN, 0};
      if (::poll(&wait, 1, kQuiet) == 0) idle();
      while (const auto datagram = peer.receive()) arrived(*datagram);
    }
  }

  AsioWorkQueues queues{world.log};
  UdpSockets sockets;
  Peer peer;
};

TEST_F(DashboardBackendLoopbackTest, EverythingArrivesThroughABadNetworkAndIsAcknowledged) {
  constexpr uint16_t kEvents = 40;
  std::map<uint16_t, std::string> lines;               // as sent
  std::map<uint16_t, std::set<std::string>> arrivals;  // as they arrived
  std::vector<uint16_t> order;
  std::set<uint16_t> acknowledged;
  // Together fewer losses than there are sendings.
  BadNetwork back([](uint16_t event) { return event / 3 % 2; },
                  [&](const Datagram& datagram) {
                    acknowledged.insert(eventOf(datagram));
                    peer.answer(datagram);
                  });
  BadNetwork there([](uint16_t event) { return event % 3; },
                   [&](const Datagram& datagram) {
                     arrivals[eventOf(datagram)].insert(writeLocalLog(datagram));
                     order.push_back(eventOf(datagram));
                     // A server's acknowledgement: only the event number counts.
                     Datagram answer(62, 0);
                     std::copy_n(datagram.begin() + 60, 2, answer.begin() + 60);
                     back.pass(answer);
                   });
  auto backend = makeReliable(50);
  ASSERT_NE(backend, nullptr);
  for (uint16_t event = 1; event <= kEvents; ++event) {
    lines[event] = *send(*backend, event, Dictionary{{"number", event}, {"text", std::string(event, 'x')}});
  }
  pump([&](const Datagram& datagram) { there.pass(datagram); },
       [&] {
         there.release();
         back.release();
       },
       [&] { return acknowledged.size() == kEvents; });
  const std::weak_ptr<DashboardBackend> weak = backend;
  backend->cleanup();
  backend.reset();
  pump([&](const Datagram& datagram) { there.pass(datagram); }, [] {}, [&] { return weak.expired(); });

  there.expectBad();
  back.expectBad();
  ASSERT_EQ(arrivals.size(), kEvents);
  int givenUp = 0;
  for (uint16_t event = 1; event <= kEvents; ++event) {
    EXPECT_EQ(arrivals[event], std::set<std::string>{lines[event]});
    // What the network repeats, the server acknowledges twice.
    const int lostAnswers = event % 3 == 0 ? 0 : event / 3 % 2;
    EXPECT_GE(there.passes(event), event % 3 + lostAnswers + 1);
    EXPECT_LE(there.passes(event), 5);
    if (there.passes(event) == 5) ++givenUp;
  }
  EXPECT_LT(givenUp, kEvents);  // acknowledgements end retransmission
  EXPECT_GT(order.size(), kEvents);
  EXPECT_FALSE(std::is_sorted(order.begin(), order.end()));
  EXPECT_EQ(queues.sourcesUnderWay(), 0U);
}

TEST_F(DashboardBackendLoopbackTest, SilentServerGetsEveryDatagramFiveTimes) {
  constexpr uint16_t kEvents = 20;
  std::map<uint16_t, int> arrivals;
  auto backend = makeReliable(5);
  ASSERT_NE(backend, nullptr);
  for (uint16_t event = 1; event <= kEvents; ++event) send(*backend, event);
  const std::weak_ptr<DashboardBackend> weak = backend;
  backend->cleanup();
  backend.reset();
  const auto arrived = [&arrivals](const Datagram& datagram) { ++arrivals[eventOf(datagram)]; };
  pump(
      arrived, [] {}, [&] { return weak.expired(); });
  while (const auto datagram = peer.receive()) arrived(*datagram);
  ASSERT_EQ(arrivals.size(), kEvents);
  for (const auto& [event, times] : arrivals) EXPECT_EQ(times, 5) << event;
  EXPECT_EQ(queues.sourcesUnderWay(), 0U);
}

TEST_F(DashboardBackendLoopbackTest, HostileAnswersChangeNothing) {
  auto backend = makeReliable(5);
  ASSERT_NE(backend, nullptr);
  send(*backend, 0);
  std::optional<Datagram> first;
  pump([&first](const Datagram& datagram) { first = datagram; }, [] {},
       [&first] { return first.has_value(); });
  for (size_t size = 0; size < 62; ++size) peer.answer(Datagram(size, 0));
  for (int event = 1; event < 200; ++event) {
    Datagram answer(60000, 0xFF);
    answer[60] = 0;
    answer[61] = static_cast<uint8_t>(event);
    peer.answer(answer);
  }
  const std::weak_ptr<DashboardBackend> weak = backend;
  backend->cleanup();
  backend.reset();
  int arrivals = 1;
  pump([&arrivals](const Datagram&) { ++arrivals; }, [] {}, [&] { return weak.expired(); });
  while (peer.receive()) ++arrivals;
  EXPECT_EQ(arrivals, 5);
}

TEST_F(DashboardBackendLoopbackTest, UnreliableDatagramsAreSentOnce) {
  auto backend = make(Dictionary{{"ip", "127.0.0.1"}, {"port", peer.port()}});
  ASSERT_NE(backend, nullptr);
  for (uint16_t event = 1; event <= 20; ++event) send(*backend, event);
  const std::weak_ptr<DashboardBackend> weak = backend;
  backend->cleanup();
  backend.reset();
  std::vector<uint16_t> order;
  const auto arrived = [&order](const Datagram& datagram) { order.push_back(eventOf(datagram)); };
  pump(
      arrived, [] {}, [&] { return weak.expired(); });
  while (const auto datagram = peer.receive()) arrived(*datagram);
  ASSERT_EQ(order.size(), 20U);
  EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST_F(DashboardBackendLoopbackTest, ServerThatIsGoneHoldsNothingUp) {
  uint16_t port = 0;
  {
    const Peer gone;
    port = gone.port();
  }
  auto backend = make(Dictionary{{"ip", "127.0.0.1"}, {"port", port}, {"reliable", 2}});
  ASSERT_NE(backend, nullptr);
  for (uint16_t event = 1; event <= 5; ++event) send(*backend, event);
  const std::weak_ptr<DashboardBackend> weak = backend;
  backend->cleanup();
  backend.reset();
  pump([](const Datagram&) {}, [] {}, [&] { return weak.expired(); });
  EXPECT_EQ(queues.sourcesUnderWay(), 0U);
}

}  // namespace
}  // namespace tarnel
