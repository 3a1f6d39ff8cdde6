// How a dashboard backend is made, and what its datagrams hold.
#include <cstdlib>
#include <new>

#include "tests/unit/backends/DashboardFixture.h"

namespace {
/// While true, memory that may be refused is refused.
bool memoryIsRefused = false;
}  // namespace

void* operator new(std::size_t size, const std::nothrow_t&) noexcept {
  return memoryIsRefused ? nullptr : ::operator new(size);
}

namespace velk::test {
namespace {

namespace texts = backend_texts;

TEST_F(DashboardTest, IsWhatItsNameStandsFor) {
  const auto backend = make("dashboard", section({{"display_url", "https://display.example/d"}}));
  ASSERT_TRUE(backend);
  EXPECT_NE(dynamic_cast<DashboardBackend*>(backend.get()), nullptr);
  EXPECT_EQ(backend->displayURL(), "https://display.example/d");
  EXPECT_EQ(backend->name(), "dashboard");
  EXPECT_FALSE(backend->isHTTPSPostBackend());
  backend->cleanup();
}

TEST_F(DashboardTest, ConnectsToTheAddressOfItsSection) {
  const auto backend = makeWith(PropertyDictionary{{"ip", "192.0.2.7"}, {"port", "65538"}});
  ASSERT_TRUE(backend);
  EXPECT_EQ(socket().address, "192.0.2.7");
  EXPECT_EQ(socket().port, 2) << "the low 16 bits";
  EXPECT_FALSE(socket().isBound);
  EXPECT_EQ(backend->displayURL(), std::nullopt);
  EXPECT_TRUE(log.lines().empty());
  backend->cleanup();
}

TEST_F(DashboardTest, NeedsAddressAndPortInItsSection) {
  for (const PropertyDictionary& profile : std::vector<PropertyDictionary>{
           {{"port", 1}}, {{"ip", PropertyValue()}, {"port", 1}}, {{"ip", 7}, {"port", 1}}, {}}) {
    log.clear();
    EXPECT_FALSE(makeWith(profile));
    EXPECT_EQ(log.lines(), (std::vector<RecordingLog::Line>{{log::Level::error, texts::kNoServerIP}}));
  }
  for (const PropertyDictionary& profile :
       std::vector<PropertyDictionary>{{{"ip", "192.0.2.7"}}, {{"ip", "192.0.2.7"}, {"port", PropertyValue()}}}) {
    log.clear();
    EXPECT_FALSE(makeWith(profile));
    EXPECT_EQ(log.lines(), (std::vector<RecordingLog::Line>{{log::Level::error, texts::kNoServerPort}}));
  }
  EXPECT_EQ(fakes.udpSockets.count(), 0U);
}

TEST_F(DashboardTest, WithoutSectionAndAddressSaysSoAndClosesItsSocket) {
  for (const PropertyValue& profile : {PropertyValue(), PropertyValue("text")}) {
    log.clear();
    EXPECT_FALSE(makeWith(profile));
    EXPECT_EQ(log.lines(), (std::vector<RecordingLog::Line>{{log::Level::error, texts::kAllNullParameters}}));
  }
  EXPECT_EQ(fakes.udpSockets.count(), 2U);
  EXPECT_EQ(fakes.udpSockets.openSockets(), 0);
}

TEST_F(DashboardTest, NeedsASocket) {
  fakes.udpSockets.makeError = 24;
  EXPECT_FALSE(makeBestEffort());
  EXPECT_EQ(log.count(log::Level::error, "DashboardBackend(initWithName): socket() failed (24)"), 1);
  fakes.udpSockets.makeError = 0;
  platform.udpSockets = nullptr;
  EXPECT_FALSE(makeBestEffort());
  EXPECT_EQ(log.count(log::Level::error, "DashboardBackend(initWithName): socket() failed (0)"), 1);
}

TEST_F(DashboardTest, ClosesASocketThatCannotBeConnected) {
  fakes.udpSockets.connectError = 13;
  for (const PropertyDictionary& more : std::vector<PropertyDictionary>{{}, {{"reliable", 500}}}) {
    log.clear();
    EXPECT_FALSE(makeWith(section(more)));
    EXPECT_EQ(log.lines(), (std::vector<RecordingLog::Line>{{log::Level::error, texts::kConnectFailed}}));
    EXPECT_FALSE(socket().isOpen);
    EXPECT_FALSE(socket().isRead());
  }
  EXPECT_EQ(fakes.udpSockets.openSockets(), 0);
}

TEST_F(DashboardTest, WithoutAnAddressThatIsOneServesAllButDatagrams) {
  for (const PropertyDictionary& more : std::vector<PropertyDictionary>{{}, {{"reliable", 500}}}) {
    log.clear();
    auto parts = section(more);
    parts.set("ip", "192.0.2.7 and what follows");
    parts.set("display_url", "https://shown.example/");
    const auto backend = makeWith(parts);
    ASSERT_TRUE(backend);
    EXPECT_EQ(backend->displayURL(), "https://shown.example/");
    EXPECT_EQ(
        log.lines(),
        (std::vector<RecordingLog::Line>{{log::Level::error,
                                          "DashboardBackend(initWithName): '192.0.2.7 and what follows' is no IPv4 "
                                          "address, so no datagrams are sent"}}));
    EXPECT_FALSE(socket().isOpen);
    EXPECT_FALSE(socket().isRead());
    EXPECT_TRUE(backend->sendMessageWithoutFlag(PropertyDictionary{}, kStart, 7, 3, 1));
    tick(3);
    EXPECT_TRUE(socket().sent.empty());
  }
}

/// A scheduler that can make no timers.
class TimerlessScheduler final : public Scheduler {
 public:
  explicit TimerlessScheduler(Scheduler& real) : _real(real) {}
  std::shared_ptr<Queue> makeSerialQueue(std::string label) override { return _real.makeSerialQueue(std::move(label)); }
  std::unique_ptr<Timer> makeTimer(std::shared_ptr<Queue>, Task) override { return nullptr; }
  [[nodiscard]] const Clock& clock() const override { return _real.clock(); }

 private:
  Scheduler& _real;
};

TEST_F(DashboardTest, NeedsATimer) {
  TimerlessScheduler scheduler(fakes.scheduler);
  Platform timerless{platform.clock,   scheduler,        platform.defaults,     platform.device,
                     platform.locale,  platform.http,    platform.random,       platform.keepAlive,
                     platform.consent, platform.process, platform.logSubmission};
  timerless.udpSockets = platform.udpSockets;
  const BackendContext other{timerless, environment};
  EXPECT_FALSE(DashboardBackend::initWithName(other, "dashboard", section({{"reliable", 500}}), "Lamp"));
  EXPECT_EQ(log.lines(), (std::vector<RecordingLog::Line>{{log::Level::error, texts::kNoTimerSource}}));
  EXPECT_FALSE(socket().isOpen);
  EXPECT_FALSE(socket().isRead());
}

TEST_F(DashboardTest, WithAServerAddressIsAlwaysReliable) {
  const auto backend = described(DashboardBackend::initWithServerIP(context, "dashboard", "192.0.2.9", 40'000, "Lamp"));
  ASSERT_TRUE(backend);
  EXPECT_EQ(socket().address, "192.0.2.9");
  EXPECT_EQ(socket().port, 40'000);
  EXPECT_TRUE(socket().isBound);
  EXPECT_TRUE(socket().isRead());
  sendEvent(*backend, 1);
  EXPECT_EQ(lastDatagram().flags, 3U) << "reliable, and the address is none of a storebag's";
  EXPECT_EQ(fakes.scheduler.timeToNextDeadline(), kHalfSecond);
  acknowledge(1);
  backend->cleanup();
  fakes.scheduler.runUntilIdle();
  EXPECT_FALSE(DashboardBackend::initWithServerIP(context, "dashboard", std::nullopt, 1, "Lamp"));
}

TEST_F(DashboardTest, PrefersTheAddressOfItsSection) {
  const PropertyDictionary profile = section();
  const auto backend = DashboardBackend::initWithProfile(context, "dashboard", &profile, "192.0.2.9", 1, "Lamp");
  ASSERT_TRUE(backend);
  EXPECT_EQ(socket().address, "192.0.2.7");
  backend->cleanup();
}

TEST_F(DashboardTest, StaysBestEffortWhenItCannotBind) {
  fakes.udpSockets.bindError = 98;
  const auto backend = makeReliable();
  ASSERT_TRUE(backend);
  EXPECT_EQ(log.count(log::Level::error, "DashboardBackend(useReliableUDP): can't bind socket, 98"), 1);
  EXPECT_FALSE(socket().isRead());
  sendEvent(*backend, 1);
  EXPECT_EQ(lastDatagram().flags, 0U);
  EXPECT_FALSE(isTimerArmed()) << "nothing waits for an acknowledgement";
  backend->cleanup();
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(fakes.udpSockets.openSockets(), 0);
}

TEST_F(DashboardTest, WithoutReadSourceStaysReliableAndGivesUp) {
  fakes.udpSockets.makesReadSources = false;
  const auto backend = makeReliable();
  ASSERT_TRUE(backend);
  EXPECT_EQ(log.count(log::Level::error, texts::kNoReadSource), 1);
  sendEvent(*backend, 1);
  EXPECT_EQ(lastDatagram().flags, 1U);
  acknowledge(1);
  tick(20);
  EXPECT_EQ(sent(1), 5);
  EXPECT_FALSE(isTimerArmed());
  backend->cleanup();
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(fakes.udpSockets.openSockets(), 0);
}

TEST_F(DashboardTest, SaysThatAReadSourceFailedLater) {
  const auto backend = makeReliable();
  FakeUdpSockets::failReadSource(socket());
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(log.count(log::Level::error, texts::kNoReadSource), 1);
  backend->cleanup();
}

TEST_F(DashboardTest, BuildsTheHeaderByteByByte) {
  const auto backend = makeBestEffort();
  backend->setSessionID(0x01020304);
  backend->setClientVersion(0x0506);
  backend->setCompType(9);
  const auto line = backend->sendMessageWithoutFlag(PropertyDictionary{{"key", "value"}},
                                                    TimeValue{0x1'0A0B0C0D, 999'999}, 0x1112, 0x1314, 0x2122);
  fakes.scheduler.runUntilIdle();
  ASSERT_EQ(socket().sent.size(), 1U);
  ByteData expected{8,    9,    1,    249,               //
                    0x0A, 0x0B, 0x0C, 0x0D,              // the low 32 bits of the seconds
                    0xFE, 0xFD, 0xFC, 0xFB, 0xFA, 0xF9,  // session and version, complemented
                    0xFF, 0xB5,                          // 74 bytes, complemented
                    0x11, 0x12, 0x13, 0x14};             //
  for (const char letter : std::string(kUdid)) expected.push_back(static_cast<std::uint8_t>(letter));
  expected.insert(expected.end(), {0x21, 0x22, 0x00, 0x00});
  for (const char letter : std::string(" key=value")) expected.push_back(static_cast<std::uint8_t>(letter));
  EXPECT_EQ(socket().sent[0], expected);
  EXPECT_EQ(line, "168496141.996 " + std::string(kUdid) + " 127.0.0.1 " + std::string(componentShortCode(9)) +
                      "  1286 16909060  8482  4370  4884  key=value");
  backend->cleanup();
}

TEST_F(DashboardTest, AnswersTheLineOfWhatItSends) {
  const auto backend = makeReliable();
  const auto line = sendEvent(*backend, 65'535, {{"b", "two"}, {"a", 1}});
  EXPECT_EQ(line, "1600000000.248 " + std::string(kUdid) + " 127.0.0.1 " + std::string(componentShortCode(20)) +
                      "    12  4242 65535     7     3  a=1 b=two");
  const auto datagram = lastDatagram();
  EXPECT_EQ(datagram.majorVersion, 8U);
  EXPECT_EQ(datagram.component, 20U);
  EXPECT_EQ(datagram.constant, 1U);
  EXPECT_EQ(datagram.fourMilliseconds, 62U);
  EXPECT_EQ(datagram.seconds, 1'600'000'000U);
  EXPECT_EQ(datagram.sessionID, 4242U);
  EXPECT_EQ(datagram.clientVersion, 12U);
  EXPECT_EQ(datagram.length, socket().sent.back().size());
  EXPECT_EQ(datagram.udid, kUdid);
  EXPECT_EQ(datagram.eventNumber, 65'535U);
  EXPECT_EQ(datagram.flags, 1U);
  EXPECT_EQ(datagram.text, " a=1 b=two");
  acknowledge(65'535);
  backend->cleanup();
}

TEST_F(DashboardTest, CutsLongTextsInDatagramAndLength) {
  const auto backend = makeBestEffort();
  sendEvent(*backend, 1, {{"long", std::string(5000, 'z')}, {"short", "a"}});
  EXPECT_EQ(socket().sent.back().size(), 1087U);
  EXPECT_EQ(lastDatagram().length, 1087U);
  EXPECT_EQ(lastDatagram().text.size(), 1023U);
  EXPECT_EQ(lastDatagram().text.substr(0, 16), " short=a long=zz");
  backend->cleanup();
}

TEST_F(DashboardTest, SendsAHeaderAloneWithoutPayload) {
  const auto backend = makeBestEffort();
  EXPECT_TRUE(backend->sendMessageWithoutFlag(std::nullopt, kStart, 1, 2, 3));
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(socket().sent.back().size(), 64U);
  EXPECT_EQ(lastDatagram().length, 64U);
  backend->cleanup();
}

TEST_F(DashboardTest, PadsAShortDeviceIdentifierWithZeros) {
  const auto backend = makeBestEffort();
  backend->setUdid("abc");
  const auto line = sendEvent(*backend, 1);
  EXPECT_EQ(lastDatagram().udid, "abc" + std::string(37, '\0'));
  EXPECT_EQ(line->substr(0, 28), "1600000000.248 abc 127.0.0.1");
  backend->cleanup();
}

TEST_F(DashboardTest, WithoutMemoryDropsTheEvent) {
  const auto backend = makeBestEffort();
  memoryIsRefused = true;
  const auto line = backend->sendMessageWithoutFlag(PropertyDictionary{{"a", 1}}, kStart, 7, 3, 1);
  memoryIsRefused = false;
  EXPECT_EQ(line, std::nullopt);
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(log.count(log::Level::error, texts::kNoMemory), 1);
  EXPECT_TRUE(socket().sent.empty());
  backend->cleanup();
}

TEST_F(DashboardTest, GetsNoEventsThroughTheEntryThatSessionsUse) {
  const auto backend = makeReliable();
  for (int number = 0; number < 3; ++number) {
    EXPECT_EQ(send(*backend, {{"a", 1}}), std::nullopt);
    EXPECT_EQ(backend->sendMessageWithEventID(PropertyDictionary{{"a", 1}}, kStart, 7, 3, 9, 0), std::nullopt);
  }
  fakes.scheduler.runUntilIdle();
  EXPECT_TRUE(socket().sent.empty());
  EXPECT_FALSE(isTimerArmed());
  backend->cleanup();
}

TEST_F(DashboardTest, BoundsWhatIsOnItsWayToTheNetwork) {
  const auto backend = makeBestEffort();
  for (int number = 0; number < 3000; ++number) {
    backend->sendMessageWithoutFlag(PropertyDictionary{}, kStart, 7, 3, static_cast<std::uint16_t>(number));
    ASSERT_LE(fakes.scheduler.pendingTasks(), 257U);
  }
  fakes.scheduler.runUntilIdle();
  ASSERT_EQ(socket().sent.size(), 3000U);
  for (std::size_t number = 0; number < 3000; ++number) EXPECT_EQ(Datagram(socket().sent[number]).eventNumber, number);
  backend->cleanup();
}

}  // namespace
}  // namespace velk::test
