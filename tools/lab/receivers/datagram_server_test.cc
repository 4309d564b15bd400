// A lab's UDP socket, on loopback.
#include "tools/lab/receivers/datagram_server.h"

#include <arpa/inet.h>
#include <gmock/gmock.h>
#include <poll.h>
#include <sys/socket.h>

#include <future>

#include "base/unique_fd.h"
#include "platform/fake/fake_clock.h"
#include "tools/lab/options.h"
#include "tools/receiving/test_datagram.h"

namespace tarnel::lab {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;

constexpr int kDeadlineMilliseconds = 60'000;

// A socket that talks to one port.
class Sender {
 public:
  explicit Sender(uint16_t port) : socket_(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(port);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    EXPECT_EQ(::connect(socket_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  }
  void send(const Bytes& bytes) const {
    EXPECT_EQ(::send(socket_.get(), bytes.data(), bytes.size(), 0), static_cast<ssize_t>(bytes.size()));
  }
  Bytes receive() const {
    pollfd entry{.fd = socket_.get(), .events = POLLIN, .revents = 0};
    EXPECT_EQ(::poll(&entry, 1, kDeadlineMilliseconds), 1) << "no answer came";
    Bytes bytes(2048);
    const ssize_t size = ::recv(socket_.get(), bytes.data(), bytes.size(), MSG_DONTWAIT);
    bytes.resize(size < 0 ? 0 : static_cast<size_t>(size));
    return bytes;
  }

 private:
  UniqueFd socket_;
};

// As a disk that does not answer.
class StoppedObserver final : public ArrivalObserver {
 public:
  void arrived(const Arrival&) override {}
  void datagramArrived(const DatagramArrival&) override { goOn_.get_future().wait(); }
  void goOn() { goOn_.set_value(); }

 private:
  std::promise<void> goOn_;
};

class FirstWarning final : public Notices {
 public:
  void storebagServed(const ServedStorebag&) override {}
  void warning(const std::string& told) override { text.set_value(told); }
  std::promise<std::string> text;
};

class DatagramServerTest : public ::testing::Test, public Notices {
 protected:
  DatagramServerTest() {
    Result<ListeningSocket> socket = receiveOn("127.0.0.1", 0, "--datagram-port");
    EXPECT_TRUE(socket);
    port_ = socket->port;
    server_ = DatagramServer::start(*std::move(socket), receiver_, *this);
  }
  void storebagServed(const ServedStorebag&) override {}
  void warning(const std::string&) override {}

  ArrivalStore store_{100};
  DatagramFaults faults_;
  fake::FakeClock clock_;
  DatagramReceiver receiver_{store_, faults_, *this, clock_};
  uint16_t port_ = 0;
  std::unique_ptr<DatagramServer> server_;
};

TEST_F(DatagramServerTest, WhoAsksForItIsAcknowledged) {
  const Sender sender(port_);
  const Bytes bytes = sampleDatagram(" a=1");
  sender.send(bytes);
  EXPECT_EQ(sender.receive(), acknowledgementOf(bytes));
  EXPECT_EQ(store_.lastDatagrams(1).at(0).content->text, " a=1");
  EXPECT_THAT(store_.lastDatagrams(1).at(0).sender, HasSubstr("127.0.0.1:"));
}

TEST_F(DatagramServerTest, TheAcknowledgementWaitsForNoObserver) {
  StoppedObserver observer;
  store_.addObserver(observer);
  const Sender sender(port_);
  const Bytes bytes = sampleDatagram(" a=1");
  sender.send(bytes);
  EXPECT_EQ(sender.receive(), acknowledgementOf(bytes));
  observer.goOn();
  EXPECT_EQ(store_.counts().acknowledged, 1U);
  server_->stop();
}

TEST_F(DatagramServerTest, SizesOfEveryKindAreSurvived) {
  const Sender sender(port_);
  for (const size_t size : {0, 1, 63, 1087, 1088, 1089, 60'000}) sender.send(Bytes(size, 0xFF));
  // Datagrams of one sender stay in order on the loopback interface.
  const Bytes last = sampleDatagram("");
  sender.send(last);
  EXPECT_EQ(sender.receive(), acknowledgementOf(last));
  std::vector<uint64_t> sizes;
  std::vector<size_t> kept;
  for (const DatagramArrival& arrival : store_.lastDatagrams(100)) {
    sizes.push_back(arrival.size);
    kept.push_back(arrival.bytes.size());
  }
  EXPECT_THAT(sizes, ElementsAre(0, 1, 63, 1087, 1088, 1089, 60'000, 64));
  EXPECT_THAT(kept, ElementsAre(0, 1, 63, 1087, 1088, 1088, 1088, 64));
}

TEST_F(DatagramServerTest, EndsWhenToldAndStaysEnded) {
  const Sender sender(port_);
  sender.send(sampleDatagram(" a=1"));
  server_->stop();
  EXPECT_EQ(store_.counts().datagrams, 1U) << "what came before is read";
  server_->stop();
}

TEST_F(DatagramServerTest, ASocketThatFailsForGoodIsGivenUpWithAWarning) {
  // Not connected: it always has something to tell, and never anything to read.
  UniqueFd unusable(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  FirstWarning warning;
  const auto server = DatagramServer::start({.socket = std::move(unusable)}, receiver_, warning);
  auto text = warning.text.get_future();
  ASSERT_EQ(text.wait_for(std::chrono::milliseconds(kDeadlineMilliseconds)), std::future_status::ready);
  EXPECT_EQ(text.get(),
            "cannot receive datagrams any more: Transport endpoint is not connected; start the lab again");
}

TEST(DatagramListenerTest, AddressesAndPortsInUseAreNamed) {
  const auto first = receiveOn("127.0.0.1", 0, "--datagram-port");
  ASSERT_TRUE(first);
  EXPECT_THAT(receiveOn("127.0.0.1", first->port, "--datagram-port").error().localizedDescription(),
              HasSubstr("end the other program, or choose another port with --datagram-port"));
  EXPECT_EQ(ipv4Address("127.0.0.2"), "127.0.0.2");
  EXPECT_EQ(ipv4Address("::1"), "127.0.0.1");
  EXPECT_EQ(ipv4Address("::"), "0.0.0.0");
  EXPECT_TRUE(receiveOn("::1", 0, "--datagram-port"));
}

TEST(DatagramListenerTest, ThePortFollowsTheHttpsPortUnlessItIsChosen) {
  LabOptions options;
  EXPECT_EQ(effectiveDatagramPort(options), 8445);
  options.port = 9000;
  EXPECT_EQ(effectiveDatagramPort(options), 8445);
  options.port = 0;
  EXPECT_EQ(effectiveDatagramPort(options), 0) << "tests and demos share a machine";
  options.datagramPort = 7000;
  EXPECT_EQ(effectiveDatagramPort(options), 7000);
  options.port = 8443;
  options.datagramPort = 0;
  EXPECT_EQ(effectiveDatagramPort(options), 0);
}

}  // namespace
}  // namespace tarnel::lab
