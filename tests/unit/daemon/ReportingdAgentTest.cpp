#include "tests/unit/daemon/AgentFixture.h"

namespace velk {
namespace {

using namespace std::chrono_literals;
using ReportingdAgentTest = test::AgentFixture;

TEST_F(ReportingdAgentTest, RefusesAPeerWithoutTheEntitlementAndTouchesNothing) {
  const auto connection = connect({});
  EXPECT_FALSE(accepted);
  EXPECT_FALSE(connection->resumed);
  EXPECT_EQ(connection->exported, nullptr);
  EXPECT_EQ(sessionCount(), 0U);
  EXPECT_EQ(fakes.keepAlive.begun, 0);
  EXPECT_EQ(logged(daemontexts::kConnectionRefused, "<connection>"), 1);
}

TEST_F(ReportingdAgentTest, AcceptsAnEntitledPeerAndExportsASession) {
  const auto connection = connect();
  EXPECT_TRUE(accepted);
  EXPECT_TRUE(connection->resumed);
  EXPECT_EQ(connection->exported, made.front());
  EXPECT_EQ(sessionCount(), 1U);
  EXPECT_EQ(logged(daemontexts::kConnectionAccepted, "<connection>", 0, 0), 1);
}

TEST_F(ReportingdAgentTest, TellsTheNumbersFromBeforeTheNewSession) {
  connect();
  made.back()->token = "tree";
  agent->updateCorrelatedSessions(*made.back());
  connect();
  EXPECT_EQ(logged(daemontexts::kConnectionAccepted, "<connection>", 1, 1), 1);
}

TEST_F(ReportingdAgentTest, CountsAKeepAliveReferenceForEachSession) {
  connect();
  EXPECT_EQ(fakes.keepAlive.begun, 1);
  connect();
  EXPECT_EQ(fakes.keepAlive.begun, 1);
  EXPECT_EQ(keepAliveCount(), 2);
}

TEST_F(ReportingdAgentTest, KeepsTheSessionOfAnInterruptedConnection) {
  const auto connection = connect();
  connection->interrupt();
  EXPECT_EQ(sessionCount(), 1U);
  EXPECT_EQ(made.front()->teardowns, 0);
  EXPECT_EQ(logged(daemontexts::kConnectionInterrupted, made.front()->description()), 1);
}

TEST_F(ReportingdAgentTest, LetsTheSessionOfAnEndedConnectionGoAndThenTearsItDown) {
  const auto connection = connect();
  const auto session = made.front();
  connection->end();
  EXPECT_EQ(sessionCount(), 0U);
  EXPECT_EQ(session->teardowns, 1);
  EXPECT_EQ(logged(daemontexts::kConnectionInvalidated, session->description()), 1);
  EXPECT_EQ(logged(daemontexts::kSessionInvalidated, session->description()), 1);
  // Nothing holds the session any more but this test: the fixture's list, and `session`.
  EXPECT_EQ(session.use_count(), 2);
  // The reference is the session's (or its transport's) to give back, not the invalidation's.
  EXPECT_EQ(keepAliveCount(), 1);
  EXPECT_TRUE(agent->waitForTeardowns(0s));
}

TEST_F(ReportingdAgentTest, WaitsForTeardownsNoLongerThanItIsTold) {
  const auto connection = connect();
  EXPECT_FALSE(agent->waitForTeardowns(0s));
  agent->invalidateAllSessions();
  EXPECT_TRUE(connection->invalidated);
  connection->end();
  EXPECT_TRUE(agent->waitForTeardowns(0s));
}

TEST_F(ReportingdAgentTest, ReleasesUnderItsOwnLockThatTheCallerHoldsAlready) {
  connect();
  {
    Guard guard(agent->monitor());
    agent->releaseIPCTransactions(1);
  }
  EXPECT_EQ(fakes.keepAlive.ended, 1);
}

TEST_F(ReportingdAgentTest, LetsFiveSessionsOfOneTypeProceedAndEndsTheSixth) {
  bool limitReached = false;
  std::shared_ptr<test::FakeReportingdSession> session;
  for (int number = 0; number < 5; ++number) {
    session = configured(9, limitReached);
    EXPECT_FALSE(limitReached);
    EXPECT_EQ(session->invalidations, 0);
  }
  EXPECT_EQ(logged(daemontexts::kActiveCountIncremented, 9, 5), 1);
  const auto sixth = configured(9, limitReached);
  EXPECT_TRUE(limitReached);
  EXPECT_EQ(sixth->invalidations, 1);
  EXPECT_EQ(loggedAsError(daemontexts::kActiveLimitExceeded, sixth->number, 9), 1);
  EXPECT_EQ(activeClients(9), 6);
  agent->invalidateReportingSession(sixth);
  EXPECT_EQ(activeClients(9), 5);
  EXPECT_EQ(logged(daemontexts::kActiveCountDecremented, 9, 5), 1);
}

TEST_F(ReportingdAgentTest, CountsASessionOnceHoweverOftenItIsAsked) {
  bool limitReached = false;
  for (int number = 0; number < 5; ++number) configured(9, limitReached);
  const auto session = made.back();
  EXPECT_FALSE(agent->isActiveClientLimitReachedForSession(*session, *session->info));
  EXPECT_EQ(activeClients(9), 5);
  // Not even a session info without client type ends one that is counted.
  EXPECT_FALSE(agent->isActiveClientLimitReachedForSession(*session, {}));
  EXPECT_EQ(session->invalidations, 0);
}

TEST_F(ReportingdAgentTest, EndsASessionWithoutClientType) {
  const auto session = create();
  const PropertyDictionary info{{kVelkReportingSessionInfoSessionID, 3}};
  EXPECT_TRUE(agent->isActiveClientLimitReachedForSession(*session, info));
  EXPECT_EQ(session->invalidations, 1);
  EXPECT_TRUE(session->counted);
  EXPECT_EQ(loggedAsError(daemontexts::kMissingClientType, session->number, info), 1);
}

TEST_F(ReportingdAgentTest, TakesTypesOutsideTheTableWithoutCountingThem) {
  bool limitReached = true;
  for (int number = 0; number < 7; ++number) {
    for (const std::int64_t type : {-1, 31, 1'000'000}) {
      const auto session = configured(type, limitReached);
      EXPECT_FALSE(limitReached);
      EXPECT_TRUE(session->counted);
      agent->invalidateReportingSession(session);
    }
  }
  EXPECT_TRUE(agent->copyStatus().dictionary("activeClients")->empty());
}

TEST_F(ReportingdAgentTest, CountsTheLastTypeOfTheTable) {
  bool limitReached = false;
  configured(30, limitReached);
  EXPECT_EQ(activeClients(30), 1);
}

TEST_F(ReportingdAgentTest, LowersTheCounterOfASessionThatWasNeverCounted) {
  bool limitReached = false;
  configured(9, limitReached);
  const auto uncounted = create();
  uncounted->info = PropertyDictionary{{kVelkReportingSessionInfoClientType, 9}};
  agent->invalidateReportingSession(uncounted);
  EXPECT_EQ(activeClients(9), 0);
  const auto another = create();
  another->info = uncounted->info;
  agent->invalidateReportingSession(another);
  EXPECT_EQ(activeClients(9), 0);
}

TEST_F(ReportingdAgentTest, LowersTheNewTypesCounterWhenACountedSessionChangedItsType) {
  bool limitReached = false;
  const auto changed = configured(9, limitReached);
  configured(10, limitReached);
  changed->info = PropertyDictionary{{kVelkReportingSessionInfoClientType, 10}};
  agent->invalidateReportingSession(changed);
  EXPECT_EQ(activeClients(9), 1);
  EXPECT_EQ(activeClients(10), 0);
}

TEST_F(ReportingdAgentTest, GivesThePlaceOfAClientThatHasGoneBackAtOnceAndOnce) {
  bool limitReached = false;
  configured(9, limitReached);
  const auto connection = connect();
  const auto session = made.back();
  session->info = PropertyDictionary{{kVelkReportingSessionInfoClientType, 9}};
  static_cast<void>(agent->isActiveClientLimitReachedForSession(*session, *session->info));
  EXPECT_EQ(activeClients(9), 2);
  connection->depart();
  settleDepartures();
  EXPECT_EQ(activeClients(9), 1);
  EXPECT_EQ(session->departures, 1);
  EXPECT_EQ(session->invalidations, 0) << "what it left behind still runs";
  // It may have been described again in between.
  EXPECT_FALSE(agent->isActiveClientLimitReachedForSession(*session, *session->info));
  connection->end();
  EXPECT_EQ(activeClients(9), 1);
}

TEST_F(ReportingdAgentTest, ClientThatHasGoneBeforeItsSessionInfoRanIsNotCountedForEver) {
  bool limitReached = false;
  configured(9, limitReached);
  const auto connection = connect();
  const auto session = made.back();
  connection->depart();
  settleDepartures();
  session->info = PropertyDictionary{{kVelkReportingSessionInfoClientType, 9}};
  EXPECT_FALSE(agent->isActiveClientLimitReachedForSession(*session, *session->info));
  EXPECT_EQ(activeClients(9), 1);
  connection->end();
  EXPECT_EQ(activeClients(9), 1);
}

TEST_F(ReportingdAgentTest, SixthSessionIsRefusedAlthoughItsClientHasGone) {
  bool limitReached = false;
  for (int number = 0; number < 5; ++number) configured(9, limitReached);
  const auto connection = connect();
  const auto sixth = made.back();
  connection->depart();
  settleDepartures();
  sixth->info = PropertyDictionary{{kVelkReportingSessionInfoClientType, 9}};
  EXPECT_TRUE(agent->isActiveClientLimitReachedForSession(*sixth, *sixth->info));
  EXPECT_EQ(activeClients(9), 5);
  connection->end();
  EXPECT_EQ(activeClients(9), 5);
}

TEST_F(ReportingdAgentTest, DepartureThatIsHeardOfAfterTheEndChangesNothing) {
  bool limitReached = false;
  configured(9, limitReached);
  const auto connection = connect();
  const auto session = made.back();
  session->info = PropertyDictionary{{kVelkReportingSessionInfoClientType, 9}};
  static_cast<void>(agent->isActiveClientLimitReachedForSession(*session, *session->info));
  connection->depart();
  connection->end();
  settleDepartures();
  EXPECT_EQ(activeClients(9), 1);
}

TEST_F(ReportingdAgentTest, DropsTheSharedDataWithTheLastSessionOfAHierarchy) {
  const auto root = create();
  const auto child = create();
  for (const auto& session : {root, child}) {
    session->token = "tree";
    agent->updateCorrelatedSessions(*session);
  }
  agent->updateSharedDataForSession(*root, {{"a", 1}});
  agent->invalidateReportingSession(root);
  EXPECT_TRUE(agent->sharedDataForSession(*child).has_value());
  agent->invalidateReportingSession(child);
  EXPECT_EQ(agent->sharedDataForSession(*child), std::nullopt);
  EXPECT_EQ(integerValue(agent->copyStatus().find("hierarchyCount")), 0);
}

TEST_F(ReportingdAgentTest, LeavesNothingOfASessionThatForgotItsTokenBeforeItEnded) {
  const auto session = create();
  session->token = "tree";
  agent->updateCorrelatedSessions(*session);
  agent->updateSharedDataForSession(*session, {{"a", 1}});
  session->token = std::nullopt;
  agent->updateCorrelatedSessions(*session);
  agent->invalidateReportingSession(session);
  EXPECT_EQ(integerValue(agent->copyStatus().find("hierarchyCount")), 0);
  session->token = "tree";
  EXPECT_EQ(agent->sharedDataForSession(*session), std::nullopt);
}

TEST_F(ReportingdAgentTest, SharesDataWithinAHierarchyOnly) {
  const auto root = create();
  const auto child = create();
  const auto standalone = create();
  root->token = child->token = "tree";
  child->level = 1;
  agent->updateSharedDataForSession(*child, {{"a", 1}, {"b", 2}});
  agent->updateSharedDataForSession(*root, {{"a", 3}});
  EXPECT_EQ(agent->sharedDataForSession(*root), (PropertyDictionary{{"a", 3}, {"b", 2}}));
  agent->removeObjectFromSharedDataForSession(*root, "a");
  EXPECT_EQ(agent->sharedDataForSession(*child), (PropertyDictionary{{"b", 2}}));
  agent->updateSharedDataForSession(*standalone, {{"c", 1}});
  agent->removeObjectFromSharedDataForSession(*standalone, "c");
  EXPECT_EQ(agent->sharedDataForSession(*standalone), std::nullopt);
}

TEST_F(ReportingdAgentTest, AnEmptySharedDictionaryIsData) {
  const auto session = create();
  session->token = "tree";
  EXPECT_EQ(agent->sharedDataForSession(*session), std::nullopt);
  agent->updateSharedDataForSession(*session, {});
  EXPECT_EQ(agent->sharedDataForSession(*session), PropertyDictionary{});
}

TEST_F(ReportingdAgentTest, SharedDataStayWithinTheirBound) {
  const auto session = create();
  session->token = "tree";
  agent->updateSharedDataForSession(*session, {{"first", std::string(300'000, 'x')}});
  agent->updateSharedDataForSession(*session, {{"second", std::string(300'000, 'x')}});
  EXPECT_FALSE(agent->sharedDataForSession(*session)->contains("second"));
  EXPECT_TRUE(log.contains("data are not taken: those of its hierarchy would exceed"));
  agent->updateSharedDataForSession(*session, {{"first", "short"}, {"second", std::string(300'000, 'x')}});
  EXPECT_EQ(*agent->sharedDataForSession(*session)->string("first"), "short");
}

TEST_F(ReportingdAgentTest, ASessionWithoutNamesGivesNoTransportOfOthersBack) {
  const auto nameless = create();
  nameless->user = PropertyDictionary{{"color", "red"}};
  const auto emptyName = create();
  emptyName->user = PropertyDictionary{{kVelkReportingUserInfoClientName, ""}};
  EXPECT_EQ(agent->copySharedConnectivityHelperForReportingSession(*nameless, 4), nullptr);
  EXPECT_NE(agent->copySharedConnectivityHelperForReportingSession(*emptyName, 4), nullptr);
  agent->releaseSharedConnectivityHelperForReportingSession(*nameless);
  const auto status = agent->copyStatus();
  ASSERT_EQ(status.array("helpers")->size(), 1U);
  EXPECT_EQ(integerValue((*status.array("helpers"))[0].dictionary()->find("usage")), 1);
  EXPECT_EQ(logged(daemontexts::kReleasingHelper, ":"), 1);
}

TEST_F(ReportingdAgentTest, AnswersTheStatusToPeersThatMayReadItOnly) {
  const auto plain = connect();
  EXPECT_FALSE(plain->statusHandler);
  const auto entitled = connect({std::string(kServiceEntitlement), std::string(kStatusEntitlement)});
  fakes.process.memory = 4711;
  std::optional<PropertyDictionary> status;
  entitled->statusHandler([&](PropertyDictionary answer) { status = std::move(answer); });
  ASSERT_TRUE(status.has_value());
  EXPECT_EQ(status->array("sessions")->size(), 1U) << "the reader's own has described nothing";
  EXPECT_EQ(integerValue(status->find("processMemory")), 4711);
  EXPECT_EQ(integerValue(status->find("keepAliveCount")), 1);
}

TEST_F(ReportingdAgentTest, SnapshotsSessionsInTheirOrderAndStorebagsByName) {
  const auto first = create();
  const auto second = create();
  serveBag(bagWithSections("4"));
  setEnvironment(kEnvironmentRelease);
  first->info = PropertyDictionary{{kVelkReportingSessionInfoClientType, test::kBramble}};
  EXPECT_TRUE(agent->storebagForSession(*first).has_value());
  const auto state = agent->copyReportingAgentState();
  ASSERT_EQ(state.sessions.size(), 2U);
  EXPECT_EQ(state.sessions[0], first);
  EXPECT_EQ(state.sessions[1], second);
  const auto* entry = state.cachedStorebags.dictionary("bramble");
  ASSERT_NE(entry, nullptr);
  EXPECT_EQ(*entry->string("StorebagVersion"), "4");
  EXPECT_EQ(*entry->string("StorebagFetchState"), "Fetch Successful");
}

}  // namespace
}  // namespace velk
