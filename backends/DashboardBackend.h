// Sends every event as one UDP datagram to a dashboard collector, and uploads log data to an address of its storebag
// section. Best effort: what could not be handed to the network is tried again on a timer. Reliable: the collector
// acknowledges each datagram by its event number; what is not acknowledged is sent again at growing intervals, four
// times, and then given up. docs/dashboard.md has the datagram and the schedule.
//
// Sessions deliver events through the base class's entry, whose operation this class does not provide (its own is the
// one without flag): so in this daemon no event leaves here, as collectors have come to rely on.
//
// Made by the factory; used on its session's queue. Socket, packets and clean-up state belong to the network queue,
// "com.tavrin.VelkReporting.networkProc". The handlers of timer and read source own the backend until
// `cleanupSources` has run, so `cleanup` must be called once the session has done with it.
//
//   running (0) --cleanup, nothing pending----------------------------------> cleanupSources
//   running (0) --cleanup--> requested (1) --tick--> last resort set (2) --9.5 s--> cleanupSources
//                            requested or set --tick with nothing pending---> cleanupSources
#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <deque>
#include <memory>
#include <optional>
#include <span>
#include <string>

#include "backends/UDPPacketToSend.h"
#include "backends/VelkReportingBackend.h"
#include "platform/Queue.h"
#include "platform/UdpSocket.h"

namespace velk {

class DashboardBackend final : public VelkReportingBackend {
  struct Private {};  // keeps the constructor to the makers below, yet open to make_shared

 public:
  /// With the address in the section. Null (and an error line) without address, port or socket.
  [[nodiscard]] static std::shared_ptr<DashboardBackend> initWithName(const BackendContext& context,
                                                                      const std::string& name,
                                                                      const PropertyValue& profile,
                                                                      const std::optional<std::string>& productFamily);
  /// Without section: always reliable, a tick every 500 ms. Null without address.
  [[nodiscard]] static std::shared_ptr<DashboardBackend> initWithServerIP(
      const BackendContext& context, const std::string& name, const std::optional<std::string>& serverIP,
      std::uint16_t serverPort, const std::optional<std::string>& productFamily);
  /// What both come to: with a section its address counts, else the one given.
  [[nodiscard]] static std::shared_ptr<DashboardBackend> initWithProfile(
      const BackendContext& context, const std::string& name, const PropertyDictionary* profile,
      const std::optional<std::string>& serverIP, std::uint16_t serverPort,
      const std::optional<std::string>& productFamily);
  DashboardBackend(Private, const BackendContext& context, const std::string& name, PropertyValue profile,
                   const std::optional<std::string>& productFamily, std::unique_ptr<UdpSocket> socket);
  ~DashboardBackend() override;

  /// Builds and queues a datagram. Answers its line for a log; nothing (and an error line) without memory for it.
  /// Waits while too many datagrams are on their way to the network queue.
  std::optional<std::string> sendMessageWithoutFlag(const std::optional<PropertyDictionary>& payload,
                                                    const TimeValue& timestamp, std::uint16_t method,
                                                    std::uint16_t respCode, std::uint16_t eventID);

  /// What is pending gets 9.5 s from the next tick on; then timer, read source and socket end.
  void cleanup() override;

  /// Archives the array as a binary property list, posts it and waits for the answer, which is where the data can be
  /// seen. True whatever status the server gives; false (and an error line) when no answer came, nothing can be
  /// archived, or the section names no address. Without transport nothing is sent, and the answer is true.
  [[nodiscard]] bool uploadLogData(const PropertyArray& logData) override;

 private:
  using DatagramBuffer = std::array<std::uint8_t, 1088>;

  // Creation, on the network queue.
  /// False when no address is given anywhere.
  [[nodiscard]] bool chooseAddress(const PropertyDictionary* profile, const std::optional<std::string>& serverIP,
                                   std::uint16_t serverPort);
  [[nodiscard]] bool connectSocket();
  [[nodiscard]] bool makeTimer();
  void useReliableUDP();

  // Sending.
  [[nodiscard]] std::size_t fillDatagram(DatagramBuffer& buffer, const std::optional<PropertyDictionary>& payload,
                                         const TimeValue& timestamp, std::uint16_t method, std::uint16_t respCode,
                                         std::uint16_t eventID) const;
  void noticeLocation(const ByteData& answer);

  // Delivery, on the network queue (DashboardDelivery.cpp).
  void tryToSendMsg(std::span<const std::uint8_t> datagram, std::uint16_t eventNumber);
  [[nodiscard]] bool sendsWhole(std::span<const std::uint8_t> datagram);
  void myPeriodicTask();
  /// False when the packet is to leave the queue.
  [[nodiscard]] bool tick(UDPPacketToSend& packet);
  void checkCleanup();
  void readAcknowledgements();
  /// False when nothing was waiting.
  bool processSocketRead();
  void armTimer();
  void disarmTimerIfIdle();
  void cleanupSources();

  // Constant after creation.
  const std::shared_ptr<Queue> _networkProcQueue;
  std::string _serverIP;
  std::uint16_t _serverPort = 0;
  Duration _period;
  SteadyTime _timerStart;  ///< ticks are due at whole periods from here
  bool _usingProfile = false;
  bool _reliableUDP = false;
  std::optional<std::string> _postURL;

  // Self-synchronised.
  std::atomic<std::uint32_t> _handedOver{0};  ///< datagrams on their way to the network queue

  // Used on the network queue only, once created.
  const std::unique_ptr<UdpSocket> _socket;
  std::deque<UDPPacketToSend> _messageQueue;  ///< oldest first, at most 50
  std::unique_ptr<ReadSource> _readSource;    ///< in reliable mode alone
  std::unique_ptr<Timer> _timer;
  bool _timerArmed = false;  ///< while something is pending or a clean-up is asked for
  std::int32_t _cleanupState = 0;
};

}  // namespace velk
