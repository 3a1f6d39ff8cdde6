// What becomes of a dashboard's datagrams, tick by tick.
#include <map>
#include <random>

#include "tests/unit/backends/DashboardFixture.h"

namespace velk::test {
namespace {

namespace texts = backend_texts;

// ---- Best effort

TEST_F(DashboardTest, BestEffortForgetsWhatHasLeft) {
  const auto backend = makeBestEffort();
  sendEvent(*backend, 1);
  EXPECT_EQ(sent(1), 1);
  EXPECT_EQ(lastDatagram().flags, 0U);
  EXPECT_FALSE(isTimerArmed()) << "nothing is pending, nobody is woken";
  tick(30);
  EXPECT_EQ(sent(1), 1);
  backend->cleanup();
}

TEST_F(DashboardTest, BestEffortTriesAgainWhatDidNotLeaveWhole) {
  const auto backend = makeBestEffort();
  fakes.udpSockets.sendError = 101;
  sendEvent(*backend, 1);
  fakes.udpSockets.sendError = 0;
  fakes.udpSockets.sendsShort = true;
  sendEvent(*backend, 2);
  EXPECT_TRUE(socket().sent.empty());
  tick(3);
  EXPECT_TRUE(isTimerArmed());
  fakes.udpSockets.sendsShort = false;
  tick();
  ASSERT_EQ(socket().sent.size(), 2U);
  EXPECT_EQ(Datagram(socket().sent[0]).eventNumber, 1U) << "oldest first";
  EXPECT_EQ(Datagram(socket().sent[1]).eventNumber, 2U);
  EXPECT_FALSE(isTimerArmed());
  tick(30);
  EXPECT_EQ(socket().sent.size(), 2U);
  backend->cleanup();
}

TEST_F(DashboardTest, BestEffortTicksEveryHalfSecondFromItsCreation) {
  const auto backend = makeBestEffort();
  fakes.scheduler.advance(std::chrono::milliseconds(1'300));
  fakes.udpSockets.sendError = 101;
  sendEvent(*backend, 1);
  EXPECT_EQ(fakes.scheduler.timeToNextDeadline(), std::chrono::milliseconds(200));
  fakes.scheduler.advance(std::chrono::milliseconds(200));
  EXPECT_EQ(fakes.scheduler.timeToNextDeadline(), kHalfSecond);
  backend->cleanup();
}

// ---- Reliable

TEST_F(DashboardTest, ReliableKeepsWhatIsNotAcknowledged) {
  const auto backend = makeReliable();
  EXPECT_TRUE(socket().isBound);
  EXPECT_TRUE(socket().isRead());
  EXPECT_FALSE(isTimerArmed());
  sendEvent(*backend, 1);
  EXPECT_TRUE(isTimerArmed());
  acknowledge(1);
  EXPECT_FALSE(isTimerArmed());
  tick(30);
  EXPECT_EQ(sent(1), 1);
  backend->cleanup();
}

TEST_F(DashboardTest, ReliableSendsAgainAtGrowingIntervalsAndGivesUp) {
  const auto backend = makeReliable();
  sendEvent(*backend, 1);
  // Resent at 1.0, 2.5, 5.0 and 9.5 s; gone at 10 s.
  const std::map<int, int> sendingsAfterTick{{1, 1},  {2, 2},  {3, 2},  {4, 2},  {5, 3},  {6, 3},  {7, 3},
                                             {8, 3},  {9, 3},  {10, 4}, {11, 4}, {12, 4}, {13, 4}, {14, 4},
                                             {15, 4}, {16, 4}, {17, 4}, {18, 4}, {19, 5}};
  for (const auto& [number, sendings] : sendingsAfterTick) {
    tick();
    EXPECT_EQ(sent(1), sendings) << "after tick " << number;
    EXPECT_TRUE(isTimerArmed());
  }
  tick();
  EXPECT_EQ(sent(1), 5);
  EXPECT_FALSE(isTimerArmed()) << "given up";
  for (const auto& datagram : socket().sent) EXPECT_EQ(datagram, socket().sent[0]);
  EXPECT_TRUE(log.lines().empty()) << "without a word";
  backend->cleanup();
}

TEST_F(DashboardTest, ScheduleScalesWithThePeriodOfTheSection) {
  const auto backend = makeReliable(200);
  sendEvent(*backend, 1);
  EXPECT_EQ(fakes.scheduler.timeToNextDeadline(), std::chrono::milliseconds(200));
  std::vector<int> resent;
  for (int number = 1; number <= 30; ++number) {
    const int before = sent(1);
    tick(1, std::chrono::milliseconds(200));
    if (sent(1) != before) resent.push_back(number * 200);
  }
  EXPECT_EQ(resent, (std::vector<int>{400, 1000, 2000, 3800}));
  backend->cleanup();
}

TEST_F(DashboardTest, PeriodsThatAreNoneFallBackToHalfASecond) {
  for (const PropertyValue& reliable : {PropertyValue(0), PropertyValue(-5), PropertyValue("soon"),
                                        PropertyValue(PropertyArray{}), PropertyValue(std::int64_t{1} << 32)}) {
    const auto backend = makeWith(section({{"reliable", reliable}}));
    sendEvent(*backend, 1);
    EXPECT_EQ(lastDatagram().flags, 1U);
    EXPECT_EQ(fakes.scheduler.timeToNextDeadline(), kHalfSecond);
    acknowledge(1);
    backend->cleanup();
    fakes.scheduler.runUntilIdle();
  }
}

TEST_F(DashboardTest, TimerKeepsItsPhaseWhileItRests) {
  const auto backend = makeReliable();
  fakes.scheduler.advance(std::chrono::milliseconds(700));
  sendEvent(*backend, 1);
  EXPECT_EQ(fakes.scheduler.timeToNextDeadline(), std::chrono::milliseconds(300));
  acknowledge(1);
  fakes.scheduler.advance(std::chrono::milliseconds(650));
  sendEvent(*backend, 2);
  EXPECT_EQ(fakes.scheduler.timeToNextDeadline(), std::chrono::milliseconds(150)) << "1.5 s from the creation";
  // A tick counts when it comes, however little time has passed.
  fakes.scheduler.advance(std::chrono::milliseconds(150));
  EXPECT_EQ(sent(2), 1);
  tick();
  EXPECT_EQ(sent(2), 2);
  acknowledge(2);
  backend->cleanup();
}

TEST_F(DashboardTest, ExactlyOnATickTheNextOneCounts) {
  const auto backend = makeReliable();
  fakes.scheduler.advance(kHalfSecond);
  sendEvent(*backend, 1);
  EXPECT_EQ(fakes.scheduler.timeToNextDeadline(), kHalfSecond);
  acknowledge(1);
  backend->cleanup();
}

TEST_F(DashboardTest, WhatDidNotLeaveStartsItsScheduleWhenItDoes) {
  const auto backend = makeReliable();
  fakes.udpSockets.sendError = 101;
  sendEvent(*backend, 1);
  tick(7);
  EXPECT_EQ(sent(1), 0);
  fakes.udpSockets.sendError = 0;
  tick();
  EXPECT_EQ(sent(1), 1);
  tick();
  EXPECT_EQ(sent(1), 1);
  tick();
  EXPECT_EQ(sent(1), 2);
  acknowledge(1);
  backend->cleanup();
}

TEST_F(DashboardTest, AFailedResendIsTriedAgainOnTheNextTick) {
  const auto backend = makeReliable();
  sendEvent(*backend, 1);
  tick();
  fakes.udpSockets.sendError = 101;
  tick(3);
  EXPECT_EQ(sent(1), 1);
  fakes.udpSockets.sendError = 0;
  fakes.udpSockets.sendsShort = true;
  tick();
  fakes.udpSockets.sendsShort = false;
  tick();
  EXPECT_EQ(sent(1), 2);
  tick(2);
  EXPECT_EQ(sent(1), 2) << "the second interval has only begun";
  tick();
  EXPECT_EQ(sent(1), 3);
  acknowledge(1);
  backend->cleanup();
}

TEST_F(DashboardTest, AnUnknownAcknowledgementChangesNothing) {
  const auto backend = makeReliable();
  sendEvent(*backend, 1);
  acknowledge(2);
  acknowledge(257);
  tick(2);
  EXPECT_EQ(sent(1), 2);
  acknowledge(1);
  EXPECT_FALSE(isTimerArmed());
  backend->cleanup();
}

TEST_F(DashboardTest, AnAcknowledgementTakesTheFirstOfTwoAlone) {
  const auto backend = makeReliable();
  sendEvent(*backend, 7, {{"first", 1}});
  sendEvent(*backend, 7, {{"second", 2}});
  acknowledge(7);
  EXPECT_TRUE(isTimerArmed());
  tick(2);
  ASSERT_EQ(socket().sent.size(), 3U);
  EXPECT_EQ(lastDatagram().text, " second=2");
  acknowledge(7);
  EXPECT_FALSE(isTimerArmed());
  backend->cleanup();
}

TEST_F(DashboardTest, AcknowledgesWhatHasNotLeftAsWell) {
  const auto backend = makeReliable();
  fakes.udpSockets.sendError = 101;
  sendEvent(*backend, 1);
  acknowledge(1);
  EXPECT_FALSE(isTimerArmed()) << "whatever its state";
  backend->cleanup();
}

TEST_F(DashboardTest, IgnoresAcknowledgementsThatEndBeforeTheEventNumber) {
  const auto backend = makeReliable();
  sendEvent(*backend, 0);
  for (const std::size_t size : {0, 1, 60, 61}) acknowledge(0, size);
  EXPECT_TRUE(isTimerArmed());
  acknowledge(0, 62);
  EXPECT_FALSE(isTimerArmed());
  sendEvent(*backend, 0x0102);
  acknowledge(0x0102, 2000);
  EXPECT_FALSE(isTimerArmed()) << "what does not fit is lost, and not needed";
  backend->cleanup();
}

TEST_F(DashboardTest, GoesOnReadingAfterARefusedPort) {
  const auto backend = makeReliable();
  sendEvent(*backend, 1);
  for (int number = 0; number < 200; ++number) FakeUdpSockets::deliverFailure(socket());
  fakes.scheduler.runUntilIdle();
  acknowledge(1);
  EXPECT_FALSE(isTimerArmed());
  EXPECT_TRUE(log.lines().empty());
  backend->cleanup();
}

TEST_F(DashboardTest, HoldsFiftyAndDropsTheOldest) {
  const auto backend = makeReliable();
  for (std::uint16_t number = 1; number <= 51; ++number) sendEvent(*backend, number);
  tick(2);
  EXPECT_EQ(sent(1), 1) << "dropped";
  for (std::uint16_t number = 2; number <= 51; ++number) EXPECT_EQ(sent(number), 2) << number;
  EXPECT_TRUE(log.lines().empty()) << "without notice";
  backend->cleanup();
}

/// Loses datagrams in both directions, as its seed wants it, and answers those that arrive at once.
class LossyLink {
 public:
  LossyLink(FakeUdpSockets::Record& socket, unsigned seed) : _random(seed) {
    socket.onSent = [this, &socket](const ByteData& datagram) {
      const auto number = Datagram(datagram).eventNumber;
      ++sendings[number];
      if (loses()) return;
      ++arrivals[number];
      if (loses()) return;
      acknowledgedAt.emplace(number, sendings[number]);
      FakeUdpSockets::deliver(socket, ByteData(datagram.begin(), datagram.begin() + 62));
    };
  }

  std::map<unsigned, int> sendings;
  std::map<unsigned, int> arrivals;
  /// By which sending.
  std::map<unsigned, int> acknowledgedAt;

 private:
  bool loses() { return std::uniform_real_distribution<>(0, 1)(_random) < 0.3; }
  std::mt19937 _random;
};

TEST_F(DashboardTest, AcrossALossyLinkDeliversOrGivesUpOnSchedule) {
  for (unsigned seed = 1; seed <= 20; ++seed) {
    const auto backend = makeReliable();
    LossyLink link(socket(), seed);
    unsigned delivered = 0;
    unsigned givenUp = 0;
    for (std::uint16_t number = 1; number <= 200; ++number) {
      sendEvent(*backend, number);
      if (number % 2 == 0) tick();
    }
    tick(25);
    EXPECT_FALSE(isTimerArmed());
    for (unsigned number = 1; number <= 200; ++number) {
      const auto acknowledged = link.acknowledgedAt.find(number);
      EXPECT_EQ(link.sendings[number], acknowledged != link.acknowledgedAt.end() ? acknowledged->second : 5) << number;
      delivered += link.arrivals[number] > 0 ? 1 : 0;
      givenUp += acknowledged == link.acknowledgedAt.end() ? 1 : 0;
    }
    EXPECT_GT(delivered, 195U) << "a datagram in 400 is lost five times";
    EXPECT_LT(givenUp, 25U) << "three in a hundred are acknowledged none of five times";
    socket().onSent = nullptr;
    backend->cleanup();
    fakes.scheduler.runUntilIdle();
  }
  EXPECT_EQ(fakes.udpSockets.openSockets(), 0);
}

// ---- The end

TEST_F(DashboardTest, CleanUpWithNothingPendingEndsEverythingAtOnce) {
  for (const PropertyDictionary& more : std::vector<PropertyDictionary>{{}, {{"reliable", 500}}}) {
    auto backend = makeWith(section(more));
    const std::weak_ptr<DashboardBackend> weak = backend;
    backend->cleanup();
    fakes.scheduler.runUntilIdle();
    EXPECT_FALSE(socket().isOpen);
    EXPECT_FALSE(socket().isRead());
    EXPECT_FALSE(isTimerArmed());
    backend.reset();
    fakes.scheduler.runUntilIdle();
    EXPECT_TRUE(weak.expired()) << "no handler owns it any more";
  }
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(DashboardTest, CleanUpWaitsForWhatIsPending) {
  auto backend = makeReliable();
  const std::weak_ptr<DashboardBackend> weak = backend;
  sendEvent(*backend, 1);
  backend->cleanup();
  backend.reset();
  tick();
  EXPECT_EQ(
      log.lines(),
      (std::vector<RecordingLog::Line>{
          {log::Level::standard, "DashboardBackend(myPeriodicTask): scheduled last resort clean-up in 9500 ms."}}));
  EXPECT_FALSE(weak.expired()) << "its handlers own it";
  tick();
  EXPECT_EQ(sent(1), 2) << "the schedule goes on";
  acknowledge(1);
  EXPECT_TRUE(socket().isOpen) << "until the next tick";
  EXPECT_TRUE(isTimerArmed());
  tick();
  EXPECT_EQ(log.lines().back(), (RecordingLog::Line{log::Level::standard, texts::kCleanUpAtTick}));
  EXPECT_FALSE(socket().isOpen);
  EXPECT_FALSE(socket().isRead());
  tick(20);
  EXPECT_FALSE(isTimerArmed());
  EXPECT_TRUE(weak.expired());
}

TEST_F(DashboardTest, BestEffortCleansUpOnceItHasSentTheRest) {
  auto backend = makeBestEffort();
  fakes.udpSockets.sendError = 101;
  sendEvent(*backend, 1);
  backend->cleanup();
  tick();
  EXPECT_TRUE(socket().isOpen);
  fakes.udpSockets.sendError = 0;
  tick();
  EXPECT_EQ(sent(1), 1);
  EXPECT_FALSE(socket().isOpen);
  EXPECT_EQ(log.count(texts::kCleanUpAtTick), 1);
}

TEST_F(DashboardTest, LastResortEndsWhatNeverDrains) {
  auto backend = makeReliable();
  const std::weak_ptr<DashboardBackend> weak = backend;
  fakes.udpSockets.sendError = 101;
  sendEvent(*backend, 1);
  backend->cleanup();
  backend.reset();
  tick();
  fakes.scheduler.advance(std::chrono::milliseconds(9'499));
  EXPECT_TRUE(socket().isOpen);
  fakes.scheduler.advance(std::chrono::milliseconds(1));
  EXPECT_FALSE(socket().isOpen);
  EXPECT_FALSE(socket().isRead());
  EXPECT_FALSE(isTimerArmed());
  EXPECT_TRUE(weak.expired());
  EXPECT_EQ(log.count(texts::kCleanUpAtTick), 0);
}

TEST_F(DashboardTest, LastResortComesNoEarlierThanTheScheduleOfWhatWasJustSent) {
  auto backend = makeReliable();
  sendEvent(*backend, 1);
  backend->cleanup();
  tick(20);
  EXPECT_EQ(sent(1), 5) << "all five sendings before the end";
  EXPECT_FALSE(socket().isOpen);
}

TEST_F(DashboardTest, ASecondCleanUpFindsNothingToEnd) {
  auto backend = makeReliable();
  backend->cleanup();
  backend->cleanup();
  fakes.scheduler.runUntilIdle();
  EXPECT_FALSE(socket().isOpen);
  EXPECT_EQ(fakes.udpSockets.openSockets(), 0);
}

TEST_F(DashboardTest, AfterCleanUpSendsFailAndStay) {
  auto backend = makeReliable();
  const std::weak_ptr<DashboardBackend> weak = backend;
  backend->cleanup();
  fakes.scheduler.runUntilIdle();
  for (std::uint16_t number = 1; number <= 60; ++number) EXPECT_TRUE(sendEvent(*backend, number));
  EXPECT_TRUE(socket().sent.empty());
  EXPECT_FALSE(isTimerArmed());
  backend->cleanup();
  tick(40);
  EXPECT_FALSE(isTimerArmed());
  backend.reset();
  fakes.scheduler.runUntilIdle();
  EXPECT_TRUE(weak.expired());
}

TEST_F(DashboardTest, AcknowledgementsOnTheirWayAtTheEndAreDropped) {
  auto backend = makeReliable();
  FakeUdpSockets::deliver(socket(), ByteData(62));
  backend->cleanup();
  FakeUdpSockets::deliver(socket(), ByteData(62));
  fakes.scheduler.runUntilIdle();
  EXPECT_FALSE(socket().isOpen);
}

}  // namespace
}  // namespace velk::test
