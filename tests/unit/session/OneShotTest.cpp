#include <algorithm>

#include "tests/unit/session/SessionFixture.h"

namespace velk::test {
namespace {

using namespace session_texts;

class OneShotTest : public SessionTest {
 protected:
  const PropertyDictionary info{{kVelkReportingSessionInfoClientType, 8}, {kVelkReportingSessionInfoSessionID, 7}};
  const PropertyDictionary user = userNamed("a", "b");
  const PropertyDictionary payload{{"p", 1}};
};

TEST_F(OneShotTest, SendsToEveryBackendOfItsStorebag) {
  serveBackends({"splunk", "korrin"});
  fakes.clock().setWallTime(TimeValue{1000, 5});
  EXPECT_EQ(sendOnce(info, user, payload, 3, 4), "finished");
  for (const auto* name : {"splunk", "korrin"}) {
    ASSERT_EQ(backend(name).sent.size(), 1U);
    const auto& sent = backend(name).sent[0];
    EXPECT_EQ(sent.message, payload);  // the payload itself, not a blob
    EXPECT_EQ(sent.method, 3);
    EXPECT_EQ(sent.respCode, 4);
    EXPECT_EQ(sent.flag, 0U);
    EXPECT_EQ(sent.timestamp, (TimeValue{1000, 5}));
    EXPECT_EQ(backend(name).transport(), delegate.helper("a:b"));
  }
  EXPECT_EQ(recordedLog.count("sendMessageWithSessionInfo: Sending message with session info for session 7"), 1);
  EXPECT_EQ(recordedLog.count("sendOneMessageWithSessionInfo: Sending single message with sessionID 7"), 1);
  EXPECT_EQ(recordedLog.count("receivedUserInfo: Received new user info for session 7"), 1);
}

TEST_F(OneShotTest, SampledInAfterOneSampledOutActivatesTheHelper) {
  serveBackends({"splunk"});
  prepareBackend = [](FakeBackend& each) { each.nextState = kBackendDisabled; };
  sendOnce(info, user, payload);
  fakes.scheduler.runUntilIdle();
  ASSERT_FALSE(booleanValue(delegate.helper("a:b")->status().find("active")));
  prepareBackend = nullptr;
  sendOnce(info, user, payload);
  fakes.scheduler.runUntilIdle();
  EXPECT_TRUE(booleanValue(delegate.helper("a:b")->status().find("active")));
}

TEST_F(OneShotTest, IdentifiersAreLookedAtBeforeTheLimit) {
  delegate.limitReached = true;
  EXPECT_EQ(sendOnce(PropertyDictionary(), PropertyDictionary{{"n", 1}}, payload), kReplyNoIdentifiers);
  EXPECT_EQ(session->sessionInfo(), PropertyDictionary());
  EXPECT_TRUE(delegate.limitQuestions.empty());
  EXPECT_EQ(connection->invalidations, 0);
  EXPECT_EQ(sendOnce(info, PropertyDictionary{{"n", 1}}, payload),
            "Exceeded maximum active reporting session limit for userInfo='{\"n\":1}'");
  EXPECT_EQ(session->sessionInfo(), info);
  EXPECT_EQ(connection->invalidations, 1);
}

TEST_F(OneShotTest, BackendsThatAreReplacedPostWhatTheyHaveBatched) {
  serveBackends({"splunk"});
  sendOnce(info, user, payload);
  auto old = made.back();
  journal.clear();
  sendOnce(info, user, payload);
  const auto entries = journal.entries();
  const auto flushed = std::find(entries.begin(), entries.end(), "flush splunk");
  ASSERT_NE(flushed, entries.end());
  EXPECT_NE(std::find(flushed, entries.end(), "cleanup splunk"), entries.end());
  ASSERT_EQ(old->flushes.size(), 1U);
  old->flushes[0]("text", std::nullopt);
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(messageLog.journal.count("[splunk -> flushMessages] text"), 1);
}

TEST_F(OneShotTest, NeedsClientTypeAndNumber) {
  serveBackends({"splunk"});
  EXPECT_EQ(sendOnce({{kVelkReportingSessionInfoSessionID, 7}}, user, payload), kReplyNoIdentifiers);
  EXPECT_EQ(sendOnce({{kVelkReportingSessionInfoClientType, 7}}, user, payload), kReplyNoIdentifiers);
  EXPECT_EQ(recordedLog.count(log::Level::error,
                              "sendMessageWithSessionInfo: Could not retrieve identifiers from sessionInfo"),
            2);
  EXPECT_TRUE(made.empty());
  EXPECT_TRUE(journal.entries().empty());
}

TEST_F(OneShotTest, SaysSoWithoutAStorebag) {
  EXPECT_EQ(sendOnce(info, user, payload), "storebag not available");
  EXPECT_EQ(session->sessionID(), 7U);
  EXPECT_EQ(journal.entries(), std::vector<std::string>{"updateCorrelatedSessions (null) 0"});
}

TEST_F(OneShotTest, JoinsTheHierarchyOfItsToken) {
  serveBackends({"splunk"});
  auto child = info;
  child.set(kVelkReportingSessionInfoHierarchyToken,
            PropertyDictionary{{kVelkReportingHierarchyTokenTokenID, "T"}, {kVelkReportingHierarchyTokenLevel, 1}});
  sendOnce(child, user, payload);
  EXPECT_EQ(journal.entries().front(), "updateCorrelatedSessions T 1");
}

TEST_F(OneShotTest, NeedsUserInfo) {
  serveBackends({"splunk"});
  EXPECT_EQ(sendOnce(info, std::nullopt, payload), "finished");
  EXPECT_EQ(recordedLog.count(log::Level::error, kSingleWithoutUserInfo), 1);
  EXPECT_TRUE(made.empty());
}

TEST_F(OneShotTest, NeedsABackend) {
  serveBackends({});
  EXPECT_EQ(sendOnce(info, user, payload), "finished");
  EXPECT_EQ(recordedLog.count(log::Level::error, kNoBackendsForSingle), 1);
}

TEST_F(OneShotTest, ListsAreTestedWithTextsOfTheirOwn) {
  prepareBackend = [](FakeBackend& each) {
    if (each.name() == "splunk") each.setWhitelist(numbers({9}));
    if (each.name() == "korrin") each.setBlacklist(numbers({3}));
  };
  serveBackends({"splunk", "korrin", "quill"});
  sendOnce(info, user, payload, 3, 4);
  EXPECT_EQ(journal.count("send quill 3/4"), 1);
  EXPECT_TRUE(backend("splunk").sent.empty());
  EXPECT_TRUE(backend("korrin").sent.empty());
  EXPECT_EQ(recordedLog.count("sendOneMessageWithSessionInfo: Dropping event with category 3 as it is not whitelisted "
                              "for backend splunk"),
            1);
  EXPECT_EQ(recordedLog.count("sendOneMessageWithSessionInfo: Dropping event with category 3 as it is blacklisted for "
                              "backend korrin"),
            1);
}

TEST_F(OneShotTest, TextsAreLoggedButDoNotAnswer) {
  prepareBackend = [](FakeBackend& each) { each.text = "T"; };
  serveBackends({"splunk"});
  EXPECT_EQ(sendOnce(info, user, payload), "finished");
  EXPECT_EQ(messageLog.journal.entries(), std::vector<std::string>{"[splunk -> sendOneMessageWithSessionInfo] T"});
}

TEST_F(OneShotTest, InternalBuildsAddTheSerialNumber) {
  makeInternalBuild();
  serveBackends({"splunk"});
  sendOnce(info, user, payload);
  EXPECT_EQ(backend("splunk").sent[0].message, (PropertyDictionary{{"p", 1}, {"SerialNum", "Unknown"}}));
  fakes.device.set("SerialNumber", "S1");
  sendOnce(info, user, payload);
  EXPECT_EQ(backend("splunk").sent[0].message, (PropertyDictionary{{"p", 1}, {"SerialNum", "S1"}}));
}

TEST_F(OneShotTest, AbsentPayloadStaysAbsent) {
  makeInternalBuild();
  serveBackends({"splunk"});
  sendOnce(info, user, std::nullopt);
  ASSERT_EQ(backend("splunk").sent.size(), 1U);
  EXPECT_FALSE(backend("splunk").sent[0].message.has_value());
}

TEST_F(OneShotTest, EveryMessageBuildsItsBackendsAnewAndCleansTheOldOnesUp) {
  serveBackends({"splunk"});
  sendOnce(info, user, payload);
  const auto before = session->backends();
  sendOnce(info, user, payload);
  EXPECT_EQ(made.size(), 2U);
  EXPECT_NE(session->backends(), before);
  EXPECT_EQ(before->size(), 1U);  // who still looks at it keeps it
  EXPECT_EQ(journal.count("cleanup splunk"), 1);
  EXPECT_EQ(made[1]->sent.size(), 1U);
}

TEST_F(OneShotTest, StatesAreUpdatedForEveryMessage) {
  serveBackends({"splunk"});
  sendOnce(info, user, payload);
  EXPECT_EQ(made[0]->stateUpdates, 2);  // for the new user info, and for the message
  sendOnce(info, user, payload);
  EXPECT_EQ(made[1]->stateUpdates, 1);
}

TEST_F(OneShotTest, HealthMessageIsSentAtTheEndToo) {
  serveBackends({"splunk"});
  sendOnce(info, user, payload);
  session->teardown();
  ASSERT_EQ(backend("splunk").sent.size(), 2U);
  const auto* health = backend("splunk").sent[1].message->dictionary("ClientData");
  ASSERT_NE(health, nullptr);
  EXPECT_FALSE(health->contains("StorebagVersion"));  // one-shots never ask for it
  EXPECT_FALSE(health->contains("GracefulTermination"));
  EXPECT_TRUE(health->contains("StorebagsCount"));
}

}  // namespace
}  // namespace velk::test
