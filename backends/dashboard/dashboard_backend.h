#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "backends/dashboard/dashboard_datagram.h"
#include "backends/dashboard/udp_packet_to_send.h"
#include "backends/tarnel_backend.h"
#include "platform/datagram_socket.h"
#include "platform/work_queue.h"

namespace tarnel {

// Sends each message as one datagram to a dashboard server, where the profile wants it until the server
// acknowledges it; takes arrays of log records for upload.
//
// Its own send has no flag and is not the flagged one through which sessions dispatch: for a session this
// backend's send is the base's, which does nothing. Datagrams come only from code that calls the unflagged
// send: they are readable on their way, and dashboard servers do not expect the messages of sessions.
//
// A successful initializer sets a timer going whose handler keeps the backend alive until cleanup has done
// its work, at most 9.5 seconds and a tick later.
//
// Threads: the owning session's. Sockets, packets and clean-up belong to the backend's own work queue.
class DashboardBackend final : public TarnelBackend {
 private:
  struct Private {};  // construction goes through initWithName

 public:
  // The packets that wait; one more and the oldest goes.
  static constexpr size_t kMaxQueuedPackets = 50;
  // Datagrams on their way to the work queue; more are dropped (logged).
  static constexpr uint32_t kMaxHandedOver = 256;

  // initWithName:profile:productFamily:
  // The server is the profile's "ip" (dotted text) and "port" (the low 16 bits of the integer in a value of
  // any kind). A "reliable" of any kind asks for reliable delivery; its integer is the period in
  // milliseconds.
  static std::shared_ptr<DashboardBackend> initWithName(const Dependencies& dependencies,
                                                        const std::string& name,
                                                        const MaybeDictionary& profile,
                                                        const MaybeString& productFamily);
  // initWithName:serverIP:serverPort:productFamily:
  // Delivers reliably. Null without an address.
  static std::shared_ptr<DashboardBackend> initWithName(const Dependencies& dependencies,
                                                        const std::string& name, const MaybeString& serverIP,
                                                        uint16_t serverPort,
                                                        const MaybeString& productFamily);
  // initWithName:profile:serverIP:serverPort:productFamily:
  // With a profile the server comes from there, and address and port are not looked at. Null on failure
  // (logged), with everything given back that was taken.
  static std::shared_ptr<DashboardBackend> initWithName(const Dependencies& dependencies,
                                                        const std::string& name,
                                                        const MaybeDictionary& profile,
                                                        const MaybeString& serverIP, uint16_t serverPort,
                                                        const MaybeString& productFamily);
  DashboardBackend(Private, const Dependencies& dependencies, const std::string& name,
                   const MaybeDictionary& profile, const MaybeString& productFamily,
                   std::unique_ptr<DatagramSocket> socket);

  using TarnelBackend::sendMessage;
  // sendMessage:timestamp:method:respCode:eventID:
  // Returns the datagram as a line for the log, before it is sent; nothing when there is no memory for it.
  MaybeString sendMessage(const MaybeDictionary& payload, const TimeValue& timestamp, Method method,
                          RespCode respCode, EventID eventID);
  // Returns at once; what waits is still delivered, for at most 9.5 seconds from the next tick on.
  void cleanup() override;
  // Posts the archived array and waits for the answer, or for the daemon's end, on the calling thread.
  bool uploadLogData(const Array& logData) override;

  // -1 once closed. On the work queue.
  int socketDescriptor() const noexcept { return socket->descriptor(); }

 private:
  struct Server;
  enum class CleanupState : int { running = 0, requested = 1, lastResort = 2 };

  static std::optional<Server> serverFromProfile(const Dependencies& dependencies, const std::string& name,
                                                 const Dictionary& profile);
  std::shared_ptr<DashboardBackend> self();
  bool begin(const std::optional<Server>& profileServer, const MaybeString& serverIP, uint16_t serverPort);
  bool connectAndStartTimer(const Ipv4Address& address, std::chrono::nanoseconds period);
  void giveUp();
  void closeSocket();

  // dashboard_backend_delivery.cc; on the work queue but for the first two
  void useReliableUDP();
  void startReading();
  void tryToSendMsg(const DashboardBuffer& bytes, size_t length, EventID eventNumber);
  bool sendWhole(std::span<const uint8_t> datagram);
  void myPeriodicTask();
  bool isDone(UDPPacketToSend& packet);
  void retransmitWhenDue(UDPPacketToSend& packet);
  void finishCleanup();
  void processSocketRead();
  void cleanupSources();

  std::unique_ptr<DatagramSocket> socket;
  std::vector<std::shared_ptr<UDPPacketToSend>> messageQueue;
  bool reliableUDP = false;
  bool usingProfile = false;
  std::shared_ptr<WorkQueue> networkProcQueue;
  std::unique_ptr<EventSource> readSource;
  std::unique_ptr<EventSource> timer;
  CleanupState cleanupState = CleanupState::running;
  MaybeString postURL;
  std::atomic<uint32_t> handedOver{0};
  std::atomic<bool> isDropping{false};
};

}  // namespace tarnel
