#include <algorithm>
#include <array>
#include <utility>

#include "backends/dashboard/dashboard_backend.h"

// Sending, retransmitting and acknowledging, on the work queue.

namespace tarnel {
namespace {

// Ticks from one sending to the next, by how often the datagram was retransmitted. After the last it is given
// up at the next tick.
constexpr std::array kChecksBeforeRetransmit{2, 3, 5, 9};
constexpr std::chrono::milliseconds kLastResort{9500};

}  // namespace

// On the initializer's thread, before the socket is connected.
void DashboardBackend::useReliableUDP() {
  auto& log = dependencies().log;
  if (const int error = socket->bindToWildcard()) {
    TARNEL_LOG(log, error, "DashboardBackend(useReliableUDP): can't bind socket, %d", error);
    return;
  }
  reliableUDP = true;
  readSource = networkProcQueue->makeReadSource(socket->descriptor());
  if (readSource == nullptr) {
    // Delivery stays reliable: datagrams are sent again and then dropped, never acknowledged.
    TARNEL_LOG(log, error, "DashboardBackend(useReliableUDP): can't create read source");
  }
}

// Once the socket is connected: until then there is nothing that could be acknowledged.
void DashboardBackend::startReading() {
  if (readSource == nullptr) return;
  readSource->start([backend = self()] { backend->processSocketRead(); },
                    [backend = self()] { backend->closeSocket(); });
}

bool DashboardBackend::sendWhole(std::span<const uint8_t> datagram) {
  return socket->send(datagram) == static_cast<std::ptrdiff_t>(datagram.size());
}

void DashboardBackend::tryToSendMsg(const DashboardBuffer& bytes, size_t length, EventID eventNumber) {
  const bool sent = sendWhole({bytes.data(), length});
  if (sent && !reliableUDP) return;
  auto packet = UDPPacketToSend::initWithBytes(bytes.data(), length, eventNumber);
  if (sent) packet->setState(UDPPacketToSend::State::awaitsAcknowledgement);
  messageQueue.push_back(std::move(packet));
  if (messageQueue.size() > kMaxQueuedPackets) messageQueue.erase(messageQueue.begin());
}

void DashboardBackend::myPeriodicTask() {
  std::erase_if(messageQueue,
                [this](const std::shared_ptr<UDPPacketToSend>& packet) { return isDone(*packet); });
  if (cleanupState != CleanupState::running) finishCleanup();
}

// Visits one packet. True when it leaves the queue.
bool DashboardBackend::isDone(UDPPacketToSend& packet) {
  if (packet.state() == UDPPacketToSend::State::notSent) {
    if (!sendWhole(*packet.data())) return false;
    packet.setState(UDPPacketToSend::State::awaitsAcknowledgement);
    return !reliableUDP;
  }
  if (packet.numberOfRetransmits() >= static_cast<int>(kChecksBeforeRetransmit.size())) return true;
  retransmitWhenDue(packet);
  return false;
}

void DashboardBackend::retransmitWhenDue(UDPPacketToSend& packet) {
  const int checks = packet.numberOfChecks() + 1;
  if (checks < kChecksBeforeRetransmit[static_cast<size_t>(packet.numberOfRetransmits())]) {
    packet.setNumberOfChecks(checks);
  } else if (sendWhole(*packet.data())) {
    packet.setNumberOfChecks(0);
    packet.setNumberOfRetransmits(packet.numberOfRetransmits() + 1);
  }
}

void DashboardBackend::finishCleanup() {
  auto& log = dependencies().log;
  if (messageQueue.empty()) {
    TARNEL_LOG(log, debug, "DashboardBackend(myPeriodicTask): clean up at myPeriodicTask.");
    cleanupSources();
  } else if (cleanupState == CleanupState::requested) {
    cleanupState = CleanupState::lastResort;
    TARNEL_LOG(log, debug, "DashboardBackend(myPeriodicTask): scheduled last resort clean-up in %d ms.",
               static_cast<int>(kLastResort.count()));
    // Weak: until it is cleaned up the sources keep the backend, and afterwards nothing needs to.
    networkProcQueue->after(kLastResort, [weak = weak_from_this()] {
      if (const auto backend = weak.lock()) static_cast<DashboardBackend&>(*backend).cleanupSources();
    });
  }
}

void DashboardBackend::processSocketRead() {
  DashboardBuffer buffer;  // filled by receive
  const auto received = socket->receive(buffer);
  if (received < 1) return;
  const auto event = acknowledgedEvent({buffer.data(), static_cast<size_t>(received)});
  if (!event) return;
  const auto packet = std::find_if(
      messageQueue.begin(), messageQueue.end(),
      [&event](const std::shared_ptr<UDPPacketToSend>& queued) { return queued->eventNumber() == *event; });
  if (packet != messageQueue.end()) messageQueue.erase(packet);
}

void DashboardBackend::cleanupSources() {
  if (timer != nullptr) timer->cancel();
  timer.reset();
  if (readSource != nullptr) readSource->cancel();
  readSource.reset();
}

}  // namespace tarnel
