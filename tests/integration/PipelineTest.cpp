// One event's way: what a backend adds to it, what filters take from it, and who gets to see it.

#include <gtest/gtest.h>

#include <cmath>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

const std::vector<std::string> kStamps{"_startTS",     "_sender",        "_clientVersion", "_sessionID",
                                       "_eventNumber", "_method",        "_status",        "_clientTS",
                                       "eventTime",    "_productFamily", "_productModel",  "_osVersion",
                                       "_build",       "_internal",      "_reportVers",    "_timezoneOffset"};

/// A daemon on a known device and a session of client type 9 whose client entry is changed by `more`.
struct Pipeline {
  explicit Pipeline(const PropertyDictionary& more = {}, const PropertyDictionary& sessionInfo = {},
                    const char* device = kDeviceLines, int clientType = 9,
                    const PropertyValue& userInfo = PropertyDictionary{{"_clientName", "Test"},
                                                                       {"_serviceName", "unit"}})
      : daemon(prepared(server, more), optionsFor(device)), session(daemon) {
    EXPECT_EQ(session.open(clientType, 4000000000, sessionInfo, userInfo).size(), 3U);
  }

  static ReportingServer& prepared(ReportingServer& server, const PropertyDictionary& more) {
    for (const char* name : {"heather", "sorrel", "yarrow"}) server.setStorebag(name, storebagWith(server, more));
    return server;
  }
  static Daemon::Options optionsFor(const char* device) {
    Daemon::Options options;
    options.deviceConfiguration = device;
    options.environment = {{"TZ", "Asia/Tokyo"}};
    return options;
  }

  /// Sends one event of method 7 and returns what arrived of it.
  PropertyDictionary roundTrip(const PropertyValue& payload, int status = 3) {
    const std::size_t before = eventsOf(server, 7).size();
    session.sendEvent(7, status, payload);
    EXPECT_TRUE(server.waitForEvents(before + 1, {7}));
    const auto events = eventsOf(server, 7);
    return events.size() > before ? events[before] : PropertyDictionary();
  }

  ReportingServer server;
  Daemon daemon;
  ControlledSession session;
};

TEST(Pipeline, StampsAnEventInOrder) {
  Pipeline pipeline;

  const auto event = pipeline.roundTrip(PropertyDictionary{{"answer", 42}, {"_sender", "forged"}, {"eventTime", "x"}});

  auto keys = std::vector<std::string>{"answer", "_sender", "eventTime", "_startTS"};
  for (const auto& key : kStamps) {
    if (key != "_sender" && key != "eventTime" && key != "_startTS") keys.push_back(key);
  }
  keys.push_back("_clientName");
  keys.push_back("_serviceName");
  EXPECT_EQ(keysOf(event), keys);
  EXPECT_EQ(integerValue(event.find("_startTS")) % 60, 0);
  EXPECT_NE(*event.string("_sender"), "forged");
  EXPECT_EQ(integerValue(event.find("_clientVersion")), 3);
  EXPECT_EQ(event.string("_sessionID")->size(), 24U);
  EXPECT_EQ(event.string("_sessionID")->substr(22), "==");
  EXPECT_EQ(integerValue(event.find("_eventNumber")), 2);
  EXPECT_EQ(integerValue(event.find("_status")), 3);
  EXPECT_EQ(*event.string("_productFamily"), "Tablebox");
  EXPECT_EQ(*event.string("_productModel"), "Box1,2");
  EXPECT_EQ(*event.string("_osVersion"), "12.5");
  EXPECT_EQ(*event.string("_build"), "21B77");
  EXPECT_EQ(integerValue(event.find("_internal")), 2);
  EXPECT_EQ(*event.string("_reportVers"), "8.0");
  EXPECT_EQ(integerValue(event.find("_timezoneOffset")), 9 * 3600);
  EXPECT_EQ(*event.find("_clientTS"), *event.find("eventTime"));
}

TEST(Pipeline, BlursTheStartButNotTheSpacing) {
  Pipeline pipeline;

  const auto event = pipeline.roundTrip(PropertyDictionary{{"a", 1}});

  const double sinceStart = doubleValue(event.find("_clientTS")) - doubleValue(event.find("_startTS"));
  EXPECT_GE(sinceStart, 0);
  EXPECT_LT(sinceStart, 60) << "the time since the session's start, on a slow machine";
}

TEST(Pipeline, StartMessageOfOtherBuildsTellsLittle) {
  Pipeline pipeline;
  ASSERT_TRUE(pipeline.server.waitForEvents(1));

  const auto start = pipeline.server.events()[0];
  auto keys = std::vector<std::string>{"Locale", "AutomaticTimeSet"};
  keys.insert(keys.end(), kStamps.begin(), kStamps.end());
  keys.insert(keys.end(), {"_clientName", "_serviceName"});
  EXPECT_EQ(keysOf(start), keys);
  EXPECT_EQ(*start.string("Locale"), "US");
  ASSERT_NE(start.find("AutomaticTimeSet")->boolean(), nullptr);
  EXPECT_EQ(integerValue(start.find("_eventNumber")), 1);
}

TEST(Pipeline, StartMessageOfInternalBuildsTellsMore) {
  Pipeline pipeline({}, {}, kInternalDeviceLines);
  ASSERT_TRUE(pipeline.server.waitForEvents(1));

  const auto start = pipeline.server.events()[0];
  auto keys = std::vector<std::string>{"SerialNum", "Version",    "Build",  "Hardware",
                                       "Product",   "ReportVers", "Locale", "AutomaticTimeSet"};
  keys.insert(keys.end(), kStamps.begin(), kStamps.end());
  keys.insert(keys.end(), {"_clientName", "_serviceName"});
  EXPECT_EQ(keysOf(start), keys);
  EXPECT_EQ(*start.string("SerialNum"), "S123");
  EXPECT_EQ(*start.string("Hardware"), "H1");
  EXPECT_EQ(*start.string("Product"), "Tablebox");
  EXPECT_EQ(*start.string("ReportVers"), "8.0");
  EXPECT_EQ(integerValue(start.find("_internal")), 3);
}

TEST(Pipeline, InternalConferencingSessionsShowTheirNumber) {
  Pipeline pipeline({}, {}, kInternalDeviceLines, 7);
  EXPECT_EQ(integerValue(pipeline.roundTrip(PropertyDictionary{{"a", 1}}).find("_sessionID")), 4000000000);
}

TEST(Pipeline, InternalBuildsMaySendTheDeviceAsClient) {
  Pipeline pipeline({{"extras_on_internal", 1}}, {}, kInternalDeviceLines);
  ASSERT_TRUE(pipeline.server.waitForPosts(1));
  EXPECT_EQ(*pipeline.server.posts()[0].body.string("clientId"), "0123456789abcdef0123456789abcdef01234567");
}

TEST(Pipeline, ClientsWithoutAnIdentifierOfTheirOwnShareOne) {
  Pipeline pipeline({{"custom_clientId", true}});
  ASSERT_TRUE(pipeline.server.waitForPosts(1));
  const auto body = pipeline.server.posts()[0].body;
  EXPECT_EQ(keysOf(body), (std::vector<std::string>{"postTime", "clientId", "events"}));
  EXPECT_EQ(body.string("clientId")->size(), 36U);
  EXPECT_TRUE(pipeline.daemon.log().waitForPart("The value for uuid:"));
}

TEST(Pipeline, NestedValuesStayOnlyWhereAllowed) {
  const PropertyDictionary payload{{"list", PropertyArray{1, PropertyDictionary{{"two", 2}}}}, {"plain", "x"}};
  Pipeline refused;
  EXPECT_FALSE(refused.roundTrip(payload).contains("list"));
  EXPECT_TRUE(refused.daemon.log().waitForPart(
      "<3>HTTPSPostBackend(createMessageForPostAndLogging): Serializer unable to handle key: list, value: "));
  Pipeline allowed({}, {}, kDeviceLines, 28);
  EXPECT_EQ(*allowed.roundTrip(payload).find("list"), *payload.find("list"));
  Pipeline conferencing({}, {}, kInternalDeviceLines, 7);
  EXPECT_TRUE(conferencing.roundTrip(payload).contains("list"));
}

TEST(Pipeline, DatesBecomeSecondsAndDataIsDropped) {
  Pipeline pipeline;
  const auto event = pipeline.roundTrip(
      PropertyDictionary{{"when", Date{1234.5}}, {"bytes", ByteData{1, 2}}, {"flag", true}, {"real", 2.0}});
  EXPECT_EQ(*event.find("when"), PropertyValue(1234.5));
  EXPECT_FALSE(event.contains("bytes"));
  EXPECT_EQ(*event.find("flag"), PropertyValue(true));
  EXPECT_EQ(*event.find("real"), PropertyValue(2.0));
}

PropertyDictionary filter(const char* key, const char* action, const PropertyDictionary& more = {}) {
  PropertyDictionary made{{"key", key}, {"action", action}};
  made.merge(more);
  return made;
}

TEST(Pipeline, FiltersActOnTheFirstRecordThatFits) {
  Pipeline pipeline(
      {{"filters",
        PropertyArray{filter("Name", "remove"), filter("name", "sha256"), filter("text", "sha256"),
                      filter("number", "sha256"), filter("bad", "blacklistValues", {{"value", PropertyArray{"EVIL"}}}),
                      filter("fine", "blacklistValues", {{"value", PropertyArray{"evil"}}}),
                      filter("white", "whitelistValues", {{"value", PropertyArray{"good"}}}),
                      filter("digits", "whitelistValues", {{"value", PropertyArray{"5"}}}), filter("kept", "unknown"),
                      filter("kept", "remove"), filter("other", "remove", {{"method", 8}}),
                      filter("status", "remove", {{"status", 4}}),
                      filter("both", "remove", {{"method", 7}, {"status", 3}}), filter("clientId", "sha256"),
                      filter("GRÖSSE", "remove")}}});

  const auto event = pipeline.roundTrip(PropertyDictionary{{"name", "x"},
                                                           {"text", "abc"},
                                                           {"number", 7},
                                                           {"bad", "an evil thing"},
                                                           {"fine", "ok"},
                                                           {"white", "so GOOD"},
                                                           {"digits", 5},
                                                           {"kept", 1},
                                                           {"other", 1},
                                                           {"status", 1},
                                                           {"both", 1},
                                                           {"größe", 1},
                                                           {"Gro\u0308\u00dfe", 1},
                                                           {"grosse", 1}});

  EXPECT_FALSE(event.contains("name"));
  EXPECT_EQ(*event.string("text"), "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad");
  EXPECT_FALSE(event.contains("number")) << "never plain where a hash was promised";
  EXPECT_FALSE(event.contains("größe"));
  EXPECT_FALSE(event.contains("Gro\u0308\u00dfe"));
  EXPECT_TRUE(event.contains("grosse"));
  EXPECT_FALSE(event.contains("bad"));
  EXPECT_TRUE(event.contains("fine"));
  EXPECT_TRUE(event.contains("white"));
  EXPECT_FALSE(event.contains("digits"));
  EXPECT_TRUE(event.contains("kept"));
  EXPECT_TRUE(event.contains("other"));
  EXPECT_TRUE(event.contains("status"));
  EXPECT_FALSE(event.contains("both"));
  EXPECT_EQ(pipeline.server.posts()[0].body.string("clientId")->size(), 64U);
}

const PropertyDictionary kHasher{{"filters", PropertyArray{filter("who", "sha256")}}};
const PropertyValue kUserWithWho = PropertyDictionary{{"_clientName", "Test"}, {"who", "abc"}, {"rank", "user"}};
constexpr char kOnce[] = "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad";
constexpr char kTwice[] = "dfe7a23fefeea519e9bbfdd1a6be94c4b2e4529dd6b7cbea83f9959c2621b13c";

TEST(Pipeline, PostedAtOnceHashesOnceAndSharedDataWins) {
  Pipeline pipeline(kHasher, {{"HierarchyToken", PropertyDictionary{{"token", "t1"}, {"level", 0}}}}, kDeviceLines, 9,
                    kUserWithWho);
  pipeline.session.send({{"method", "updateSharedDataWithDictionary"},
                         {"dictionary", PropertyDictionary{{"rank", "shared"}, {"gone", 1}, {"extra", 2}}}});
  pipeline.session.send({{"method", "updateSharedDataForKey"}, {"key", "gone"}});
  pipeline.session.send({{"method", "updateSharedDataForKey"}, {"key", "more"}, {"value", "m"}});

  const auto event = pipeline.roundTrip(PropertyDictionary{{"rank", "payload"}});

  EXPECT_EQ(*event.string("who"), kOnce);
  EXPECT_EQ(*event.string("rank"), "shared");
  EXPECT_FALSE(event.contains("gone"));
  EXPECT_EQ(integerValue(event.find("extra")), 2);
  EXPECT_EQ(*event.string("more"), "m");
}

TEST(Pipeline, BatchedHashesTwiceAndUserInfoWins) {
  Pipeline pipeline(kHasher,
                    {{"HierarchyToken", PropertyDictionary{{"token", "t1"}, {"level", 0}}}, {"BatchEvents", true}},
                    kDeviceLines, 9, kUserWithWho);
  pipeline.session.send(
      {{"method", "updateSharedDataWithDictionary"}, {"dictionary", PropertyDictionary{{"rank", "shared"}}}});
  pipeline.session.sendEvent(7, 3, PropertyDictionary{{"rank", "payload"}});
  ASSERT_EQ(pipeline.session.call({{"method", "flushMessagesWithCompletion"}}).size(), 2U);

  ASSERT_TRUE(pipeline.server.waitForEvents(1, {7}));
  const auto event = eventsOf(pipeline.server, 7)[0];
  EXPECT_EQ(*event.string("who"), kTwice);
  EXPECT_EQ(*event.string("rank"), "user");
}

TEST(Pipeline, ListsDropEventsPerBackend) {
  ReportingServer server;
  server.setStorebag("heather", storebagOf({{"splunk", postBackend(server, {{"event_whitelist", PropertyArray{7, 8}},
                                                                            {"event_blacklist", PropertyArray{8}},
                                                                            {"post_url", server.url("/one")}})},
                                            {"korrin", postBackend(server, {{"post_url", server.url("/two")}})}}));
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  for (const int method : {7, 8, 9}) session.sendEvent(method, 1, PropertyDictionary{{"a", 1}});

  ASSERT_TRUE(server.waitForEvents(5));  // the start and three through the open backend, one through the other
  std::size_t through = 0;
  for (const auto& post : server.posts()) through += post.request.target == "/one" ? 1 : 0;
  EXPECT_EQ(through, 1U);
  EXPECT_TRUE(daemon.log().waitForPart(
      "sendMessageWithDictionary: Dropping event with category 9 as it is not whitelisted for backend splunk"));
  EXPECT_TRUE(daemon.log().waitForPart(
      "sendMessageWithDictionary: Dropping event with category 8 as it is blacklisted for backend splunk"));
}

TEST(Pipeline, LargeCategoriesKeepTheirLowBits) {
  Pipeline pipeline;
  pipeline.session.sendEvent(70000, 65537, PropertyDictionary{{"a", 1}});
  ASSERT_TRUE(pipeline.server.waitForEvents(1, {4464}));
  EXPECT_EQ(integerValue(eventsOf(pipeline.server, 4464)[0].find("_status")), 1);
}

TEST(Pipeline, MissingParametersAreNamed) {
  Pipeline pipeline;
  const auto sent = [&](const PropertyDictionary& message) {
    return pipeline.session.call({{"method", "sendMessageWithDictionary"}, {"dictionary", message}});
  };
  EXPECT_EQ(sent({{"ParametersType", 1}}), PropertyArray{PropertyValue()});
  EXPECT_EQ(sent({{"ParametersCategory", 1}}), PropertyArray{PropertyValue()});
  EXPECT_TRUE(pipeline.daemon.log().waitForPart("sendMessageWithDictionary: Missing mandatory parameter 'category'"));
  EXPECT_TRUE(pipeline.daemon.log().waitForPart("sendMessageWithDictionary: Missing mandatory parameter 'type'"));
}

TEST(Pipeline, PayloadThatIsNoDictionaryIsNone) {
  Pipeline pipeline;
  for (const PropertyValue& payload : {PropertyValue("text"), PropertyValue(PropertyArray{1}), PropertyValue(5)}) {
    const auto event = pipeline.roundTrip(payload);
    EXPECT_EQ(keysOf(event)[0], "_startTS");
  }
}

TEST(Pipeline, OneUnusableEventDoesNotLoseTheBatch) {
  Pipeline pipeline({}, {{"BatchEvents", true}});
  pipeline.session.sendEvent(7, 1, PropertyDictionary{{"good", 1}});
  pipeline.session.sendEvent(7, 2, PropertyDictionary{{"bad", PropertyArray{ByteData{1}}}, {"worse", ByteData{255}}});
  pipeline.session.sendEvent(7, 3, PropertyDictionary{{"good", 2}});
  ASSERT_EQ(pipeline.session.call({{"method", "flushMessagesWithCompletion"}}).size(), 2U);

  ASSERT_TRUE(pipeline.server.waitForEvents(3, {7}));
  EXPECT_EQ(eventsOf(pipeline.server, 7).size(), 3U);
}

TEST(Pipeline, UserInfoMayOverwriteTheMethod) {
  Pipeline pipeline({}, {}, kDeviceLines, 9, PropertyDictionary{{"_clientName", "Test"}, {"_method", 99}});
  pipeline.session.sendEvent(7, 1, PropertyDictionary{{"a", 1}});
  EXPECT_TRUE(pipeline.server.waitForEvents(2, {99}));
}

TEST(Pipeline, AggregatorGetsItsOwnEventsBack) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server, {{"event_whitelist", PropertyArray{1000}}}));
  Daemon daemon(server);
  ControlledSession session(daemon);
  session.send({{"method", "setSessionInfo"},
                {"sessionInfo", PropertyDictionary{{"ComponentType", 9}, {"SessionID", 12}}},
                {"userInfo", PropertyDictionary{{"_clientName", "Test"}, {"rank", "user"}}},
                {"frameworksToCheck", PropertyArray{}},
                {"hasAggregationBlock", true}});
  ASSERT_EQ(session.call({{"method", "startConfigWithCompletionHandler"}}).size(), 3U);
  session.sendEvent(7, 3, PropertyDictionary{{"rank", "payload"}, {"answer", 42}});
  session.sendEvent(8, 4);

  const auto start = session.event("sendMessageToClient", 0);
  EXPECT_EQ(integerValue(start.find("category")), 0);
  const auto first = session.event("sendMessageToClient", 1);
  ASSERT_NE(first.dictionary("payload"), nullptr);
  EXPECT_EQ(integerValue(first.find("category")), 7);
  EXPECT_EQ(integerValue(first.find("type")), 3);
  EXPECT_GT(doubleValue(first.find("timestamp")), 1.6e9);
  EXPECT_EQ(*first.dictionary("payload")->string("rank"), "user");
  EXPECT_EQ(integerValue(first.dictionary("payload")->find("answer")), 42);
  ASSERT_NE(first.dictionary("sessionInfo"), nullptr);
  EXPECT_EQ(integerValue(first.dictionary("sessionInfo")->find("SessionID")), 12);
  const auto second = session.event("sendMessageToClient", 2);
  EXPECT_EQ(integerValue(second.find("category")), 8);
  EXPECT_EQ(second.dictionary("payload"), nullptr) << "user info does not travel alone";
}

TEST(Pipeline, MessageLogHoldsWhatWasSentUnderConsent) {
  Pipeline pipeline;
  const auto reply = pipeline.session.reply(pipeline.session.sendEvent(7, 3, PropertyDictionary{{"answer", 42}}));
  ASSERT_NE(reply.array("reply"), nullptr);
  const auto* text = (*reply.array("reply"))[0].string();
  ASSERT_NE(text, nullptr);
  EXPECT_NE(text->find("\"answer\""), std::string::npos);
  EXPECT_NE(pipeline.daemon.messageLog().find("[splunk -> sendMessageWithDictionary] "), std::string::npos);
  EXPECT_NE(pipeline.daemon.messageLog().find("\"answer\""), std::string::npos);
}

TEST(Pipeline, MessageLogHoldsNothingWithoutConsent) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server, {{"override_dnu", 1}}));
  Daemon::Options options;
  options.consent = false;
  Daemon daemon(server, options);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  const auto reply = session.reply(session.sendEvent(7, 3, PropertyDictionary{{"answer", 42}}));
  ASSERT_NE(reply.array("reply"), nullptr);
  EXPECT_TRUE((*reply.array("reply"))[0].isNull());
  EXPECT_TRUE(server.waitForEvents(1, {7})) << "posted all the same";
  EXPECT_EQ(daemon.messageLog().find("answer"), std::string::npos);
}

}  // namespace
}  // namespace velk::test
