// What the dashboard's tests have in common: backends over fake sockets, and a reader of datagrams of their own, which
// shares nothing with the one in the tree.
#pragma once

#include <algorithm>
#include <memory>
#include <string>
#include <vector>

#include "backends/DashboardBackend.h"
#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {

inline constexpr char kUdid[] = "0123456789abcdef0123456789abcdef01234567";
inline constexpr Duration kHalfSecond = std::chrono::milliseconds(500);

/// A datagram taken apart byte by byte, complements undone.
struct Datagram {
  explicit Datagram(const ByteData& bytes) {
    const auto byte = [&bytes](std::size_t at) { return at < bytes.size() ? static_cast<unsigned>(bytes[at]) : 0U; };
    const auto pair = [&byte](std::size_t at) { return byte(at) * 256 + byte(at + 1); };
    majorVersion = byte(0);
    component = byte(1);
    constant = byte(2);
    fourMilliseconds = byte(3);
    seconds = pair(4) * 65536 + pair(6);
    sessionID = 0xFFFFFFFFU - (pair(8) * 65536 + pair(10));
    clientVersion = 0xFFFFU - pair(12);
    length = 0xFFFFU - pair(14);
    method = pair(16);
    respCode = pair(18);
    for (std::size_t at = 20; at < 60; ++at) udid += static_cast<char>(byte(at));
    eventNumber = pair(60);
    flags = pair(62);
    for (std::size_t at = 64; at < bytes.size(); ++at) text += static_cast<char>(bytes[at]);
  }

  unsigned majorVersion, component, constant, fourMilliseconds, seconds, sessionID, clientVersion, length, method,
      respCode, eventNumber, flags;
  std::string udid;
  std::string text;
};

class DashboardTest : public BackendTest {
 protected:
  using Record = FakeUdpSockets::Record;

  /// Handlers own a backend until it has cleaned up, pending datagrams included.
  ~DashboardTest() override {
    fakes.udpSockets.sendError = 0;
    for (const auto& backend : _made) {
      if (const auto alive = backend.lock()) alive->cleanup();
    }
    tick(40);
  }

  /// A section with an address; `more` is added.
  [[nodiscard]] static PropertyDictionary section(const PropertyDictionary& more = {}) {
    PropertyDictionary result{{"ip", "192.0.2.7"}, {"port", 9000}};
    result.merge(more);
    return result;
  }

  [[nodiscard]] std::shared_ptr<DashboardBackend> makeWith(const PropertyValue& profile) {
    return described(DashboardBackend::initWithName(context, "dashboard", profile, "Lamp"));
  }
  [[nodiscard]] std::shared_ptr<DashboardBackend> makeBestEffort() { return makeWith(section()); }
  [[nodiscard]] std::shared_ptr<DashboardBackend> makeReliable(int period = 500) {
    return makeWith(section({{"reliable", period}}));
  }

  [[nodiscard]] std::shared_ptr<DashboardBackend> described(std::shared_ptr<DashboardBackend> backend) {
    if (!backend) return nullptr;
    _made.push_back(backend);
    backend->setSelfVersion("8.1.2");
    backend->setCompType(20);
    backend->setSessionID(4242);
    backend->setClientVersion(12);
    backend->setUdid(kUdid);
    return backend;
  }

  /// Queues one datagram and lets it go to the network.
  std::optional<std::string> sendEvent(DashboardBackend& backend, std::uint16_t eventNumber,
                                       const PropertyDictionary& payload = {{"a", 1}}) {
    auto line = backend.sendMessageWithoutFlag(payload, TimeValue{kNow, 250'000}, 7, 3, eventNumber);
    fakes.scheduler.runUntilIdle();
    return line;
  }
  void tick(int times = 1, Duration period = kHalfSecond) {
    for (int number = 0; number < times; ++number) fakes.scheduler.advance(period);
  }
  /// What a collector sends back: the header with that event number, `size` bytes of it.
  void acknowledge(std::uint16_t eventNumber, std::size_t size = 64) {
    ByteData bytes(size);
    if (size > 60) bytes[60] = static_cast<std::uint8_t>(eventNumber >> 8);
    if (size > 61) bytes[61] = static_cast<std::uint8_t>(eventNumber);
    FakeUdpSockets::deliver(socket(), std::move(bytes));
    fakes.scheduler.runUntilIdle();
  }

  [[nodiscard]] Record& socket() { return fakes.udpSockets.last(); }
  [[nodiscard]] Datagram lastDatagram() { return Datagram(socket().sent.back()); }
  /// How often a datagram with that event number has left.
  [[nodiscard]] int sent(std::uint16_t eventNumber) {
    return static_cast<int>(
        std::count_if(socket().sent.begin(), socket().sent.end(),
                      [eventNumber](const ByteData& bytes) { return Datagram(bytes).eventNumber == eventNumber; }));
  }
  [[nodiscard]] bool isTimerArmed() const { return fakes.scheduler.pendingDeadlines() > 0; }

 private:
  std::vector<std::weak_ptr<DashboardBackend>> _made;
};

}  // namespace velk::test
