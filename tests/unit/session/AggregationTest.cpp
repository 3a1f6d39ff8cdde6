#include <thread>

#include "tests/unit/session/SessionFixture.h"

namespace velk::test {
namespace {

class AggregationTest : public SessionTest {
 protected:
  static PropertyDictionary level(int number) {
    return PropertyDictionary{
        {kVelkReportingSessionInfoHierarchyToken,
         PropertyDictionary{{kVelkReportingHierarchyTokenTokenID, "T"}, {kVelkReportingHierarchyTokenLevel, number}}}};
  }
  /// An aggregating root with a connection of its own; `session` becomes its child.
  void startChildOfAggregator() {
    describe(level(0), std::nullopt, true);
    delegate.ancestor = session;
    session = makeSession(childConnection);
    start({"splunk"}, level(1), userNamed("Child", "Calls"));
    forgetStartMessages();
  }
  void forgetStartMessages() { seen = connection->calls().size(); }
  /// What the aggregator got since the session's start message.
  [[nodiscard]] std::vector<FakeConnection::Call> received() const {
    auto calls = connection->calls();
    calls.erase(calls.begin(), calls.begin() + static_cast<std::ptrdiff_t>(seen));
    return calls;
  }

  std::shared_ptr<FakeConnection> childConnection = std::make_shared<FakeConnection>();
  std::size_t seen = 0;
};

TEST_F(AggregationTest, SessionWithABlockOfItsOwnGetsItsEventsBack) {
  start({"splunk"}, {}, userNamed("Media", "Calls"), true);
  forgetStartMessages();
  fakes.clock().setWallTime(TimeValue{1000, 250000});
  send(message(5, 6, PropertyDictionary{{"p", 1}, {kVelkReportingUserInfoClientName, "forged"}}));
  ASSERT_EQ(received().size(), 1U);
  const auto call = received()[0];
  EXPECT_EQ(call.sessionInfo, session->sessionInfo());
  EXPECT_EQ(call.timestamp, 1000.25);
  EXPECT_EQ(call.category, 5);
  EXPECT_EQ(call.type, 6);
  EXPECT_EQ(call.payload,
            (PropertyDictionary{
                {"p", 1}, {kVelkReportingUserInfoClientName, "Media"}, {kVelkReportingUserInfoServiceName, "Calls"}}));
}

TEST_F(AggregationTest, UserInfoIsNotSentWithoutAPayload) {
  start({"splunk"}, {}, userNamed("Media", "Calls"), true);
  forgetStartMessages();
  send(message(5, 6));
  ASSERT_EQ(received().size(), 1U);
  EXPECT_FALSE(received()[0].payload.has_value());
}

TEST_F(AggregationTest, BackendsDoNotSeeTheMergedUserInfo) {
  start({"splunk"}, {}, userNamed("Media", "Calls"), true);
  send(message(5, 6, PropertyDictionary{{"p", 1}}));
  EXPECT_EQ(backend("splunk").sent[0].message, (PropertyDictionary{{"ClientData", PropertyDictionary{{"p", 1}}}}));
}

TEST_F(AggregationTest, AncestorGetsTheChildsEventsWithTheChildsUserInfo) {
  startChildOfAggregator();
  send(message(5, 6, PropertyDictionary{{"p", 1}}));
  ASSERT_EQ(received().size(), 1U);
  EXPECT_EQ(received()[0].sessionInfo, session->sessionInfo());
  EXPECT_EQ(*received()[0].payload->string(kVelkReportingUserInfoClientName), "Child");
  EXPECT_TRUE(childConnection->calls().empty());
}

TEST_F(AggregationTest, AncestorWinsOverTheSessionsOwnBlock) {
  describe(level(0), std::nullopt, true);
  delegate.ancestor = session;
  session = makeSession(childConnection);
  start({"splunk"}, level(1), std::nullopt, true);
  forgetStartMessages();
  send(message(5, 6));
  EXPECT_EQ(received().size(), 1U);
  EXPECT_TRUE(childConnection->calls().empty());
}

TEST_F(AggregationTest, EventThatBackendsDropIsStillAggregated) {
  prepareBackend = [](FakeBackend& each) {
    if (each.name() == "splunk") each.setWhitelist(numbers({0}));
  };
  start({"splunk", "korrin"}, {}, std::nullopt, true);
  forgetStartMessages();
  send(message(5, 6));
  EXPECT_EQ(received().size(), 1U);
  EXPECT_TRUE(backend("splunk").sent.empty());
  EXPECT_EQ(backend("korrin").sent.size(), 1U);
}

/// Looks, at each event that it is handed, at what a backend has seen so far.
class WatchingConnection : public FakeConnection {
 public:
  Result<void> sendMessageToClient(const std::optional<PropertyDictionary>& sessionInfo, double timestamp,
                                   std::uint16_t category, std::uint16_t type,
                                   const std::optional<PropertyDictionary>& payload) override {
    if (look) seenByBackend.push_back(look());
    return FakeConnection::sendMessageToClient(sessionInfo, timestamp, category, type, payload);
  }
  std::function<std::size_t()> look;
  std::vector<std::size_t> seenByBackend;
};

TEST_F(AggregationTest, AggregatorHearsOfAnEventBeforeAnyBackend) {
  const auto watching = std::make_shared<WatchingConnection>();
  session = makeSession(watching);
  start({"splunk"}, {}, std::nullopt, true);
  watching->look = [this] { return backend("splunk").sent.size(); };
  send(message(5, 6));
  send(message(5, 7));
  EXPECT_EQ(watching->seenByBackend, (std::vector<std::size_t>{0, 1}));
}

TEST_F(AggregationTest, EventThatIsNoneIsNotAggregated) {
  start({"splunk"}, {}, std::nullopt, true);
  forgetStartMessages();
  send(PropertyDictionary{{kVelkReportingMessageParametersType, 1}});
  send(PropertyDictionary{{kVelkReportingMessageParametersCategory, 1}});
  EXPECT_TRUE(received().empty());
}

TEST_F(AggregationTest, SessionWithoutBackendsAggregatesNothing) {
  describe({}, std::nullopt, true);
  send(message(5, 6));
  EXPECT_TRUE(connection->calls().empty());
}

TEST_F(AggregationTest, HealthMessagesObeyListsAsCategoryZeroAndAreAggregatedAllTheSame) {
  prepareBackend = [](FakeBackend& each) { each.setWhitelist(numbers({5})); };
  start({"splunk"}, {}, std::nullopt, true);
  forgetStartMessages();
  session->teardown();
  EXPECT_TRUE(backend("splunk").sent.empty());
  EXPECT_EQ(recordedLog.count("sendMessageWithDictionary: Dropping event with category 0 as it is not whitelisted for "
                              "backend splunk"),
            2)
      << "the start message was the first";
  ASSERT_EQ(received().size(), 2U);
  EXPECT_EQ(received()[0].type, 1);
  EXPECT_TRUE(received()[1].isEndMarker());
}

TEST_F(AggregationTest, EndThatDoesNotFitIsLoggedAndStillAnEnd) {
  start({"splunk"}, {}, std::nullopt, true);
  connection->full = true;
  session->shutdownSessionAggregation();
  EXPECT_EQ(recordedLog.count("sendMessageWithDictionary: Failed to get remote object proxy: outbox full"), 1);
  EXPECT_FALSE(session->hasAggregator());
  connection->full = false;
  forgetStartMessages();
  send(message(5, 6));
  EXPECT_TRUE(received().empty());
}

TEST_F(AggregationTest, ClearedAggregatorStaysClearedWhenItsAncestorIsGone) {
  describe(level(0), std::nullopt, true);
  delegate.ancestor = session;
  session = makeSession(childConnection);
  start({"splunk"}, level(1), std::nullopt, true);
  session->shutdownSessionAggregation();
  delegate.ancestor = nullptr;
  const auto before = childConnection->calls().size();
  fetchStates(userNamed("New", "Name"));
  send(message(5, 6));
  EXPECT_EQ(childConnection->calls().size(), before);
}

TEST_F(AggregationTest, StartAndHealthMessagesAreAggregated) {
  serveBackends({});
  describe({}, std::nullopt, true);
  configure();
  ASSERT_EQ(connection->calls().size(), 1U);
  EXPECT_EQ(connection->calls()[0].type, 0);
  session->teardown();
  ASSERT_EQ(connection->calls().size(), 3U);
  EXPECT_EQ(connection->calls()[1].category, 0);
  EXPECT_EQ(connection->calls()[1].type, 1);
  EXPECT_TRUE(connection->calls()[2].isEndMarker());
}

TEST_F(AggregationTest, OneShotMessagesAreNotAggregated) {
  start({"splunk"}, {}, userNamed("a", "b"), true);
  forgetStartMessages();
  sendOnce(*session->sessionInfo(), userNamed("a", "b"), PropertyDictionary{{"p", 1}});
  EXPECT_TRUE(received().empty());
}

TEST_F(AggregationTest, FullOutboxIsLoggedAndTheEventGoesOn) {
  startChildOfAggregator();
  connection->full = true;
  send(message(5, 6));
  EXPECT_EQ(recordedLog.count(log::Level::standard,
                              "sendMessageWithDictionary: Failed to get remote object proxy: outbox full"),
            1);
  EXPECT_EQ(backend("splunk").sent.size(), 1U);
}

TEST_F(AggregationTest, AFullOutboxIsLoggedOnceAMinute) {
  startChildOfAggregator();
  connection->full = true;
  const auto lines = [&] {
    return recordedLog.count("sendMessageWithDictionary: Failed to get remote object proxy: outbox full");
  };
  for (int event = 0; event < 100; ++event) send(message(5, 6));
  EXPECT_EQ(lines(), 1);
  fakes.clock().advance(std::chrono::minutes(1));
  for (int event = 0; event < 100; ++event) send(message(5, 6));
  EXPECT_EQ(lines(), 2);
  EXPECT_EQ(backend("splunk").sent.size(), 200U);
}

TEST_F(AggregationTest, ShutdownSendsOneEndMarkerAndNothingAfterIt) {
  start({"splunk"}, {}, std::nullopt, true);
  forgetStartMessages();
  session->shutdownSessionAggregation();
  send(message(5, 6));
  session->shutdownSessionAggregation();
  ASSERT_EQ(received().size(), 1U);
  EXPECT_TRUE(received()[0].isEndMarker());
  EXPECT_FALSE(session->hasAggregator());
  EXPECT_EQ(recordedLog.count("shutdownSessionAggregation: Disable aggregation module for session 7"), 2);
}

TEST_F(AggregationTest, RelativeThatComesLateIsNotHeardAfterTheEndMarker) {
  start({"splunk"}, {}, std::nullopt, true);
  forgetStartMessages();
  session->shutdownSessionAggregation();
  EXPECT_TRUE(session->sendToAggregator(PropertyDictionary(), 1, 2, 3, PropertyDictionary()).has_value());
  EXPECT_EQ(received().size(), 1U);
}

TEST_F(AggregationTest, SessionWithoutABlockSendsNoEndMarker) {
  start({"splunk"});
  session->shutdownSessionAggregation();
  EXPECT_TRUE(connection->calls().empty());
}

TEST_F(AggregationTest, EndMarkerIsLastHoweverManySpeakAtOnce) {
  describe({}, std::nullopt, true);
  std::vector<std::thread> relatives;
  for (int number = 0; number < 4; ++number) {
    relatives.emplace_back([this] {
      for (int event = 0; event < 200; ++event) {
        EXPECT_TRUE(session->sendToAggregator(PropertyDictionary{{"s", 1}}, 1, 2, 3, std::nullopt).has_value());
      }
    });
  }
  session->shutdownSessionAggregation();
  for (auto& relative : relatives) relative.join();
  const auto calls = connection->calls();
  ASSERT_FALSE(calls.empty());
  EXPECT_TRUE(calls.back().isEndMarker());
  for (std::size_t at = 0; at + 1 < calls.size(); ++at) EXPECT_FALSE(calls[at].isEndMarker());
}

}  // namespace
}  // namespace velk::test
