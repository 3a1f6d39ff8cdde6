// What a session is told about its configuration, and what decides it.

#include <gtest/gtest.h>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

const PropertyValue kSplunk = PropertyArray{"splunk"};
const PropertyValue kNobody = PropertyArray{};
const PropertyDictionary kUser{{"_clientName", "Test"}, {"_serviceName", "unit"}};

/// The names of the enabled backends of a session under a storebag of one changed client entry.
PropertyValue enabledWith(const PropertyDictionary& more, const Daemon::Options& options = {},
                          const PropertyDictionary& sessionInfo = {}, const PropertyValue& userInfo = kUser) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server, more));
  Daemon daemon(server, options);
  ControlledSession session(daemon);
  const PropertyArray lists = session.open(9, 1, sessionInfo, userInfo);
  EXPECT_EQ(session.finish(), 0);
  return lists.size() == 3 ? lists[0] : PropertyValue("no reply");
}

TEST(Configuration, NamesTheEnabledBackendsInTheirOrder) {
  ReportingServer server;
  server.setStorebag("heather", storebagOf({{"korrin", postBackend(server)},
                                            {"release_timeout", 5},
                                            {"mystery", postBackend(server)},
                                            {"qrs", PropertyDictionary{{"display_url", "https://example.org"}}},
                                            {"my_splunk_2", postBackend(server)},
                                            {"splunk", postBackend(server, {{"sampling_threshold", nullptr}})}}));
  Daemon daemon(server);
  ControlledSession session(daemon);

  const PropertyArray lists = session.open(9, 1);

  ASSERT_EQ(lists.size(), 3U);
  EXPECT_EQ(lists[0], PropertyValue(PropertyArray{"korrin", "my_splunk_2"}));
  EXPECT_TRUE(daemon.log().waitForPart("VelkReportingBackend(newBackendWithName): mystery"));
  EXPECT_TRUE(daemon.log().waitForPart("HTTPSPostBackend(initWithName): can't find the client list."));
}

TEST(Configuration, UnitesWhitelistsAndIntersectsBlacklists) {
  ReportingServer server;
  server.setStorebag("heather",
                     storebagOf({{"splunk", postBackend(server, {{"event_whitelist", PropertyArray{1, 2, 0}},
                                                                 {"event_blacklist", PropertyArray{4, 5, 6}}})},
                                 {"korrin", postBackend(server, {{"event_whitelist", PropertyArray{2, 3}},
                                                                 {"event_blacklist", PropertyArray{6, 5, 9}}})},
                                 {"qrs", postBackend(server, {{"event_whitelist", PropertyArray{}}})}}));
  Daemon daemon(server);
  ControlledSession session(daemon);

  const PropertyArray lists = session.open(9, 1);

  ASSERT_EQ(lists.size(), 3U);
  EXPECT_EQ(sortedNumbers(lists[1]), (std::vector<std::int64_t>{0, 1, 2, 3}));
  EXPECT_EQ(sortedNumbers(lists[2]), (std::vector<std::int64_t>{5, 6}));
}

TEST(Configuration, OneBackendWithoutWhitelistLiftsTheRestriction) {
  ReportingServer server;
  server.setStorebag("heather", storebagOf({{"splunk", postBackend(server, {{"event_whitelist", PropertyArray{1}}})},
                                            {"korrin", postBackend(server)}}));
  Daemon daemon(server);
  ControlledSession session(daemon);

  const PropertyArray lists = session.open(9, 1);

  ASSERT_EQ(lists.size(), 3U);
  EXPECT_TRUE(lists[1].isNull());
  EXPECT_TRUE(lists[2].isNull());
}

TEST(Configuration, StartedAgainKeepsTheBackends) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ControlledSession session(daemon);
  const PropertyArray first = session.open(9, 77);

  const PropertyArray second = session.call({{"method", "startConfigWithCompletionHandler"}});

  EXPECT_EQ(first, second);
  EXPECT_TRUE(
      daemon.log().waitForPart("<3>startConfigWithCompletionHandler: has been called more than once for session 77"));
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "createBackendsWithStorebag: Creating backends for session 77"), 1U);
  EXPECT_EQ(session.finish(), 0);
  ASSERT_TRUE(server.waitForEvents(2, {0}));
  EXPECT_EQ(eventsOf(server, 0).size(), 2U) << "one start and one health message";
}

TEST(Configuration, WaitsForUserInfo) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server, {{"client", "Other,Late"}}));
  Daemon daemon(server);
  ControlledSession session(daemon);

  PropertyArray lists = session.open(9, 5, {}, PropertyValue());
  ASSERT_EQ(lists.size(), 3U);
  EXPECT_EQ(lists[0], kNobody);

  const auto fetch = [&](const PropertyValue& userInfo) {
    return session.call({{"method", "fetchStatesWithUserInfo"}, {"userInfo", userInfo}});
  };
  const PropertyValue late = PropertyDictionary{{"_clientName", "late"}, {"_serviceName", "unit"}};
  lists = fetch(late);
  ASSERT_EQ(lists.size(), 3U);
  EXPECT_EQ(lists[0], kSplunk);
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "receivedUserInfo: Received new user info for session 5"), 1U);

  EXPECT_EQ(fetch(late)[0], kSplunk);
  EXPECT_EQ(fetch(PropertyValue())[0], kSplunk) << "required and absent: the old one stays";
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "receivedUserInfo: Received new user info for session 5"), 1U);

  EXPECT_EQ(fetch(PropertyDictionary{{"_clientName", "Stranger"}})[0], kNobody);
  EXPECT_EQ(daemon.log().countOnceThereAre(2, "receivedUserInfo: Received new user info for session 5"), 2U);
}

TEST(Configuration, WithoutRequiredUserInfoSkipsConsent) {
  Daemon::Options options;
  options.consent = false;
  EXPECT_EQ(enabledWith({{"locale_whitelist", nullptr}, {"filters", nullptr}}, options, {{"RequireUserDict", false}},
                        PropertyValue()),
            kSplunk);
}

TEST(Configuration, WarnsOfUserInfoThatIsNotRequired) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ControlledSession session(daemon);

  EXPECT_EQ(session.open(9, 1, {{"RequireUserDict", false}}).size(), 3U);
  EXPECT_TRUE(
      daemon.log().waitForPart("<3>setSessionInfo: Configure session: user info provided without requiring it"));
}

TEST(Configuration, NeedsConsent) {
  Daemon::Options options;
  options.consent = false;
  EXPECT_EQ(enabledWith({}, options), kNobody);
}

TEST(Configuration, MayOverrideConsent) {
  Daemon::Options options;
  options.consent = false;
  EXPECT_EQ(enabledWith({{"override_dnu", 1}}, options), kSplunk);
  EXPECT_EQ(enabledWith({{"override_dnu", 2}}, options), kNobody);
}

TEST(Configuration, MatchesClientNamesWhole) {
  EXPECT_EQ(enabledWith({{"client", "Other,tEST"}}), kSplunk);
  EXPECT_EQ(enabledWith({{"client", "Other, Test"}}), kNobody) << "the blank is kept";
  EXPECT_EQ(enabledWith({{"client", "Tes"}}), kNobody);
}

TEST(Configuration, MatchesServiceNamesByPart) {
  EXPECT_EQ(enabledWith({{"service", "x,NI"}}), kSplunk);
  EXPECT_EQ(enabledWith({{"service", "units"}}), kNobody);
  EXPECT_EQ(enabledWith({{"service", "units"}}, {}, {}, PropertyDictionary{{"_clientName", "Test"}}), kNobody);
}

TEST(Configuration, NeedsACountryOfTheList) {
  Daemon::Options options;
  options.environment = {{"LC_ALL", "en_GB.UTF-8"}};
  EXPECT_EQ(enabledWith({{"locale_whitelist", PropertyArray{"US", "gb"}}}, options), kSplunk);
  EXPECT_EQ(enabledWith({{"locale_whitelist", PropertyArray{"B"}}}, options), kSplunk) << "part of the code";
  EXPECT_EQ(enabledWith({{"locale_whitelist", PropertyArray{"US"}}}, options), kNobody);
  EXPECT_EQ(enabledWith({{"locale_whitelist", PropertyArray{}}}, options), kNobody);
  EXPECT_EQ(enabledWith({{"locale_whitelist", nullptr}}, options), kNobody);
}

TEST(Configuration, LooksAtTheDevice) {
  Daemon::Options options;
  options.deviceConfiguration = kDeviceLines;
  EXPECT_EQ(enabledWith({{"device_whitelist", PropertyArray{"table"}}}, options), kSplunk);
  EXPECT_EQ(enabledWith({{"device_whitelist", PropertyArray{"phone"}}}, options), kNobody);
  EXPECT_EQ(enabledWith({{"device_blacklist", PropertyArray{"box1"}}}, options), kNobody);
  EXPECT_EQ(enabledWith({{"device_blacklist", PropertyArray{"phone"}}}, options), kSplunk);
}

TEST(Configuration, LooksAtItsOwnVersion) {
  EXPECT_EQ(enabledWith({{"enabledSince", "8.0"}}), kSplunk);
  EXPECT_EQ(enabledWith({{"enabledSince", "7.200.9"}}), kSplunk);
  EXPECT_EQ(enabledWith({{"enabledSince", "8.0.1"}}), kNobody);
  EXPECT_EQ(enabledWith({{"enabledSince", "9"}}), kNobody);
}

TEST(Configuration, SamplesOut) {
  EXPECT_EQ(enabledWith({{"sampling_threshold", 0.0}}), kNobody);
  const PropertyArray perCountry{PropertyDictionary{{"country", PropertyArray{"CA"}}, {"threshold", 0.0}},
                                 PropertyDictionary{{"country", PropertyArray{"FR", "US"}}, {"threshold", 1.0}},
                                 PropertyDictionary{{"country", PropertyArray{"US"}}, {"threshold", 0.0}}};
  EXPECT_EQ(enabledWith({{"sampling_threshold", 0.0}, {"per_country_sampling_thresholds", perCountry}}), kSplunk);
}

TEST(Configuration, SessionInfoWithoutClientTypeEndsTheSession) {
  ReportingServer server;
  Daemon daemon(server);
  ControlledSession session(daemon);
  session.send({{"method", "setSessionInfo"},
                {"sessionInfo", PropertyDictionary{{"SessionID", 8}}},
                {"userInfo", kUser},
                {"frameworksToCheck", PropertyArray{}},
                {"hasAggregationBlock", false}});

  EXPECT_FALSE(session.event("invalidated").empty());
  EXPECT_TRUE(daemon.log().waitForPart("<3>isActiveClientLimitReachedForSession: session "));
  EXPECT_TRUE(
      daemon.log().waitForPart("missing clientType in its sessionInfo {\"SessionID\":8}. Session terminated..."));
  EXPECT_TRUE(daemon.log().waitForPart("releaseIPCTransactions: IPC transaction ended"));
}

TEST(Configuration, HelperIsReleasedAfterItsTimeout) {
  ReportingServer server;
  auto bag = storebagWith(server);
  bag.set("release_timeout", 1);
  server.setStorebag("heather", bag);
  Daemon daemon(server);
  ControlledSession first(daemon);
  ASSERT_EQ(first.open(9, 1).size(), 3U);
  EXPECT_EQ(first.finish(), 0);

  EXPECT_TRUE(
      daemon.log().waitForPart("startConnectivityHelperReleaseTimerWithBlock: Connectivity helper release timer "
                               "fired for NetSession with ID <"));
  EXPECT_TRUE(daemon.log().waitForPart(">, timeout 1s"));
  EXPECT_TRUE(
      daemon.log().waitForPart("releaseSharedConnectivityHelperForReportingSession: Usage count of shared "
                               "connectivity helper for userInfoKey test:unit reached zero. Invalidating the "
                               "helper"));
  EXPECT_TRUE(daemon.log().waitForPart("releaseIPCTransactions: IPC transaction ref count is 0, decremented by 1"));
  ASSERT_TRUE(server.waitForEvents(2, {0}));

  ControlledSession second(daemon);
  EXPECT_EQ(second.open(9, 2)[0], kSplunk);
  EXPECT_EQ(daemon.log().countOnceThereAre(2, "Creating shared connectivity helper for userInfoKey test:unit"), 2U);
}

TEST(Configuration, SessionsOfOneClientAndServiceShareAHelper) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ControlledSession first(daemon);
  ControlledSession second(daemon);
  ControlledSession third(daemon);

  ASSERT_EQ(first.open(9, 1, {}, PropertyDictionary{{"_clientName", "Media"}, {"_serviceName", "Calls"}}).size(), 3U);
  ASSERT_EQ(second.open(9, 2, {}, PropertyDictionary{{"_clientName", "media"}, {"_serviceName", "calls"}}).size(), 3U);
  ASSERT_EQ(third.open(9, 3, {}, PropertyDictionary{{"_clientName", "media"}}).size(), 3U);

  EXPECT_EQ(daemon.log().countOnceThereAre(1, "Creating shared connectivity helper for userInfoKey media:calls"), 1U);
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "Found existing shared connectivity helper for userInfoKey media:calls"),
            1U);
  EXPECT_TRUE(daemon.log().waitForPart("Creating shared connectivity helper for userInfoKey media:"));
}

}  // namespace
}  // namespace velk::test
