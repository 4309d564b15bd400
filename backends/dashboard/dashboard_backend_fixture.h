#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "backends/dashboard/dashboard_backend.h"
#include "platform/fake/fake_world.h"

namespace tarnel {

// A world in which time passes tick by tick, and a backend of it.
class DashboardBackendFixture : public ::testing::Test {
 protected:
  using milliseconds = std::chrono::milliseconds;

  static Dictionary profileOf(std::vector<Dictionary::Entry> more = {}) {
    Dictionary profile{{"ip", "192.0.2.7"}, {"port", 8125}};
    for (auto& [key, value] : more) profile.set(key, value);
    return profile;
  }
  static Dictionary reliableProfile() { return profileOf({{"reliable", 500}}); }

  std::shared_ptr<DashboardBackend> make(const MaybeDictionary& profile) {
    auto made = DashboardBackend::initWithName(world.dependencies, "dashboard", profile, "Slate");
    if (made != nullptr) introduce(*made);
    return made;
  }
  std::shared_ptr<DashboardBackend> makeExplicit() {
    auto made = DashboardBackend::initWithName(world.dependencies, "dashboard", MaybeString("192.0.2.9"),
                                               uint16_t{9000}, "Slate");
    if (made != nullptr) introduce(*made);
    return made;
  }
  // As a session does.
  static void introduce(TarnelBackend& backend) {
    backend.setSessionID(0x01020304);
    backend.setCompType(12);
    backend.setClientVersion(0x0506);
    backend.setUdid("0123456789abcdef0123456789abcdef01234567");
    backend.setSelfVersion("3.2");
  }

  static MaybeString send(DashboardBackend& backend, uint16_t event, const MaybeDictionary& payload = {}) {
    return backend.sendMessage(payload, TimeValue{1700000000, 250000}, Method{3}, RespCode{8},
                               EventID{event});
  }
  // Hands over and sends.
  void sendNow(DashboardBackend& backend, uint16_t event) {
    send(backend, event);
    world.workQueues.runUntilIdle();
  }
  void tick(int times = 1) {
    for (int i = 0; i < times; ++i) world.workQueues.advance(milliseconds(500));
  }
  // The next sends put nothing on its way.
  void failSends(size_t times, std::ptrdiff_t result = -1) { socket().sendResults.assign(times, result); }
  void receive(fake::Datagram datagram) {
    socket().incoming.push_back(std::move(datagram));
    world.workQueues.signalReadable(socket().descriptor);
  }
  static fake::Datagram acknowledgement(uint16_t event, size_t size = 62) {
    fake::Datagram datagram(size, 0xEE);
    if (size > 60) datagram[60] = static_cast<uint8_t>(event >> 8U);
    if (size > 61) datagram[61] = static_cast<uint8_t>(event);
    return datagram;
  }
  void acknowledge(uint16_t event) { receive(acknowledgement(event)); }

  fake::SocketRecord& socket() { return world.datagramSockets.last(); }
  size_t sentCount() { return socket().sent.size(); }
  // Event numbers of what went out, in order.
  std::vector<uint16_t> sentEvents() {
    std::vector<uint16_t> events;
    for (const auto& datagram : socket().sent) {
      events.push_back(static_cast<uint16_t>(datagram[60] << 8U | datagram[61]));
    }
    return events;
  }
  bool nothingIsLeft() const {
    return world.datagramSockets.open() == 0 && world.workQueues.timers() == 0 &&
           world.workQueues.readSources() == 0;
  }
  void expectLog(LogLevel level, const std::string& text, size_t times = 1) const {
    std::string all;
    for (const auto& line : world.log.lines()) all += line.text + "\n";
    EXPECT_EQ(world.log.count(level, text), times) << text << "\namong:\n" << all;
  }

  fake::FakeWorld world;
};

}  // namespace tarnel
