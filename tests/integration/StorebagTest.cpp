// Where a session's configuration comes from: fetched over HTTPS, verified, cached, and served again.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

const PropertyValue kSplunk = PropertyArray{"splunk"};

PropertyArray openOnce(const Daemon& daemon, int clientType, int sessionID) {
  ControlledSession session(daemon);
  PropertyArray lists = session.open(clientType, sessionID);
  EXPECT_EQ(session.finish(), 0);
  return lists;
}

bool isConfigured(const PropertyArray& lists) { return lists.size() == 3 && lists[0] == kSplunk; }

TEST(Storebag, IsFetchedOnceVerifiedAndCached) {
  ReportingServer server;
  const auto bag = storebagWith(server);
  server.setStorebag("heather", bag);
  Daemon daemon(server);

  EXPECT_TRUE(isConfigured(openOnce(daemon, 9, 1)));
  EXPECT_TRUE(isConfigured(openOnce(daemon, 9, 2)));

  EXPECT_EQ(server.storebagRequests("heather"), 1U);
  const auto requests = server.tls().requests();
  ASSERT_FALSE(requests.empty());
  EXPECT_EQ(requests[0].target, "/bags/vindle/heather?version=8.0");
  EXPECT_EQ(requests[0].header("If-Modified-Since"), nullptr);
  const auto file = fileNamed(daemon.directory() + "/cache", "heather");
  ASSERT_TRUE(file);
  EXPECT_EQ(contentsOf(*file), server.servedStorebag("heather"));
  struct stat status {};
  ASSERT_EQ(stat(file->c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777U, 0600U);
  EXPECT_EQ(daemon.log().countOnceThereAre(
                1, "fetchNetworkStorebag: Storebag Server URL: " + server.url("/bags/vindle/heather")),
            1U);
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "fetchStorebagWithName: storebag 'heather' has been saved to disk cache"),
            1U);
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "storebagForSession: Cached storebag found for client type 9"), 1U);
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "New storebag 'heather' received: maxAge 600, Last-Modified '(null)'"),
            1U);
}

TEST(Storebag, IsAskedForWithTheInstalledVersion) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  const TemporaryDirectory installed;
  installed.write("version", "9.3\n");
  Daemon::Options options;
  options.environment = {{"VELKREPORTING_DATA_DIRECTORY", installed.path()}};
  Daemon daemon(server, options);

  EXPECT_TRUE(isConfigured(openOnce(daemon, 9, 1)));
  EXPECT_EQ(server.tls().requests().at(0).target, "/bags/vindle/heather?version=9.3");
}

TEST(Storebag, ThatAnotherKeySignedIsNeitherUsedNorCached) {
  ReportingServer server;
  ReportingServer stranger;
  server.setRawStorebag("heather", stranger.signedEnvelope(storebagWith(server)));
  Daemon daemon(server);

  EXPECT_EQ(openOnce(daemon, 9, 1), noLists());

  EXPECT_TRUE(daemon.log().waitForPart("fetchStorebagWithName: Signature can not be verified, "));
  EXPECT_FALSE(fileNamed(daemon.directory() + "/cache", "heather"));
}

TEST(Storebag, WithOneChangedByteIsRefused) {
  ReportingServer server;
  std::string envelope = server.signedEnvelope(storebagWith(server));
  const auto at = envelope.rfind("<string>") + 60;  // within the bag or the signature, whichever comes last
  envelope[at] = envelope[at] == 'A' ? 'B' : 'A';
  server.setRawStorebag("heather", envelope);
  Daemon daemon(server);

  EXPECT_EQ(openOnce(daemon, 9, 1), noLists());
  EXPECT_FALSE(fileNamed(daemon.directory() + "/cache", "heather"));
}

TEST(Storebag, WithoutItsEnvironmentConfiguresNothing) {
  ReportingServer server;
  auto bag = storebagWith(server);
  bag.remove("seed");
  bag.remove("release");
  server.setStorebag("heather", bag);
  Daemon daemon(server);

  EXPECT_EQ(openOnce(daemon, 9, 1), noLists());
  EXPECT_TRUE(
      daemon.log().waitForPart("fetchStorebagForEnvironmentAndClientType: Seed section is missing in the storebag."));
  EXPECT_TRUE(daemon.log().waitForPart(
      "fetchStorebagForEnvironmentAndClientType: Could not find storebag for client type 9 with"));
}

TEST(Storebag, WithoutSeedFallsBackToRelease) {
  ReportingServer server;
  auto bag = storebagWith(server);
  bag.remove("seed");
  server.setStorebag("heather", bag);
  Daemon daemon(server);

  EXPECT_TRUE(isConfigured(openOnce(daemon, 9, 1)));
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "Seed section is missing in the storebag."), 1U);
}

TEST(Storebag, OfAnInternalBuildIsTheInternalSection) {
  ReportingServer server;
  auto bag = storebagWith(server);
  bag.remove("seed");
  bag.remove("release");
  server.setStorebag("heather", bag);
  Daemon::Options options;
  options.deviceConfiguration = kInternalDeviceLines;
  Daemon daemon(server, options);

  EXPECT_TRUE(isConfigured(openOnce(daemon, 9, 1)));
  EXPECT_TRUE(daemon.log().waitForPart("userDefaultsEnvironment: Environment type 2"));
}

TEST(Storebag, EnvironmentBeyondTheLastIsTheInternalOne) {
  ReportingServer server;
  auto bag = storebagWith(server);
  bag.remove("seed");
  bag.remove("release");
  server.setStorebag("heather", bag);
  Daemon::Options options;
  options.defaults = {{"environmentType", 7}};
  Daemon daemon(server, options);

  EXPECT_TRUE(isConfigured(openOnce(daemon, 9, 1)));
  EXPECT_TRUE(daemon.log().waitForPart("userDefaultsEnvironment: Invalid environment type 7"));
}

TEST(Storebag, OnDiskServesARestartWithoutNetwork) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ASSERT_TRUE(isConfigured(openOnce(daemon, 9, 1)));
  ASSERT_EQ(daemon.stop(), 0);

  server.setStorebagStatus(500);
  daemon.start();

  EXPECT_TRUE(isConfigured(openOnce(daemon, 9, 2)));
  EXPECT_EQ(server.storebagRequests("heather"), 1U);
  EXPECT_TRUE(daemon.log().waitForPart(
      "storebag 'heather' loaded from disk cache. Disk cache is valid and will not be refreshed"));
}

TEST(Storebag, ThatExpiredOnDiskIsServedAtOnceAndAskedForLater) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server),
                     {{"Cache-Control", "max-age=600, private"}, {"Last-Modified", "Tue, 10 Nov 2026 10:00:00 GMT"}});
  Daemon daemon(server);
  ASSERT_TRUE(isConfigured(openOnce(daemon, 9, 1)));
  ASSERT_EQ(daemon.stop(), 0);
  const auto file = fileNamed(daemon.directory() + "/cache", "heather");
  ASSERT_TRUE(file);
  std::filesystem::last_write_time(*file, std::filesystem::last_write_time(*file) - std::chrono::hours(1));

  daemon.start();

  EXPECT_TRUE(isConfigured(openOnce(daemon, 9, 2)));
  EXPECT_TRUE(
      daemon.log().waitForPart("storebag 'heather' loaded from disk cache. Disk cache expired and will be refreshed"));
  EXPECT_TRUE(daemon.log().waitForPart(
      "fetchNetworkStorebag: Adding 'Last-Modified: Tue, 10 Nov 2026 10:00:00 GMT' to the header"));
  EXPECT_TRUE(daemon.log().waitForPart("getURLRequestWithCompletionHandler: storebag delayed pull for '"));
}

TEST(Storebag, CorruptOnDiskIsSetAsideAndFetchedAnew) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ASSERT_TRUE(isConfigured(openOnce(daemon, 9, 1)));
  ASSERT_EQ(daemon.stop(), 0);
  const auto file = fileNamed(daemon.directory() + "/cache", "heather");
  ASSERT_TRUE(file);
  writeContents(*file, "bplist00 but not really");

  daemon.start();

  EXPECT_TRUE(isConfigured(openOnce(daemon, 9, 2)));
  EXPECT_EQ(server.storebagRequests("heather"), 2U);
  EXPECT_EQ(contentsOf(*file), server.servedStorebag("heather"));
  std::size_t setAside = 0;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(daemon.directory())) {
    if (entry.is_regular_file()) setAside += contentsOf(entry.path()) == "bplist00 but not really" ? 1 : 0;
  }
  EXPECT_EQ(setAside, 1U) << "the corrupt file is kept for whoever looks into it";
}

TEST(Storebag, ThatFailedIsNotAskedForAgainAtOnce) {
  ReportingServer server;
  server.setStorebagStatus(500);
  Daemon daemon(server);

  EXPECT_EQ(openOnce(daemon, 9, 1), noLists());
  EXPECT_EQ(openOnce(daemon, 9, 2), noLists());

  EXPECT_EQ(server.storebagRequests("heather"), 1U);
  EXPECT_TRUE(daemon.log().waitForPart("fetchNetworkStorebag: Error resolving with lookup server "));
  EXPECT_TRUE(
      daemon.log().waitForPart("storebagForSession: Not fetching storebag for client type 9 - must wait 900 "
                               "seconds between attempts"));
}

TEST(Storebag, AskedForAgainAfterAHangUpSignal) {
  ReportingServer server;
  server.setStorebagStatus(500);
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ASSERT_EQ(openOnce(daemon, 9, 1), noLists());

  server.setStorebagStatus(200);
  daemon.process().signal(SIGHUP);

  // The signal overtakes nothing that was sent before it was handled: some sessions may still find the old failure.
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  bool configured = false;
  for (int session = 2; !configured && std::chrono::steady_clock::now() < deadline; ++session) {
    configured = isConfigured(openOnce(daemon, 9, session));
  }
  EXPECT_TRUE(configured);
  EXPECT_EQ(server.storebagRequests("heather"), 2U);
}

TEST(Storebag, MetricsAreKeptBeforeItIsVerified) {
  ReportingServer server;
  TlsTestServer::Response forged;
  forged.body = "forged";
  forged.headers = {{"Cache-Control", "private max-age=77, x"}, {"Last-Modified", "yesterday"}};
  server.setStorebagAnswer("heather", forged);
  Daemon daemon(server);

  EXPECT_EQ(openOnce(daemon, 9, 1), noLists());
  EXPECT_EQ(runControl(daemon, {"defaults", "read", "CACHED_heather_max-age"}).output, "77\n");
  EXPECT_NE(runControl(daemon, {"defaults", "read", "CACHED_heather_Last-Modified"}).output.find("yesterday"),
            std::string::npos);
  EXPECT_FALSE(fileNamed(daemon.directory() + "/cache", "heather"));
}

TEST(Storebag, UnchangedOrEmptyAtTheFirstFetchIsNone) {
  ReportingServer server;
  server.setRawStorebag("heather", "");
  Daemon daemon(server);
  EXPECT_EQ(openOnce(daemon, 9, 1), noLists());
  EXPECT_TRUE(daemon.log().waitForPart(
      "fetchNetworkStorebag: received zero-length storebag for 'heather\u2018, treat as unchanged"));

  server.setStorebagStatus(304);
  EXPECT_EQ(openOnce(daemon, 6, 2), noLists());
  EXPECT_TRUE(
      daemon.log().waitForPart("fetchNetworkStorebag: storebag 'clover' does not need update as its content has "
                               "not changed on the server"));
}

TEST(Storebag, OfTheConferencingClientHasNoWorkingFallback) {
  ReportingServer server;
  server.setStorebagStatus(503);
  Daemon daemon(server);

  EXPECT_EQ(openOnce(daemon, 7, 1), noLists());
  EXPECT_TRUE(daemon.log().waitForPart("fetchNetworkStorebag: Loading default storebag 'sorrel'"));
  EXPECT_TRUE(daemon.log().waitForPart("fetchStorebagWithName: Signature is missing"));
}

TEST(Storebag, IsNeverFetchedInTheClear) {
  ReportingServer server;
  TlsTestServer plain(false);
  Daemon::Options options;
  options.defaults = {{"velkreporting_storebag_url", plain.url("/bags/vindle")}};
  Daemon daemon(server, options);

  EXPECT_EQ(openOnce(daemon, 9, 1), noLists());
  EXPECT_TRUE(plain.requests().empty());
}

TEST(Storebag, OfAServerWithAnotherAuthorityIsRefused) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  TlsTestServer stranger;
  Daemon::Options options;
  options.environment = {{"SSL_CERT_FILE", stranger.caFile()}};
  Daemon daemon(server, options);

  EXPECT_EQ(openOnce(daemon, 9, 1), noLists());
  EXPECT_EQ(server.storebagRequests("heather"), 0U);
}

TEST(Storebag, OfClientTypesThatShareANameIsFetchedOnce) {
  ReportingServer server;
  server.setStorebag("clover", storebagWith(server));
  Daemon daemon(server);

  EXPECT_TRUE(isConfigured(openOnce(daemon, 6, 1)));
  EXPECT_TRUE(isConfigured(openOnce(daemon, 18, 2)));
  EXPECT_EQ(server.storebagRequests("clover"), 1U);
}

TEST(Storebag, DoesNotExistForTheFirstClientTypes) {
  ReportingServer server;
  Daemon daemon(server);

  for (const int type : {0, 3, 4, 31, 32, -1, 2000000000}) EXPECT_EQ(openOnce(daemon, type, 1), noLists()) << type;
  EXPECT_EQ(server.tls().requests().size(), 0U);
}

TEST(Storebag, WithExpandedMacrosConfigures) {
  ReportingServer server;
  auto bag = storebagWith(server, {{"locale_whitelist", "==countries"}});
  bag.set("shared_values", PropertyDictionary{{"==countries", "FR,US"}});
  server.setStorebag("heather", bag);
  Daemon daemon(server);

  EXPECT_TRUE(isConfigured(openOnce(daemon, 9, 1)));
  EXPECT_TRUE(daemon.log().waitForPart("expandMacroForDataSet: Expanding macro '==countries' into '"));
}

TEST(Storebag, WithValuesOfWrongTypesNeverEndsTheDaemon) {
  ReportingServer server;
  const PropertyArray list{1, "two", PropertyDictionary{{"three", 3}}};
  const auto section = [](const PropertyValue& backend) {
    return storebagOf({{"splunk", backend}, {"korrin", 7}, {"qrs", PropertyArray{1}}, {"release_timeout", "soon"}});
  };
  const auto clients = [&](const PropertyValue& entries) { return section(PropertyDictionary{{"clients", entries}}); };
  PropertyDictionary odd;
  for (const char* key : {"client",
                          "service",
                          "expedite",
                          "enabledSince",
                          "override_dnu",
                          "locale_whitelist",
                          "device_whitelist",
                          "device_blacklist",
                          "filters",
                          "sampling_threshold",
                          "per_country_sampling_thresholds",
                          "override_sampling",
                          "custom_clientId",
                          "post_url",
                          "realtime_post_url",
                          "event_threshold",
                          "event_whitelist",
                          "event_blacklist",
                          "include_session_id",
                          "use_wifi_only"}) {
    odd.set(key, PropertyDictionary{{"a", list}});
  }
  PropertyDictionary lists;
  for (const auto& entry : odd) lists.set(entry.key, list);
  std::vector<std::pair<int, PropertyDictionary>> bags{
      {5, {{"version", 1}, {"refresh_cycle", "never"}, {"seed", "x"}, {"release", list}}},
      {8, section("text")},
      {9, section(list)},
      {10, clients("text")},
      {12, clients(list)},
      {14, clients(PropertyArray{odd})},
      {15, clients(PropertyArray{lists})},
      {16, clients(PropertyArray{PropertyDictionary{}})},
      {17,
       clients(PropertyArray{clientEntry(server, {{"filters", PropertyArray{1, "x", PropertyDictionary{{"key", 4}}}},
                                                  {"event_whitelist", "7"},
                                                  {"post_url", 9}})})},
      {19, {{"shared_values", 5}, {"release_timeout", list}}},
      {21, {}}};
  auto deep = storebagWith(server);
  deep.set("shared_values", PropertyDictionary{{"==a", 7}, {"==b", list}, {"", "=="}});
  bags.emplace_back(22, deep);
  const std::vector<const char*> names{"bramble", "fennel", "heather",  "juniper",  "lavender", "mallow",
                                       "nettle",  "orchid", "primrose", "rosemary", "saffron",  "tansy"};
  for (std::size_t i = 0; i < bags.size(); ++i) server.setStorebag(names[i], bags[i].second);
  server.setStorebag("willow", storebagWith(server));
  Daemon daemon(server);

  for (const auto& [type, bag] : bags) {
    ControlledSession session(daemon);
    EXPECT_EQ(session.open(type, type).size(), 3U) << type;
    session.sendEvent(7, 1, PropertyDictionary{{"key", "x"}});
    EXPECT_EQ(session.call({{"method", "flushMessagesWithCompletion"}}).size(), 2U) << type;
    EXPECT_EQ(session.finish(), 0);
  }
  EXPECT_TRUE(isConfigured(openOnce(daemon, 27, 99)));
  EXPECT_EQ(daemon.stop(), 0);
}

TEST(Storebag, OfASlowServerLeavesNoSessionUnanswered) {
  ReportingServer server;
  for (const char* name : {"sorrel", "fennel", "heather", "juniper", "lavender"}) {
    server.setStorebag(name, storebagWith(server));
  }
  server.setStorebagDelay(std::chrono::seconds(5));
  Daemon daemon(server);
  std::vector<std::unique_ptr<ControlledSession>> sessions;
  std::vector<std::size_t> lines;
  for (const int type : {7, 11, 13, 20, 8, 9, 10, 12}) {
    for (int i = 0; i < 5; ++i) {
      sessions.push_back(std::make_unique<ControlledSession>(daemon));
      lines.push_back(sessions.back()->sendOpening(type, static_cast<int>(sessions.size())));
    }
  }
  ASSERT_EQ(sessions.size(), 40U);

  for (std::size_t i = 0; i < sessions.size(); ++i) {
    const auto reply = sessions[i]->reply(lines[i], std::chrono::seconds(200));
    const auto* lists = reply.array("reply");
    ASSERT_NE(lists, nullptr) << i;
    EXPECT_TRUE(isConfigured(*lists)) << i;
  }
  for (const char* name : {"sorrel", "fennel", "heather", "juniper", "lavender"}) {
    EXPECT_EQ(server.storebagRequests(name), 1U) << name;
  }
  for (auto& session : sessions) EXPECT_EQ(session->finish(), 0);
}

}  // namespace
}  // namespace velk::test
