#include "tests/unit/session/SessionFixture.h"

namespace velk::test {
namespace {

using namespace session_texts;

class MessagePipelineTest : public SessionTest {
 protected:
  static PropertyDictionary withToken() {
    return PropertyDictionary{
        {kVelkReportingSessionInfoHierarchyToken, PropertyDictionary{{kVelkReportingHierarchyTokenTokenID, "T"}}}};
  }
};

TEST_F(MessagePipelineTest, SaysThatItSends) {
  start({"splunk"});
  send(message(1, 2));
  EXPECT_EQ(recordedLog.count(log::Level::standard, "sendMessageWithDictionary: Sending message for session 7"), 1);
}

TEST_F(MessagePipelineTest, DropsMessagesWithoutCategoryOrType) {
  start({"splunk"});
  EXPECT_EQ(send({{kVelkReportingMessageParametersType, 2}}), std::nullopt);
  EXPECT_EQ(recordedLog.count(log::Level::standard, kMissingCategory), 1);
  EXPECT_EQ(send({{kVelkReportingMessageParametersCategory, 2}}), std::nullopt);
  EXPECT_EQ(recordedLog.count(log::Level::standard, kMissingType), 1);
  EXPECT_TRUE(backend("splunk").sent.empty());
}

TEST_F(MessagePipelineTest, TestsPresenceNotType) {
  start({"splunk"});
  send(message("12 monkeys", PropertyArray()));
  ASSERT_EQ(backend("splunk").sent.size(), 1U);
  EXPECT_EQ(backend("splunk").sent[0].method, 12);
  EXPECT_EQ(backend("splunk").sent[0].respCode, 0);
}

TEST_F(MessagePipelineTest, CutsCategoryAndTypeToSixteenBits) {
  start({"splunk"});
  send(message(70000, 65536 + 5));
  EXPECT_EQ(backend("splunk").sent[0].method, 4464);
  EXPECT_EQ(backend("splunk").sent[0].respCode, 5);
}

TEST_F(MessagePipelineTest, HandsOnTheFlagAndTheTime) {
  start({"splunk"});
  fakes.clock().setWallTime(TimeValue{1000, 5});
  auto dictionary = message(1, 2);
  send(dictionary);
  dictionary.set(kVelkReportingMessageParametersFlag, 5);
  send(dictionary);
  EXPECT_EQ(backend("splunk").sent[0].flag, 0U);
  EXPECT_EQ(backend("splunk").sent[1].flag, 5U);
  EXPECT_EQ(backend("splunk").sent[1].timestamp, (TimeValue{1000, 5}));
}

TEST_F(MessagePipelineTest, MessageWithoutPayloadGivesAnEmptyBlob) {
  start({"splunk"});
  send(message(1, 2));
  EXPECT_EQ(backend("splunk").sent[0].message, PropertyDictionary());
}

TEST_F(MessagePipelineTest, PayloadThatIsNoDictionaryCountsAsAbsent) {
  start({"splunk"});
  auto dictionary = message(1, 2);
  dictionary.set(kVelkReportingMessageParametersPayload, "text");
  send(dictionary);
  EXPECT_EQ(backend("splunk").sent[0].message, PropertyDictionary());
}

TEST_F(MessagePipelineTest, BlobHoldsPayloadAndSharedData) {
  start({"splunk"}, withToken());
  delegate.sharedData = PropertyDictionary{{"s", 1}};
  send(message(1, 2, PropertyDictionary{{"p", 2}}));
  EXPECT_EQ(backend("splunk").sent[0].message, (PropertyDictionary{{"SharedData", PropertyDictionary{{"s", 1}}},
                                                                   {"ClientData", PropertyDictionary{{"p", 2}}}}));
}

TEST_F(MessagePipelineTest, EmptySharedDataCounts) {
  start({"splunk"}, withToken());
  delegate.sharedData = PropertyDictionary();
  send(message(1, 2));
  EXPECT_EQ(backend("splunk").sent[0].message, (PropertyDictionary{{"SharedData", PropertyDictionary()}}));
}

TEST_F(MessagePipelineTest, EachBackendTestsItsOwnLists) {
  prepareBackend = [](FakeBackend& each) {
    if (each.name() == "splunk") each.setWhitelist(numbers({0, 9}));
    if (each.name() == "korrin") each.setBlacklist(numbers({5}));
  };
  start({"splunk", "korrin", "quill"});
  send(message(5, 1));
  EXPECT_EQ(journal.entries(), std::vector<std::string>{"send quill 5/1"});
  EXPECT_EQ(recordedLog.count("sendMessageWithDictionary: Dropping event with category 5 as it is not whitelisted for "
                              "backend splunk"),
            1);
  EXPECT_EQ(recordedLog.count("sendMessageWithDictionary: Dropping event with category 5 as it is blacklisted for "
                              "backend korrin"),
            1);
}

TEST_F(MessagePipelineTest, LaterPostBackendAnswers) {
  prepareBackend = [](FakeBackend& each) { each.text = "by " + each.name(); };
  start({"splunk", "korrin", "dashboard", "quill"});
  EXPECT_EQ(send(message(1, 2)), "by korrin");
}

TEST_F(MessagePipelineTest, OrderOfTheStorebagDecides) {
  prepareBackend = [](FakeBackend& each) { each.text = "by " + each.name(); };
  start({"dashboard", "korrin", "my_splunk_2"});
  EXPECT_EQ(send(message(1, 2)), "by my_splunk_2");
}

TEST_F(MessagePipelineTest, AbsentTextKeepsTheEarlierChoice) {
  prepareBackend = [](FakeBackend& each) {
    if (each.name() == "splunk") each.text = "by splunk";
  };
  start({"splunk", "korrin", "dashboard"});
  EXPECT_EQ(send(message(1, 2)), "by splunk");
}

TEST_F(MessagePipelineTest, DashboardAnswersWhenNobodyElseDoes) {
  prepareBackend = [](FakeBackend& each) {
    if (each.name() == "dashboard" || each.name() == "quill") each.text = "by " + each.name();
  };
  start({"quill", "dashboard", "korrin"});
  EXPECT_EQ(send(message(1, 2)), "by dashboard");
}

TEST_F(MessagePipelineTest, TextsOfOtherBackendsAreLoggedButNeverAnswer) {
  prepareBackend = [](FakeBackend& each) { each.text = "by " + each.name(); };
  start({"quill", "qrs"});
  EXPECT_EQ(send(message(1, 2)), std::nullopt);
  EXPECT_EQ(messageLog.journal.entries(), (std::vector<std::string>{"[quill -> sendMessageWithDictionary] by quill",
                                                                    "[qrs -> sendMessageWithDictionary] by qrs"}));
}

TEST_F(MessagePipelineTest, NothingIsLoggedForABackendWithoutText) {
  start({"splunk"});
  send(message(1, 2));
  EXPECT_TRUE(messageLog.journal.entries().empty());
}

class StartMessageTest : public MessagePipelineTest {
 protected:
  PropertyDictionary startPayload() {
    serveBackends({"splunk"});
    describe();
    configure();
    const auto& sent = backend("splunk").sent;
    EXPECT_EQ(sent.size(), 1U);
    EXPECT_EQ(sent[0].method, 0);
    EXPECT_EQ(sent[0].respCode, 0);
    EXPECT_EQ(sent[0].flag, 0U);
    EXPECT_EQ(recordedLog.count("internalSendMessage: Sent internal message (method:0 respCode:0)"), 1);
    return *sent[0].message->dictionary("ClientData");
  }
};

TEST_F(StartMessageTest, HasTwoEntriesOnReleasedBuilds) {
  EXPECT_EQ(startPayload(), (PropertyDictionary{{"Locale", "US"}, {"AutomaticTimeSet", true}}));
}

TEST_F(StartMessageTest, SaysUnknownWithoutACountryAndFollowsTheClockSetting) {
  fakes.locale.country = std::nullopt;
  fakes.locale.automaticTimeZone = false;
  EXPECT_EQ(startPayload(), (PropertyDictionary{{"Locale", "Unknown"}, {"AutomaticTimeSet", false}}));
}

TEST_F(StartMessageTest, HasEightEntriesOnInternalBuilds) {
  makeInternalBuild();
  fakes.device.set("SerialNumber", "S1");
  EXPECT_EQ(startPayload(), (PropertyDictionary{{"SerialNum", "S1"},
                                                {"Version", "12.5"},
                                                {"Build", "12A5"},
                                                {"Hardware", "Unknown"},
                                                {"Product", "Tree"},
                                                {"ReportVers", "8.0"},
                                                {"Locale", "US"},
                                                {"AutomaticTimeSet", true}}));
}

TEST_F(StartMessageTest, ObeysWhitelistsAsCategoryZero) {
  prepareBackend = [](FakeBackend& each) { each.setWhitelist(numbers({5})); };
  serveBackends({"splunk"});
  describe();
  configure();
  EXPECT_TRUE(backend("splunk").sent.empty());
}

TEST_F(MessagePipelineTest, SharedDataIsSetAndRemovedUnderItsKey) {
  start({"splunk"}, withToken());
  session->updateSharedDataWithDictionary({{"a", 1}, {"b", 2}});
  session->updateSharedDataForKey("a", std::nullopt);
  session->updateSharedDataForKey("c", PropertyValue("three"));
  EXPECT_EQ(delegate.sharedData, (PropertyDictionary{{"b", 2}, {"c", "three"}}));
}

}  // namespace
}  // namespace velk::test
