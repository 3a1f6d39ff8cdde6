#include "client/IncomingEvents.h"

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

PropertyDictionary event(int number) { return {{"number", number}}; }

TEST(IncomingEvents, OnlyTheFirstNeedsATaker) {
  IncomingEvents incoming;
  const auto ticket = incoming.add(event(1), 1);
  EXPECT_NE(ticket, 0U);
  EXPECT_EQ(incoming.add(event(2), 1), 0U);
  EXPECT_EQ(incoming.take(ticket, false).size(), 2U);
  EXPECT_NE(incoming.add(event(3), 1), 0U);
}

TEST(IncomingEvents, LingeringTakerIsExpectedUntilItFindsNothing) {
  IncomingEvents incoming;
  const auto ticket = incoming.add(event(1), 1);
  EXPECT_EQ(incoming.take(ticket, true).size(), 1U);
  EXPECT_EQ(incoming.add(event(2), 1), 0U);
  EXPECT_EQ(incoming.take(ticket, true).size(), 1U);
  EXPECT_TRUE(incoming.take(ticket, true).empty());
  EXPECT_NE(incoming.add(event(3), 1), 0U);
}

TEST(IncomingEvents, WorkTakesAlongWhatCameBeforeIt) {
  IncomingEvents incoming;
  const auto stale = incoming.add(event(1), 1);
  EXPECT_EQ(incoming.takeAll().size(), 1U);
  const auto fresh = incoming.add(event(2), 1);
  EXPECT_NE(fresh, 0U) << "the taker that was queued before the work must not overtake it";
  EXPECT_TRUE(incoming.take(stale, true).empty());
  EXPECT_EQ(incoming.take(fresh, false).size(), 1U);
}

class ClientOrder : public VelkReportingTest {};

TEST_F(ClientOrder, HoldsBetweenEventsAndCallsHoweverDense) {
  _daemon.start();
  const auto client = VelkReporting::initWithSessionInfo(
      PropertyDictionary{{"ComponentType", 9}, {"SessionID", 7}, {"BatchEvents", true}}, std::nullopt, {});
  for (int number = 0; number < 200; ++number) {
    client->sendMessageWithCategory(1, static_cast<std::uint16_t>(number));
    if (number % 7 == 0) client->updateSharedDataForKey("after", PropertyValue(number));
  }
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 200));
  int next = 0;
  for (const auto& call : _daemon.calls()) {
    if (call.method == "sendMessageWithDictionary") {
      EXPECT_EQ(integerValue(call.arguments[0].dictionary()->find("ParametersType")), next++);
    } else if (call.method == "updateSharedDataForKey") {
      EXPECT_EQ(integerValue(call.arguments[1]), next - 1);
    }
  }
}

TEST(IncomingEvents, ATakerThatIsNotComingIsReplacedByTheNextEvents) {
  IncomingEvents incoming;
  const auto first = incoming.add({{"n", 1}}, 1);
  ASSERT_NE(first, 0U);
  incoming.takerIsNotComing(first);
  const auto second = incoming.add({{"n", 2}}, 1);
  ASSERT_NE(second, 0U);
  EXPECT_EQ(incoming.take(second, false).size(), 2U);
  const auto third = incoming.add({{"n", 3}}, 1);
  EXPECT_EQ(incoming.takeAll().size(), 1U);
  const auto fourth = incoming.add({{"n", 4}}, 1);
  ASSERT_NE(fourth, 0U);
  incoming.takerIsNotComing(third);
  EXPECT_EQ(incoming.add({{"n", 5}}, 1), 0U) << "the fourth one's taker is still on its way";
}

TEST_F(ClientOrder, HoldsForOneThreadWhileOthersCall) {
  constexpr int kEvents = 4000;
  _daemon.start();
  const auto client = VelkReporting::initWithSessionInfo(
      PropertyDictionary{{"ComponentType", 9}, {"SessionID", 7}, {"BatchEvents", true}}, std::nullopt, {});
  std::atomic<bool> isOver{false};
  std::vector<std::thread> others;
  for (int number = 0; number < 3; ++number) {
    others.emplace_back([&] {
      while (!isOver) client->setMessageSentDelegate({});
    });
  }
  for (int number = 0; number < kEvents; ++number) {
    while (!client->sendMessageWithDictionary({{"ParametersCategory", 1}, {"ParametersType", number}})) {
      std::this_thread::yield();
    }
  }
  isOver = true;
  for (auto& other : others) other.join();
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", kEvents));
  int next = 0;
  for (const auto& call : _daemon.calls()) {
    if (call.method != "sendMessageWithDictionary") continue;
    ASSERT_EQ(integerValue(call.arguments[0].dictionary()->find("ParametersType")), next++);
  }
}

}  // namespace
}  // namespace velk::test
