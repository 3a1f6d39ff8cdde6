#include "foundation/Base64.h"
#include "tests/unit/session/SessionFixture.h"

namespace velk::test {
namespace {

using namespace session_texts;

class ConfigurationTest : public SessionTest {
 protected:
  static constexpr auto kRequire = kVelkReportingSessionInfoRequireUserInfo;
};

PropertyDictionary hierarchy(PropertyValue token, int level) {
  return PropertyDictionary{{kVelkReportingSessionInfoHierarchyToken,
                             PropertyDictionary{{kVelkReportingHierarchyTokenTokenID, std::move(token)},
                                                {kVelkReportingHierarchyTokenLevel, level}}}};
}

TEST_F(ConfigurationTest, CreationSaysWhoMadeItAndItsIdentifier) {
  EXPECT_EQ(recordedLog.count("initWithSessionDelegate: ReportingdSession initWithSessionDelegate:<agent>"), 1);
  EXPECT_EQ(recordedLog.count("initWithSessionDelegate: Initialized session with UUID " + session->sessionIDString()),
            1);
}

TEST_F(ConfigurationTest, IdentifierIsSixteenBytesInBase64) {
  EXPECT_EQ(session->sessionIDString().size(), 24U);
  EXPECT_EQ(session->sessionIDString().substr(22), "==");
  EXPECT_EQ(base64Decoded(session->sessionIDString())->size(), 16U);
  EXPECT_NE(makeSession(connection)->sessionIDString(), session->sessionIDString());
}

TEST_F(ConfigurationTest, StoresTheDescription) {
  describe(hierarchy("T", 2), userNamed("Media", "Calls"), true);
  EXPECT_EQ(session->sessionID(), 7U);
  EXPECT_EQ(integerValue(session->sessionInfo()->find(kVelkReportingSessionInfoClientType)), 8);
  EXPECT_EQ(session->userInfo(), userNamed("Media", "Calls"));
  EXPECT_EQ(session->hierarchyToken(), "T");
  EXPECT_EQ(session->hierarchyLevel(), 2U);
  EXPECT_TRUE(session->hasAggregator());
  EXPECT_EQ(recordedLog.count(log::Level::standard, "setSessionInfo: Configuring session 7"), 1);
}

TEST_F(ConfigurationTest, JoinsItsRelativesBeforeItTakesAHelper) {
  describe(hierarchy("T", 2), userNamed("Media", "Calls"));
  EXPECT_EQ(journal.entries(), (std::vector<std::string>{"updateCorrelatedSessions T 2", "copyHelper media:calls 4"}));
}

TEST_F(ConfigurationTest, KeepsOnlyTheSessionInfoWhenTheLimitIsReached) {
  delegate.limitReached = true;
  describe(hierarchy("T", 2), userNamed("Media", "Calls"), true);
  EXPECT_TRUE(session->sessionInfo().has_value());
  EXPECT_EQ(session->sessionID(), 0U);
  EXPECT_FALSE(session->userInfo().has_value());
  EXPECT_FALSE(session->hierarchyToken().has_value());
  EXPECT_FALSE(session->hasAggregator());
  EXPECT_TRUE(journal.entries().empty());
  EXPECT_EQ(connection->invalidations, 1);
}

TEST_F(ConfigurationTest, MissingSessionNumberReadsAsZero) {
  session->setSessionInfo(PropertyDictionary{{kVelkReportingSessionInfoClientType, 8}}, std::nullopt, {}, false);
  EXPECT_EQ(session->sessionID(), 0U);
  EXPECT_EQ(recordedLog.count("setSessionInfo: Configuring session 0"), 1);
}

TEST_F(ConfigurationTest, SessionNumberIsCutToThirtyTwoBits) {
  describe({{kVelkReportingSessionInfoSessionID, std::int64_t{1} << 32 | 9}});
  EXPECT_EQ(session->sessionID(), 9U);
}

TEST_F(ConfigurationTest, WarnsOfUserInfoThatIsNotSaidToBeRequired) {
  describe({}, userNamed("a", "b"));
  EXPECT_EQ(recordedLog.count(log::Level::error, kUserInfoNotRequired), 1);  // an absent key counts as false here
  describe({{kRequire, false}}, userNamed("a", "b"));
  EXPECT_EQ(recordedLog.count(log::Level::error, kUserInfoNotRequired), 2);
  describe({{kRequire, true}}, userNamed("a", "b"));
  describe({{kRequire, false}});
  EXPECT_EQ(recordedLog.count(log::Level::error, kUserInfoNotRequired), 2);
}

TEST_F(ConfigurationTest, HierarchyTokenThatIsTextIsIgnored) {
  describe(hierarchy("T", 2));
  describe({{kVelkReportingSessionInfoHierarchyToken, "T"}});
  EXPECT_FALSE(session->hierarchyToken().has_value());
  EXPECT_EQ(session->hierarchyLevel(), 0U);
}

TEST_F(ConfigurationTest, OneNameMakesUserInfoValid) {
  describe({}, PropertyDictionary{{kVelkReportingUserInfoServiceName, "Calls"}});
  EXPECT_TRUE(session->hasValidUserInfoKeys());
  EXPECT_EQ(journal.count("copyHelper :calls 4"), 1);
}

TEST_F(ConfigurationTest, UserInfoWithoutNamesGetsNoHelperAndLeavesItToTheAgentThatThereIsNoneToGiveBack) {
  describe({}, PropertyDictionary{{"color", "red"}});
  EXPECT_FALSE(session->hasValidUserInfoKeys());
  session->teardown();
  int releases = 0;
  for (const auto& entry : journal.entries()) {
    EXPECT_EQ(entry.find("copyHelper"), std::string::npos) << entry;
    releases += entry == "releaseHelper :";
  }
  EXPECT_EQ(releases, 1);
}

TEST_F(ConfigurationTest, NewUserInfoGivesTheOldHelperBackFirst) {
  describe({}, userNamed("a", "b"));
  journal.clear();
  fetchStates(userNamed("c", "d"));
  const auto entries = journal.entries();
  ASSERT_GE(entries.size(), 2U);
  EXPECT_EQ(entries[0], "releaseHelper a:b");
  EXPECT_EQ(entries[1], "copyHelper c:d 4");
}

TEST_F(ConfigurationTest, RepliesThreeAbsentArraysWithoutAStorebag) {
  describe();
  const auto answer = configure();
  EXPECT_EQ(answer.calls, 1);
  EXPECT_FALSE(answer.states || answer.whitelist || answer.blacklist);
  EXPECT_EQ(session->backends(), nullptr);
  EXPECT_EQ(recordedLog.count("startConfigWithCompletionHandler: Starting configuration for session 7"), 1);
  send(message(1, 2));
  EXPECT_EQ(recordedLog.count(kNoBackendsForMessage), 1);
}

TEST_F(ConfigurationTest, BuildsABackendForEachSectionInTheStorebagsOrder) {
  delegate.storebag = PropertyDictionary{{"splunk", PropertyDictionary()},
                                         {"release_timeout", 5},
                                         {"dashboard", PropertyDictionary()},
                                         {"korrin", PropertyDictionary()}};
  describe();
  const auto answer = configure();
  EXPECT_EQ(answer.states, (PropertyArray{"splunk", "dashboard", "korrin"}));
  EXPECT_EQ(recordedLog.count("createBackendsWithStorebag: Creating backends for session 7"), 1);
}

TEST_F(ConfigurationTest, GivesBackendsWhatTheyStampOnEvents) {
  fakes.clock().setWallTime(TimeValue{1000, 250000});
  describe({{kVelkReportingSessionInfoClientVersion, 65536 + 3}, {kVelkReportingSessionInfoBatchEvent, true}},
           userNamed("a", "b"));
  serveBackends({"splunk"});
  configure();
  EXPECT_EQ(backend("splunk").attributes(),
            "7 8 3 0123456789abcdef0123456789abcdef01234567 12.5 12A5 Oak 0 1 1 0 1000.250000 Tree");
  EXPECT_EQ(backend("splunk").clientType, 8);
  EXPECT_EQ(backend("splunk").heldUserInfo(), userNamed("a", "b"));
  EXPECT_EQ(backend("splunk").combinedID(), session->sessionIDString());
  EXPECT_EQ(backend("splunk").transport(), delegate.helper("a:b"));
}

TEST_F(ConfigurationTest, AbsentFlagsMeanUserInfoRequiredAndNoBatching) {
  describe();
  serveBackends({"splunk"});
  configure();
  EXPECT_EQ(backend("splunk").attributes(),
            "7 8 0 0123456789abcdef0123456789abcdef01234567 12.5 12A5 Oak 0 1 0 0 1600000000.000000 Tree");
}

TEST_F(ConfigurationTest, NestedDataDependsOnClientTypeAndBuild) {
  const auto allowed = [this](int clientType) {
    const auto backends = createBackends(
        &*delegate.storebag,
        std::make_unique<PropertyDictionary>(PropertyDictionary{{kVelkReportingSessionInfoClientType, clientType}})
            .get(),
        std::nullopt, "", services);
    return backend("splunk").nestedDataAllowed();
  };
  serveBackends({"splunk"});
  EXPECT_FALSE(allowed(7));
  EXPECT_TRUE(allowed(28));
  EXPECT_FALSE(allowed(8));
}

TEST_F(ConfigurationTest, ClientTypeSevenGetsNestedDataOnInternalBuilds) {
  makeInternalBuild();
  describe({{kVelkReportingSessionInfoClientType, 7}});
  serveBackends({"splunk"});
  configure();
  EXPECT_TRUE(backend("splunk").nestedDataAllowed());
}

TEST_F(ConfigurationTest, CreatesNoBackendsFromNothing) {
  const PropertyDictionary empty;
  EXPECT_EQ(createBackends(nullptr, &empty, std::nullopt, "", services), nullptr);
  EXPECT_EQ(recordedLog.count(log::Level::error, kBackendsWithoutStorebag), 1);
  EXPECT_EQ(createBackends(&empty, nullptr, std::nullopt, "", services), nullptr);
  EXPECT_EQ(recordedLog.count(log::Level::error, kBackendsWithoutSessionInfo), 1);
  const auto none = createBackends(&empty, &empty, std::nullopt, "", services);
  ASSERT_NE(none, nullptr);
  EXPECT_TRUE(none->empty());
}

TEST_F(ConfigurationTest, SecondConfigurationKeepsTheFirstBackends) {
  start({"splunk"});
  const auto before = session->backends();
  const auto answer = configure();
  EXPECT_EQ(session->backends(), before);
  EXPECT_EQ(made.size(), 1U);
  EXPECT_TRUE(backend("splunk").sent.empty());
  EXPECT_EQ(recordedLog.count(log::Level::error,
                              "startConfigWithCompletionHandler: has been called more than once for session 7"),
            1);
  EXPECT_EQ(answer.states, PropertyArray{"splunk"});
}

TEST_F(ConfigurationTest, StartMessageFollowsTheDownstreamUpdate) {
  serveBackends({"splunk"});
  describe();
  journal.clear();
  configure();
  EXPECT_EQ(journal.entries(), (std::vector<std::string>{"updateDownstreamSessions", "send splunk 0/0"}));
}

TEST_F(ConfigurationTest, HelperIsActivatedWhenABackendIsEnabled) {
  start({"splunk"}, {}, userNamed("a", "b"));
  fakes.scheduler.runUntilIdle();
  EXPECT_TRUE(booleanValue(delegate.helper("a:b")->status().find("active")));
}

TEST_F(ConfigurationTest, HelperStaysInactiveWithoutAnEnabledBackend) {
  prepareBackend = [](FakeBackend& each) { each.nextState = kBackendWaiting; };
  start({"splunk"}, {}, userNamed("a", "b"));
  fakes.scheduler.runUntilIdle();
  EXPECT_FALSE(booleanValue(delegate.helper("a:b")->status().find("active")));
}

TEST_F(ConfigurationTest, SessionDescribedAgainWithAnotherUserActivatesTheNewHelper) {
  start({"splunk"}, {}, userNamed("a", "b"));
  describe({}, userNamed("c", "d"));
  fakes.scheduler.runUntilIdle();
  EXPECT_TRUE(booleanValue(delegate.helper("c:d")->status().find("active")));
}

TEST_F(ConfigurationTest, HelperActivatedLaterIsReleasedAfterTheStorebagsTimeout) {
  prepareBackend = [](FakeBackend& each) { each.nextState = kBackendWaiting; };
  delegate.storebag = PropertyDictionary{{"release_timeout", 5}, {"splunk", PropertyDictionary()}};
  describe({}, userNamed("a", "b"));
  configure();
  backend("splunk").setState(kBackendEnabled);
  fakes.scheduler.runUntilIdle();
  const auto status = delegate.helper("a:b")->status();
  EXPECT_TRUE(booleanValue(status.find("active")));
  EXPECT_EQ(integerValue(status.find("releaseTimeout")), 5);
}

class ReleaseTimeoutTest : public SessionTest {
 protected:
  /// How long the helper that the user info "c:d" got after the configuration outlives the session.
  std::optional<Duration> measure() {
    describe({}, userNamed("a", "b"));
    configure();
    fetchStates(userNamed("c", "d"));
    fakes.scheduler.runUntilIdle();
    delegate.helper("a:b")->invalidate();
    fakes.scheduler.advance(std::chrono::minutes(10));
    session->teardown();
    fakes.scheduler.runUntilIdle();
    return fakes.scheduler.timeToNextDeadline();
  }
};

TEST_F(ReleaseTimeoutTest, IsThirtySecondsByDefault) {
  serveBackends({"splunk"});
  EXPECT_EQ(measure(), std::chrono::seconds(30));
}

TEST_F(ReleaseTimeoutTest, ComesFromTheStorebag) {
  delegate.storebag = PropertyDictionary{{"release_timeout", 5}, {"splunk", PropertyDictionary()}};
  EXPECT_EQ(measure(), std::chrono::seconds(5));
}

TEST_F(ConfigurationTest, DigestKeyGoesToItsBackendAlone) {
  start({"splunk", "qrs"});
  session->setDigestKey({1, 2, 3}, 2);
  EXPECT_EQ(backend("qrs").heldDigestKey(), (ByteData{1, 2, 3}));
  EXPECT_EQ(backend("qrs").heldDigestAlgorithm(), 2);
  EXPECT_FALSE(backend("splunk").heldDigestKey().has_value());
}

TEST_F(ConfigurationTest, NewUserInfoHandsOnTheDigestKeyWithAlgorithmZero) {
  start({"qrs"}, {}, userNamed("a", "b"));
  session->setDigestKey({1, 2, 3}, 2);
  fetchStates(userNamed("c", "b"));
  EXPECT_EQ(backend("qrs").heldDigestKey(), (ByteData{1, 2, 3}));
  EXPECT_EQ(backend("qrs").heldDigestAlgorithm(), 0);
}

TEST_F(ConfigurationTest, DigestKeyBeforeTheBackendsArrivesWithTheNextUserInfo) {
  describe({}, userNamed("a", "b"));
  session->setDigestKey({1, 2, 3}, 2);
  serveBackends({"qrs"});
  configure();
  EXPECT_FALSE(backend("qrs").heldDigestKey().has_value());
  fetchStates(userNamed("a", "b"));
  EXPECT_EQ(backend("qrs").heldDigestKey(), (ByteData{1, 2, 3}));
  EXPECT_EQ(backend("qrs").heldDigestAlgorithm(), 0);
}

class NewUserInfoTest : public ConfigurationTest {
 protected:
  [[nodiscard]] int announced() const {
    return recordedLog.count("receivedUserInfo: Received new user info for session 7");
  }
};

TEST_F(NewUserInfoTest, ChangedClientNameUpdatesTheStatesAndActivatesTheHelper) {
  start({"splunk"}, {}, userNamed("a", "b"));
  const int updates = backend("splunk").stateUpdates;
  const auto answer = fetchStates(userNamed("c", "b"));
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(announced(), 1);
  EXPECT_EQ(backend("splunk").stateUpdates, updates + 1);
  EXPECT_EQ(journal.count("updateDownstreamSessions"), 1);
  EXPECT_TRUE(booleanValue(delegate.helper("c:b")->status().find("active")));
  EXPECT_EQ(backend("splunk").heldUserInfo(), userNamed("c", "b"));
  EXPECT_EQ(backend("splunk").transport(), delegate.helper("c:b"));
  EXPECT_EQ(answer.states, PropertyArray{"splunk"});
  EXPECT_EQ(recordedLog.count("fetchStatesWithUserInfo: Fetching states for session 7"), 1);
}

TEST_F(NewUserInfoTest, SameUserInfoIsNotAnnounced) {
  start({"splunk"}, {}, userNamed("a", "b"));
  fetchStates(userNamed("a", "b"));
  EXPECT_EQ(announced(), 0);
  EXPECT_EQ(journal.count("updateDownstreamSessions"), 0);
}

TEST_F(NewUserInfoTest, OtherKeysReachTheBackendsWithoutAnUpdate) {
  start({"splunk"}, {}, userNamed("a", "b"));
  auto more = userNamed("a", "b");
  more.set("color", "red");
  fetchStates(more);
  EXPECT_EQ(announced(), 0);
  EXPECT_EQ(backend("splunk").heldUserInfo(), more);
}

TEST_F(NewUserInfoTest, AbsentNewNameAlwaysCountsAsChanged) {
  const PropertyDictionary onlyService{{kVelkReportingUserInfoServiceName, "b"}};
  start({"splunk"}, {}, onlyService);
  fetchStates(onlyService);
  EXPECT_EQ(announced(), 1);
}

TEST_F(NewUserInfoTest, FirstUserInfoCountsAsChanged) {
  start({"splunk"});
  fetchStates(std::nullopt);
  EXPECT_EQ(announced(), 0);
  fetchStates(userNamed("a", "b"));
  EXPECT_EQ(announced(), 1);
}

TEST_F(NewUserInfoTest, AbsentUserInfoIsIgnoredWhereItIsRequired) {
  start({"splunk"}, {}, userNamed("a", "b"));
  fetchStates(std::nullopt);
  EXPECT_EQ(session->userInfo(), userNamed("a", "b"));
  EXPECT_TRUE(journal.entries().empty());
}

TEST_F(NewUserInfoTest, AbsentUserInfoReplacesTheOldOneWhereNoneIsRequired) {
  start({"splunk"}, {{kRequire, false}}, userNamed("a", "b"));
  fetchStates(std::nullopt);
  EXPECT_FALSE(session->userInfo().has_value());
  EXPECT_FALSE(backend("splunk").heldUserInfo().has_value());
  EXPECT_EQ(announced(), 1);
  EXPECT_EQ(journal.count("releaseHelper a:b"), 1);
}

TEST_F(NewUserInfoTest, RepliesThreeAbsentArraysWhenTheLimitIsReached) {
  start({"splunk"});
  delegate.limitReached = true;
  const auto answer = fetchStates(userNamed("a", "b"));
  EXPECT_EQ(answer.calls, 1);
  EXPECT_FALSE(answer.states || answer.whitelist || answer.blacklist);
  EXPECT_FALSE(session->userInfo().has_value());
  EXPECT_EQ(delegate.limitQuestions.back(), *session->sessionInfo());
}

TEST_F(NewUserInfoTest, SessionThatWasNeverDescribedAsksWithNothing) {
  fetchStates(std::nullopt);
  EXPECT_EQ(delegate.limitQuestions.back(), PropertyDictionary());
}

TEST_F(ConfigurationTest, AbsentRepliesAreNoMatter) {
  serveBackends({"splunk"});
  describe();
  session->startConfigWithCompletionHandler(nullptr);
  session->fetchStatesWithUserInfo(std::nullopt, nullptr);
  session->sendMessageWithDictionary(message(1, 2), nullptr);
  session->flushMessagesWithCompletion(nullptr);
  session->fetchDisplayURL(nullptr);
  session->uploadFileAtPath("/a", "", FileDescriptor(), nullptr);
  session->uploadLogData({}, nullptr);
  EXPECT_EQ(backend("splunk").sent.size(), 2U);
}

TEST_F(ConfigurationTest, StatusTellsWhatASessionIs) {
  start({"splunk"}, hierarchy("T", 1), userNamed("Media", "Calls"));
  backend("splunk").batchedSize = 12;
  backend("splunk").batchedCount = 3;
  const auto status = session->statusDictionary();
  EXPECT_EQ(integerValue(status.find("sessionID")), 7);
  EXPECT_EQ(integerValue(status.find("clientType")), 8);
  EXPECT_EQ(*status.string("clientName"), "Media");
  EXPECT_EQ(*status.string("serviceName"), "Calls");
  EXPECT_EQ(*status.string("token"), "T");
  EXPECT_EQ(integerValue(status.find("level")), 1);
  EXPECT_TRUE(booleanValue(status.find("described")));
  EXPECT_FALSE(booleanValue(status.find("finished")));
  EXPECT_EQ(
      (*status.array("backends"))[0],
      PropertyValue(PropertyDictionary{{"name", "splunk"}, {"state", 2}, {"batchedEvents", 3}, {"batchedBytes", 12}}));
}

}  // namespace
}  // namespace velk::test
