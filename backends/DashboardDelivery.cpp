// What becomes of a dashboard's datagrams: the network queue's half of the backend.
#include <algorithm>
#include <array>
#include <utility>

#include "backends/DashboardBackend.h"
#include "backends/LogTexts.h"
#include "foundation/DashboardDatagram.h"
#include "platform/Clock.h"
#include "platform/Log.h"

namespace velk {

namespace {

/// The oldest ones are dropped without notice.
constexpr std::size_t kMostPending = 50;
/// Ticks until a datagram is sent again, by how often that has happened already.
constexpr std::array<std::int32_t, 4> kThresholds{2, 3, 5, 9};
constexpr Duration kLeeway = std::chrono::milliseconds(100);
/// The whole schedule at the usual period.
constexpr std::chrono::milliseconds kLastResort(9500);
/// Datagrams read before others on the same thread get their turn.
constexpr int kReadsPerTurn = 64;
constexpr std::size_t kReceiveBytes = 1088;

constexpr std::int32_t kRunning = 0;
constexpr std::int32_t kCleanupRequested = 1;
constexpr std::int32_t kLastResortScheduled = 2;

}  // namespace

void DashboardBackend::tryToSendMsg(std::span<const std::uint8_t> datagram, std::uint16_t eventNumber) {
  assertOnQueue(*_networkProcQueue);
  const bool sent = sendsWhole(datagram);
  if (sent && !_reliableUDP) return;
  auto packet = UDPPacketToSend::initWithBytes(datagram, eventNumber);
  if (sent) packet.state = UDPPacketToSend::kAwaitsAcknowledgement;
  _messageQueue.push_back(std::move(packet));
  if (_messageQueue.size() > kMostPending) _messageQueue.pop_front();
  armTimer();
}

bool DashboardBackend::sendsWhole(std::span<const std::uint8_t> datagram) {
  const auto sent = _socket->send(datagram);
  return sent.status == Transfer::Status::moved && sent.bytes == datagram.size();
}

void DashboardBackend::myPeriodicTask() {
  assertOnQueue(*_networkProcQueue);
  std::erase_if(_messageQueue, [this](UDPPacketToSend& packet) { return !tick(packet); });
  checkCleanup();
  disarmTimerIfIdle();
}

bool DashboardBackend::tick(UDPPacketToSend& packet) {
  if (packet.state == UDPPacketToSend::kNotSent) {
    if (!sendsWhole(packet.data)) return true;
    packet.state = UDPPacketToSend::kAwaitsAcknowledgement;
    return _reliableUDP;
  }
  if (packet.state != UDPPacketToSend::kAwaitsAcknowledgement) return true;
  if (packet.numberOfRetransmits >= kThresholds.size()) return false;
  const auto checks = packet.numberOfChecks + 1;
  if (checks < kThresholds[packet.numberOfRetransmits]) {
    packet.numberOfChecks = checks;
  } else if (sendsWhole(packet.data)) {
    // Otherwise the count stands, so that the next tick tries again.
    packet.numberOfChecks = 0;
    ++packet.numberOfRetransmits;
  }
  return true;
}

void DashboardBackend::checkCleanup() {
  if (_cleanupState != kRunning && _messageQueue.empty()) {
    log::standard(backend_texts::kCleanUpAtTick);
    cleanupSources();
  } else if (_cleanupState == kCleanupRequested) {
    _cleanupState = kLastResortScheduled;
    log::standard(backend_texts::kLastResort, kLastResort.count());
    auto self = std::static_pointer_cast<DashboardBackend>(shared_from_this());
    _networkProcQueue->asyncAfter(kLastResort, [self = std::move(self)] { self->cleanupSources(); });
  }
}

void DashboardBackend::readAcknowledgements() {
  for (int reads = 0; reads < kReadsPerTurn; ++reads) {
    if (!processSocketRead()) return;
  }
}

bool DashboardBackend::processSocketRead() {
  assertOnQueue(*_networkProcQueue);
  std::array<std::uint8_t, kReceiveBytes> buffer;
  const auto received = _socket->receive(buffer);
  if (received.status == Transfer::Status::wouldBlock) return false;
  // A collector's port that refused a datagram shows here, and the next one may be taken again.
  if (received.status != Transfer::Status::moved || received.bytes < 1) return true;
  const auto eventNumber = dashboard::acknowledgedEventNumber(std::span(buffer).first(received.bytes));
  if (!eventNumber) return true;
  const auto acknowledged =
      std::find_if(_messageQueue.begin(), _messageQueue.end(),
                   [&eventNumber](const UDPPacketToSend& packet) { return packet.eventNumber == *eventNumber; });
  if (acknowledged == _messageQueue.end()) return true;
  _messageQueue.erase(acknowledged);
  disarmTimerIfIdle();
  return true;
}

/// An idle backend wakes nobody; whenever the timer runs, it ticks as if it had run from the beginning.
void DashboardBackend::armTimer() {
  if (!_timer || _timerArmed) return;
  const auto elapsed = _context.platform.scheduler.clock().steadyTime() - _timerStart;
  _timer->start(_period - elapsed % _period, _period, kLeeway);
  _timerArmed = true;
}

/// A clean-up that was asked for is the next tick's business.
void DashboardBackend::disarmTimerIfIdle() {
  if (!_timer || !_timerArmed || !_messageQueue.empty() || _cleanupState != kRunning) return;
  _timer->cancel();
  _timerArmed = false;
}

void DashboardBackend::cleanup() {
  auto self = std::static_pointer_cast<DashboardBackend>(shared_from_this());
  _networkProcQueue->async([self = std::move(self)] {
    if (self->_messageQueue.empty()) {
      self->cleanupSources();
    } else {
      self->_cleanupState = kCleanupRequested;
    }
  });
}

/// Ends those whose handlers own this backend, and the socket that they used.
void DashboardBackend::cleanupSources() {
  assertOnQueue(*_networkProcQueue);
  _timer.reset();
  _readSource.reset();
  _socket->close();
}

}  // namespace velk
