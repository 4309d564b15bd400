#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/resource.h>
#include <sys/wait.h>

#include <fstream>

#include "ipc/dbus/dbus_codec.h"
#include "ipc/server/ipc_test_support.h"

// Clients that misbehave: each harms nobody but itself.

namespace tarnel {
namespace {

using ::testing::HasSubstr;

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kMemoryIsMeasurable = false;  // the sanitizers keep freed memory
#else
constexpr bool kMemoryIsMeasurable = true;
#endif

size_t residentBytes() {
  std::ifstream statm("/proc/self/statm");
  size_t total = 0;
  size_t resident = 0;
  statm >> total >> resident;
  return resident * static_cast<size_t>(sysconf(_SC_PAGESIZE));
}

class IpcHostileTest : public ::testing::Test {
 protected:
  void expectOthersAreServed() {
    BusClient client(service.path());
    EXPECT_NE(client.call("StartConfig", ""), nullptr) << client.errorText;
  }
  // Connections that were closed for what begins so.
  size_t closings(const std::string& why) {
    size_t count = 0;
    for (const auto& line : service.log().startingWith("IpcConnection: Closing the connection of ")) {
      if (line.text.find(": " + why) != std::string::npos) ++count;
    }
    return count;
  }
  size_t callsOf(size_t connection) const {
    const auto session = service.session(connection);
    return session == nullptr ? 0 : session->count();
  }

  Service service;
};

TEST_F(IpcHostileTest, GarbageIsClosed) {
  service.start();
  for (const std::string& bytes :
       {std::string(200'000, 'x'), std::string("\0GET / HTTP/1.1\r\n\r\n", 19) + std::string(200'000, '\n'),
        std::string(300'000, '\0')}) {
    const RawClient client(service.path());
    client.write(bytes);
    shutdown(client.fd().get(), SHUT_WR);
    EXPECT_TRUE(isClosedByPeer(client.fd()));
  }
  const RawClient client(service.path());
  client.authenticate();
  client.write(std::string(1000, 'x'));
  EXPECT_TRUE(isClosedByPeer(client.fd()));
  expectOthersAreServed();
}

TEST_F(IpcHostileTest, HalfAHandshakeEndsWithTheClient) {
  service.start();
  {
    const RawClient client(service.path());
    client.write(std::string("\0AUTH", 5));
  }
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 1; }));
  expectOthersAreServed();
}

TEST(IpcHandshakeTest, AHandshakeThatNeverEndsIsDropped) {
  IpcLimits limits;
  limits.authentication = std::chrono::milliseconds(50);
  Service service(limits);
  service.start();
  const RawClient silent(service.path());
  EXPECT_TRUE(isClosedByPeer(silent.fd()));
  const RawClient half(service.path());
  half.write(std::string("\0AUTH ANON", 10));
  EXPECT_TRUE(isClosedByPeer(half.fd()));
  EXPECT_TRUE(service.logged("not authenticated within 50 ms"));
  // One that is through is not held to it.
  BusClient client(service.path());
  EXPECT_NE(client.call("StartConfig", ""), nullptr);
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 2; }));
  EXPECT_NE(client.call("StartConfig", ""), nullptr);
}

TEST_F(IpcHostileTest, CallsInOnePieceWithTheHandshakeAreServed) {
  service.start();
  const RawClient client(service.path());
  EXPECT_TRUE(client.write(std::string("\0AUTH ANONYMOUS 74\r\nBEGIN\r\n", 27) + rawCall("StartConfig") +
                           rawCall("FlushMessages") + rawCall("FinishSession")));
  EXPECT_TRUE(eventually([&] { return service.accepted() == 1 && service.session()->count() == 3; }));
}

// Where the authentication ends must be the same for the one who bounds messages and the one who reads them.
TEST_F(IpcHostileTest, LinesThatOnlySeemToEndTheAuthenticationLetNothingPass) {
  service.start();
  // The header of a large message, in which the calls and the last line hide from the one who bounds.
  const std::string cover = std::string("B\1\0\1\0\x0F\xF0\0\0\0\0\1\0\0\0\0", 16) + "\r\nBEGIN\r\n";
  const std::string authenticated("\0AUTH ANONYMOUS 74\r\n", 20);
  for (const std::string& lines :
       {authenticated + "NOPE\nBEGIN\r\n", authenticated + "\nBEGIN\r\n", authenticated + "X\rBEGIN\r\n",
        authenticated + "NEGOTIATE_UNIX_FD\nBEGIN\r\n"}) {
    const RawClient client(service.path());
    const size_t before = service.invalidations();
    client.write(lines + cover + rawCall("StartConfig") +
                 rawCall("SetSessionInfo", std::string(16, '\0'), "aa{sv}aa{sv}aavb", uint32_t{2} << 20U));
    EXPECT_TRUE(isClosedByPeer(client.fd()));
    EXPECT_TRUE(eventually([&] { return service.invalidations() == before + 1; }));
  }
  EXPECT_EQ(closings("a message of 2097"), 4U);
  expectOthersAreServed();
}

TEST_F(IpcHostileTest, AnAuthenticationThatIsEndedBeforeItSucceededEndsTheConnection) {
  service.start();
  const std::vector<std::string> handshakes{std::string("\0BEGIN\r\n", 8),
                                            std::string("\0AUTH\r\nBEGIN\r\n", 14),
                                            std::string("\0AUTH KERBEROS_V4 00\r\nBEGIN\r\n", 29),
                                            std::string("\0NEGOTIATE_UNIX_FD\r\nBEGIN\r\n", 27),
                                            std::string("\0AUTH ANONYMOUS 74\r\nCANCEL\r\nBEGIN\r\n", 35),
                                            std::string("\0AUTH ANONYMOUS 74\r\nERROR\r\nBEGIN\r\n", 34)};
  for (const std::string& handshake : handshakes) {
    for (const std::string& rest :
         {std::string(), "AUTH ANONYMOUS 74\r\nBEGIN\r\n" + rawCall("StartConfig")}) {
      const RawClient client(service.path());
      client.write(handshake + rest);
      EXPECT_TRUE(isClosedByPeer(client.fd())) << handshake;
    }
  }
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 2 * handshakes.size(); }));
  EXPECT_EQ(closings("it broke the protocol: its authentication did not end with BEGIN"),
            2 * handshakes.size());
  expectOthersAreServed();
}

TEST_F(IpcHostileTest, AnAuthenticationWithoutEndIsClosed) {
  service.start();
  const RawClient client(service.path());
  client.write(std::string("\0AUTH ANONYMOUS 74\r\n", 20) + std::string(10'000, 'x'));
  EXPECT_TRUE(isClosedByPeer(client.fd()));
  EXPECT_TRUE(eventually([&] { return closings("its authentication takes more than 4096 bytes") == 1; }));
}

// As the common libraries do it: some ask what there is, some wait for each answer, some send all at once.
TEST_F(IpcHostileTest, EveryCustomaryAuthenticationIsTaken) {
  service.start();
  const std::string name = std::to_string(getuid());
  std::string hex;
  for (const char digit : name) hex += std::string("3") + digit;
  const std::vector<std::vector<std::string>> handshakes{
      {"AUTH EXTERNAL " + hex, "NEGOTIATE_UNIX_FD", "BEGIN"},
      {"AUTH", "AUTH EXTERNAL " + hex, "NEGOTIATE_UNIX_FD", "BEGIN"},
      {"AUTH EXTERNAL", "DATA", "NEGOTIATE_UNIX_FD", "BEGIN"},
      {"AUTH EXTERNAL", "DATA " + hex, "BEGIN"},
      {"AUTH KERBEROS_V4", "AUTH ANONYMOUS", "DATA", "BEGIN"},
      {"AUTH EXTERNAL " + hex, "CANCEL", "AUTH ANONYMOUS 74", "BEGIN"}};
  size_t served = 0;
  for (const auto& handshake : handshakes) {
    std::string all(1, '\0');
    for (const auto& line : handshake) all += line + "\r\n";
    const std::string calls = rawCall("StartConfig") + rawCall("FlushMessages");
    {
      const RawClient patient(service.path());
      patient.write(std::string(1, '\0'));
      for (const auto& line : handshake) {
        patient.write(line + "\r\n");
        EXPECT_TRUE(line == "BEGIN" || patient.readLine().ends_with("\r\n"));
      }
      patient.write(calls);
      EXPECT_TRUE(eventually([&] { return service.accepted() == served + 1 && callsOf(served) == 2; }));
      ++served;
    }
    for (size_t cut = 1; cut < all.size(); cut += 7) {
      const RawClient client(service.path());
      client.write(all.substr(0, cut));
      client.write(all.substr(cut) + calls);
      EXPECT_TRUE(eventually([&] { return service.accepted() == served + 1 && callsOf(served) == 2; }));
      ++served;
    }
  }
  EXPECT_EQ(closings(""), 0U);
}

TEST_F(IpcHostileTest, AMessageThatIsTooLargeEndsTheConnection) {
  service.start();
  const size_t before = residentBytes();
  for (const uint32_t claim : {uint32_t{100} << 20U, uint32_t{2} << 20U}) {
    const RawClient client(service.path());
    client.authenticate();
    EXPECT_TRUE(client.write(rawCall("UploadLogData", {}, "av", claim)));
    const std::string piece(64 << 10U, '\0');
    size_t written = 0;
    while (written < claim && client.write(piece)) written += piece.size();
    EXPECT_LT(written, size_t{2} << 20U);
    EXPECT_TRUE(isClosedByPeer(client.fd()));
  }
  EXPECT_TRUE(service.logged("bytes exceeds the limit of 1048576 bytes"));
  EXPECT_TRUE(!kMemoryIsMeasurable || residentBytes() < before + (size_t{16} << 20U));
  expectOthersAreServed();
}

TEST_F(IpcHostileTest, AMessageUpToTheLimitIsTaken) {
  service.start();
  BusClient client(service.path());
  const std::string text(wire::kMaxMessageBytes - 1000, 'x');
  EXPECT_NE(client.call("UploadLogData", "av", 1, "s", text.c_str()), nullptr) << client.errorText;
}

TEST_F(IpcHostileTest, AClaimWithoutBytesHoldsNothing) {
  service.start();
  std::vector<RawClient> clients;
  const size_t before = residentBytes();
  for (int i = 0; i < 20; ++i) {
    clients.emplace_back(service.path());
    clients.back().authenticate();
    EXPECT_TRUE(clients.back().write(rawCall("UploadLogData", "xxxxxxxx", "av", uint32_t{100} << 20U)));
  }
  expectOthersAreServed();
  EXPECT_TRUE(!kMemoryIsMeasurable || residentBytes() < before + (size_t{16} << 20U));
}

TEST_F(IpcHostileTest, AFloodWithoutReadingIsHeldBack) {
  service.start();
  const RawClient client(service.path());
  client.authenticate();
  expectOthersAreServed();
  const size_t before = residentBytes();
  std::string calls;
  for (int i = 0; i < 1000; ++i) calls += rawCall("StartConfig");
  // Written until the daemon has stopped reading and the socket is full.
  fcntl(client.fd().get(), F_SETFL, O_NONBLOCK);
  size_t at = 0;
  for (int i = 0; i < 400; ++i) {
    pollfd writable{client.fd().get(), POLLOUT, 0};
    if (poll(&writable, 1, 200) <= 0) break;
    const auto sent = send(client.fd().get(), calls.data() + at, calls.size() - at, MSG_NOSIGNAL);
    if (sent > 0) at = (at + static_cast<size_t>(sent)) % calls.size();
  }
  const size_t held = service.session()->count();
  EXPECT_GT(held, 0U);
  EXPECT_TRUE(!kMemoryIsMeasurable || residentBytes() < before + (size_t{8} << 20U));
  expectOthersAreServed();
  EXPECT_EQ(service.session()->count(), held);
}

TEST(IpcDeathTest, DeathAtAnyInstantIsSurvived) {
  IpcLimits limits;
  limits.connectionsPerUser = limits.connections;
  Service service(limits);
  service.start();
  const std::string bytes = std::string("\0AUTH ANONYMOUS 74\r\nBEGIN\r\n", 27) + rawCall("StartConfig") +
                            rawCall("UploadLogData", std::string("\0\0\0\0", 4), "av") +
                            rawCall("FlushMessages");
  for (size_t length = 0; length <= bytes.size(); ++length) {
    RawClient client(service.path());
    client.write(std::string_view(bytes).substr(0, length));
    client.close();
  }
  EXPECT_TRUE(eventually([&] { return service.invalidations() == bytes.size() + 1; }));
  BusClient client(service.path());
  EXPECT_NE(client.call("StartConfig", ""), nullptr);
}

TEST_F(IpcHostileTest, AKilledClientIsNoticed) {
  service.start();
  std::array<int, 2> told{};
  ASSERT_EQ(pipe(told.data()), 0);
  const std::string path = service.path();
  const pid_t child = fork();
  if (child == 0) {
    const RawClient client(path);
    client.authenticate();
    client.write(rawCall("StartConfig"));
    static_cast<void>(write(told[1], "x", 1));
    for (;;) pause();
  }
  char ready = 0;
  ASSERT_EQ(read(told[0], &ready, 1), 1);
  kill(child, SIGKILL);
  waitpid(child, nullptr, 0);
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 1; }));
  close(told[0]);
  close(told[1]);
}

TEST_F(IpcHostileTest, DescriptorsThatNobodyAskedForAreClosed) {
  service.start();
  const RawClient client(service.path());
  client.authenticate();
  EXPECT_TRUE(client.write(rawCall("StartConfig")));
  EXPECT_TRUE(eventually([&] { return service.accepted() == 1 && service.session()->count() == 1; }));
  const size_t before = openDescriptors();
  EXPECT_TRUE(client.writeWith(rawCall("FlushMessages"), client.fd().get(), 100));
  EXPECT_TRUE(eventually([&] { return service.session()->count() == 2; }));
  EXPECT_EQ(openDescriptors(), before);
}

TEST_F(IpcHostileTest, AMalformedMessageEndsTheConnection) {
  service.start();
  const RawClient client(service.path());
  client.authenticate();
  std::string call = rawCall("StartConfig");
  call[2] = '\x7F';  // flags that do not exist are ignored
  EXPECT_TRUE(client.write(call));
  call[3] = '\0';  // a protocol version that does not exist
  EXPECT_TRUE(client.write(call + rawCall("StartConfig")));
  EXPECT_TRUE(isClosedByPeer(client.fd()));
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 1; }));
  EXPECT_TRUE(service.logged("it broke the protocol: a malformed message"));
}

TEST_F(IpcHostileTest, TextThatIsNotUtf8IsRefusedByName) {
  service.start();
  const RawClient client(service.path());
  client.authenticate();
  // aa{sv} with one dictionary {"k": <s 0xFF>}.
  std::string body("\1\0\2\0", 4);                           // category, type
  body += std::string("\24\0\0\0", 4);                       // bytes of the outer array
  body += std::string("\14\0\0\0\0\0\0\0", 8).substr(0, 4);  // bytes of the dictionary
  body += std::string("\0\0\0\0", 4);                        // to 8
  body += std::string("\1\0\0\0k\0\1s\0\0\0\0\1\0\0\0\xFF\0", 18);
  body[4] = 26;
  body[8] = 18;
  EXPECT_TRUE(client.write(rawCall("SendMessage", body, "qqaa{sv}")));
  std::string answer;
  std::array<char, 4096> piece{};
  while (answer.find("UTF-8") == std::string::npos) {
    const auto got = recv(client.fd().get(), piece.data(), piece.size(), 0);
    ASSERT_GT(got, 0) << answer;
    answer.append(piece.data(), static_cast<size_t>(got));
  }
  EXPECT_THAT(answer, HasSubstr(wire::kErrorInvalidArguments));
  EXPECT_THAT(answer, HasSubstr("at key \"k\": the text is not UTF-8"));
  EXPECT_EQ(service.session()->count(), 0U);
}

TEST_F(IpcHostileTest, TooDeepIsRefusedByName) {
  service.start();
  BusClient client(service.path());
  auto call = client.newCall("SendMessageDictionary");
  sd_bus_message* m = call.get();
  constexpr unsigned kLevels = wire::kMaxDepth + 1;
  for (unsigned i = 0; i < kLevels; ++i) {
    if (i > 0) sd_bus_message_open_container(m, 'v', "a{sv}");
    sd_bus_message_open_container(m, 'a', "{sv}");
    sd_bus_message_open_container(m, 'e', "sv");
    sd_bus_message_append(m, "s", "k");
  }
  sd_bus_message_append(m, "v", "i", 1);
  for (unsigned i = 0; i < 3 * kLevels - 1; ++i) ASSERT_GE(sd_bus_message_close_container(m), 0);
  EXPECT_EQ(client.call(call), nullptr);
  EXPECT_EQ(client.errorName, wire::kErrorTooDeep);
  EXPECT_EQ(service.session()->count(), 0U);
  EXPECT_NE(client.call("StartConfig", ""), nullptr);
}

}  // namespace
}  // namespace tarnel
