#include "tests/unit/daemon/StorebagFixture.h"

namespace velk {
namespace {

using namespace std::chrono_literals;
using test::kBramble;
using test::kConference;

class StorebagServiceTest : public test::StorebagFixture {
 protected:
  StorebagServiceTest() { setEnvironment(kEnvironmentRelease); }
  StorebagSection fetch(std::int32_t clientType = kBramble) {
    return service->fetchStorebagForEnvironmentAndClientType(clientType);
  }
  static std::string url(const std::string& base, const std::string& name) {
    return base + "/" + name + "?version=8.0";
  }
  std::string defaultUrl() { return url("https://storebags.tavrin.example/bags/vindle", "bramble"); }
  std::string headerOf(const HttpRequest& asked, std::string_view name) {
    for (const auto& [key, value] : asked.headers) {
      if (key == name) return value;
    }
    return "none";
  }
};

TEST_F(StorebagServiceTest, FetchesVerifiesAndKeepsAStorebagThatIsNotOnDisk) {
  serveBag(bagWithSections("7"), {{"Cache-Control", "max-age=600"}, {"Last-Modified", "Monday"}});
  const auto fetched = fetch();
  EXPECT_EQ(sectionName(fetched.section), "release");
  EXPECT_EQ(fetched.version, "7");
  EXPECT_EQ(fetched.maxAge, 600);
  EXPECT_FALSE(fetched.handled);
  EXPECT_EQ(files.bytes("bramble"), key.envelope(bagWithSections("7")));
  EXPECT_EQ(logged(daemontexts::kServerUrl, defaultUrl()), 1);
  EXPECT_EQ(logged(daemontexts::kStorebagSaved, "bramble"), 1);
}

TEST_F(StorebagServiceTest, AsksOverHttpsWithoutCacheWithinFifteenSeconds) {
  serveBag(bagWithSections());
  fetch();
  const auto asked = request(0);
  EXPECT_EQ(asked.method, "GET");
  EXPECT_EQ(asked.url, defaultUrl());
  EXPECT_EQ(asked.timeout, 15s);
  EXPECT_TRUE(asked.ignoresLocalCache);
  EXPECT_TRUE(asked.requiresHttps);
  EXPECT_EQ(headerOf(asked, "If-Modified-Since"), "none");
}

TEST_F(StorebagServiceTest, AsksTheServerOfTheSettingAndReadsItEveryTime) {
  serveBag(bagWithSections());
  fakes.defaults.put("velkreporting_storebag_url", "https://one.example/x");
  fetch();
  fakes.defaults.put("velkreporting_storebag_url", "https://two.example");
  fetch(6);
  fakes.defaults.put("velkreporting_storebag_url", 5);
  fetch(8);
  EXPECT_EQ(request(0).url, url("https://one.example/x", "bramble"));
  EXPECT_EQ(request(1).url, url("https://two.example", "clover"));
  EXPECT_EQ(request(2).url, url("https://storebags.tavrin.example/bags/vindle", "fennel"));
}

TEST_F(StorebagServiceTest, InternalBuildsAskTheInternalServer) {
  fakes.device.set("ReleaseType", "Internal");
  serveBag(bagWithSections());
  fetch();
  EXPECT_EQ(request(0).url, url("https://storebags.internal.tavrin.example/storebags/vindle", "bramble"));
}

TEST_F(StorebagServiceTest, TheStorebagsOwnCycleOverridesTheServersAgeUpToADay) {
  const auto maxAgeWith = [&](const PropertyValue& cycle) {
    auto bag = bagWithSections();
    bag.set("refresh_cycle", cycle);
    putOnDisk("bramble", bag, 600);
    return fetch().maxAge;
  };
  EXPECT_EQ(maxAgeWith(60), 60);
  EXPECT_EQ(maxAgeWith(100000), 86400);
  EXPECT_EQ(maxAgeWith(86400), 86400);
  EXPECT_EQ(maxAgeWith(-5), -5);
  EXPECT_EQ(maxAgeWith(INT64_MAX), 86400);
  EXPECT_EQ(maxAgeWith("120 seconds"), 120);
  EXPECT_EQ(logged(daemontexts::kMaxAgeOverride, 60), 1);
}

TEST_F(StorebagServiceTest, HandsTheReleaseTimeoutIntoTheSection) {
  auto bag = bagWithSections();
  bag.set("release_timeout", "5");
  putOnDisk("bramble", bag, 600);
  EXPECT_EQ(*fetch().section->string("release_timeout"), "5");
}

TEST_F(StorebagServiceTest, TakesTheReleaseSectionWhenTheSeedsIsMissing) {
  setEnvironment(kEnvironmentSeed);
  auto bag = bagWithSections();
  bag.remove("seed");
  putOnDisk("bramble", bag, 600);
  EXPECT_EQ(sectionName(fetch().section), "release");
  EXPECT_EQ(loggedAsError(daemontexts::kSeedMissing), 1);
  bag.set("release", "not a dictionary");
  putOnDisk("bramble", bag, 600);
  EXPECT_EQ(fetch().section, std::nullopt);
  EXPECT_EQ(loggedAsError(daemontexts::kNoSection, kBramble, "seed"), 1);
}

TEST_F(StorebagServiceTest, ReportsAnEnvironmentWithoutSection) {
  auto bag = bagWithSections();
  bag.remove("development");
  putOnDisk("bramble", bag, 600);
  setEnvironment(kEnvironmentDevelopment);
  EXPECT_EQ(fetch().section, std::nullopt);
  EXPECT_EQ(loggedAsError(daemontexts::kNoSection, kBramble, "development"), 1);
  setEnvironment(kEnvironmentNone);
  EXPECT_EQ(fetch().section, std::nullopt);
  EXPECT_EQ(loggedAsError(daemontexts::kNoSection, kBramble, nullptr), 1);
}

TEST_F(StorebagServiceTest, SurvivesStorebagsOfWrongTypes) {
  for (const PropertyValue& bag :
       {PropertyValue(PropertyArray{1}), PropertyValue("text"), PropertyValue(PropertyDictionary{}),
        PropertyValue(PropertyDictionary{
            {"release", PropertyArray{}}, {"shared_values", 5}, {"version", 5}, {"refresh_cycle", PropertyArray{}}})}) {
    putOnDisk("bramble", bag, 600);
    serveNothing();
    EXPECT_EQ(fetch().section, std::nullopt);
    EXPECT_EQ(fetch().version, std::nullopt);
  }
}

TEST_F(StorebagServiceTest, KnowsNoStorebagForTypesOutsideTheTable) {
  EXPECT_EQ(fetch(3).section, std::nullopt);
  EXPECT_EQ(loggedAsError(daemontexts::kNoStorebagName, 3), 1);
  EXPECT_EQ(requestCount(), 0U);
}

TEST_F(StorebagServiceTest, ServesAFreshCopyWithoutAsking) {
  putOnDisk("bramble", bagWithSections(), 600);
  advanceSeconds(600);
  EXPECT_EQ(sectionName(fetch().section), "release");
  EXPECT_EQ(requestCount(), 0U);
  EXPECT_EQ(logged(daemontexts::kLoadedFromDisk, "bramble", daemontexts::kDiskValid), 1);
}

TEST_F(StorebagServiceTest, ServesAnAgedCopyAtOnceAndRefreshesItInTheBackground) {
  putOnDisk("bramble", bagWithSections("old"), 600);
  fakes.defaults.put("CACHED_bramble_Last-Modified", "Monday");
  advanceSeconds(601);
  serveBag(bagWithSections("new"));
  EXPECT_EQ(fetch().version, "old");
  EXPECT_EQ(logged(daemontexts::kLoadedFromDisk, "bramble", daemontexts::kDiskExpired), 1);
  EXPECT_EQ(logged(daemontexts::kAddingLastModified, "Monday"), 1);
  EXPECT_EQ(headerOf(request(0), "If-Modified-Since"), "Monday");
  EXPECT_EQ(fakes.random.bounds(), std::vector<std::uint32_t>{7200});
}

TEST_F(StorebagServiceTest, AClockThatWasSetBackAgesACopyAsWell) {
  putOnDisk("bramble", bagWithSections(), 600);
  fakes.clock().setWallTime({secondsFromTimeValue(fakes.clock().wallTime()) > 700 ? 1'599'999'000 : 0, 0});
  serveStatus(304);
  EXPECT_EQ(sectionName(fetch().section), "release");
  static_cast<void>(request(0));
}

TEST_F(StorebagServiceTest, AnUnchangedAnswerNeverRenewsTheAge) {
  putOnDisk("bramble", bagWithSections(), 600);
  const auto written = files.modificationDate("bramble");
  advanceSeconds(601);
  serveStatus(304);
  fetch();
  static_cast<void>(request(0));
  service->startAfresh();
  pool->stop();
  EXPECT_EQ(files.modificationDate("bramble"), written);
  EXPECT_EQ(fakes.defaults.value("CACHED_bramble_max-age"), PropertyValue(600));
  EXPECT_EQ(logged(daemontexts::kNotChanged, "bramble"), 1);
}

TEST_F(StorebagServiceTest, ADelayedRefreshGivesWayToAnImmediateFetch) {
  putOnDisk("bramble", bagWithSections("old"), 600);
  advanceSeconds(601);
  fakes.random.setRest(7199);
  serveBag(bagWithSections("new"));
  fetch();
  EXPECT_EQ(requestCount(), 0U);
  files.remove("bramble");
  EXPECT_EQ(fetch().version, "new");
  EXPECT_TRUE(request(0).isUrgent);
  EXPECT_EQ(pullDue("bramble"), std::nullopt);
}

TEST_F(StorebagServiceTest, ARefreshThatIsPendingIsNotAskedForTwice) {
  putOnDisk("bramble", bagWithSections(), 600);
  advanceSeconds(601);
  fakes.random.setRest(7199);
  fetch();
  fetch();
  EXPECT_EQ(pullsDelayedBy(7199), 1);
  EXPECT_EQ(
      log.count("getURLRequestWithCompletionHandler: ignored duplicate request for storebag '" + defaultUrl() + "'"),
      1);
  pool->stop();
  EXPECT_EQ(http.sessions().size(), 1U);
}

TEST_F(StorebagServiceTest, ARefreshThatRunsIsNotAskedForTwice) {
  putOnDisk("bramble", bagWithSections(), 600);
  advanceSeconds(601);
  fetch();
  const auto task = http.waitForTask(0);
  EXPECT_FALSE(task->request().isUrgent);
  fetch();
  EXPECT_EQ(requestCount(), 1U);
  task->respond(304);
  ASSERT_TRUE(waitForPulls(1));
  fetch();
  ASSERT_NE(http.waitForTask(1), nullptr) << "an unchanged copy stays expired, and is asked for again";
  http.waitForTask(1)->respond(304);
}

TEST_F(StorebagServiceTest, AnImmediateFetchGoesBesideARefreshThatRuns) {
  putOnDisk("bramble", bagWithSections("old"), 600);
  advanceSeconds(601);
  fetch();
  const auto refresh = http.waitForTask(0);
  files.remove("bramble");
  serveBag(bagWithSections("new"));
  EXPECT_EQ(fetch().version, "new");
  refresh->respond(304);
  ASSERT_TRUE(waitForPulls(2));
  EXPECT_EQ(files.bytes("bramble"), key.envelope(bagWithSections("new")));
}

TEST_F(StorebagServiceTest, APullLeavesThoseOfOtherNamesAlone) {
  putOnDisk("bramble", bagWithSections(), 600);
  putOnDisk("clover", bagWithSections(), 600);
  advanceSeconds(601);
  fetch();
  fetch(6);
  const auto bramble = http.waitForTask(0);
  const auto clover = http.waitForTask(1);
  bramble->respond(304);
  ASSERT_TRUE(waitForPulls(1));
  fetch();
  http.waitForTask(2)->respond(304);
  clover->respond(200, test::textOf(key.envelope(bagWithSections("new"))));
  ASSERT_TRUE(waitForPulls(3));
  EXPECT_EQ(files.bytes("clover"), key.envelope(bagWithSections("new")));
}

TEST_F(StorebagServiceTest, AFetchThatFailedIsMadeAgain) {
  serveStatus(404);
  EXPECT_EQ(fetch().section, std::nullopt);
  EXPECT_EQ(logged(daemontexts::kErrorResolving, defaultUrl(), "status 404"), 1);
  serveNothing();
  EXPECT_EQ(fetch().section, std::nullopt);
  http.failTaskCreation(Error{"HttpErrorDomain", 27, "Too many open files"});
  EXPECT_EQ(fetch().section, std::nullopt);
  http.failTaskCreation(std::nullopt);
  serveBag(bagWithSections());
  EXPECT_EQ(sectionName(fetch().section), "release");
  EXPECT_EQ(requestCount(), 3U);
}

TEST_F(StorebagServiceTest, LetsGoOfEveryTransportBehindItsPull) {
  serveStatus(404);
  fetch();
  fetch();
  pool->stop();
  ASSERT_EQ(http.sessions().size(), 2U);
  for (const auto& session : http.sessions()) EXPECT_FALSE(session->hasDelegate());
}

TEST_F(StorebagServiceTest, AnAnswerThatDoesNotComeIsWaitedForWithinBounds) {
  const auto impatient = StorebagService::make(platform(), environment, files.cache(), key.source(), 20ms);
  EXPECT_EQ(impatient->fetchStorebagForEnvironmentAndClientType(kBramble).section, std::nullopt);
  EXPECT_EQ(logged(daemontexts::kErrorResolving, defaultUrl(), "no answer came in time"), 1);
  // It is worth keeping all the same.
  http.waitForTask(0)->respond(200, test::textOf(key.envelope(bagWithSections("late"))));
  ASSERT_TRUE(waitForPulls(1));
  EXPECT_EQ(impatient->fetchStorebagForEnvironmentAndClientType(kBramble).version, "late");
}

TEST_F(StorebagServiceTest, ATransportThatCannotMakeATaskFailsTheFetchAtOnce) {
  http.failTaskCreation(Error{"HttpErrorDomain", 3, "no such address"});
  EXPECT_EQ(fetch().section, std::nullopt);
  EXPECT_TRUE(log.contains("fetchNetworkStorebag: Error resolving with lookup server "));
}

TEST_F(StorebagServiceTest, AnUnreachableServerLeavesOthersWithoutAStorebag) {
  serveNothing();
  EXPECT_EQ(fetch().section, std::nullopt);
  EXPECT_EQ(logged(daemontexts::kErrorResolving, defaultUrl(), "could not connect"), 1);
  EXPECT_EQ(logged(daemontexts::kLoadingDefault, "bramble"), 0);
}

TEST_F(StorebagServiceTest, TheConferencingFallbackIsLoadedAndThenFailsVerification) {
  serveNothing();
  EXPECT_EQ(fetch(kConference).section, std::nullopt);
  EXPECT_EQ(logged(daemontexts::kLoadingDefault, "sorrel"), 1);
  EXPECT_EQ(loggedAsError(daemontexts::kSignatureMissing), 1);
  EXPECT_EQ(loggedAsError(daemontexts::kCouldNotFetch, kConference), 1);
  EXPECT_EQ(files.bytes("sorrel"), std::nullopt);
}

TEST_F(StorebagServiceTest, ATamperedAnswerIsNeitherKeptNorServedButItsMetricsAre) {
  auto envelope = test::textOf(key.envelope(bagWithSections()));
  const auto bag = envelope.find("<key>bag</key>");
  ASSERT_NE(bag, std::string::npos);
  const auto digits = envelope.find("<string>", bag) + 60;
  envelope[digits] = envelope[digits] == 'A' ? 'B' : 'A';
  serve({200, envelope, {{"Cache-Control", "max-age=42"}, {"Last-Modified", "Monday"}}, std::nullopt});
  EXPECT_EQ(fetch().section, std::nullopt);
  EXPECT_EQ(files.bytes("bramble"), std::nullopt);
  EXPECT_TRUE(log.contains("Signature can not be verified"));
  EXPECT_EQ(fakes.defaults.value("CACHED_bramble_max-age"), PropertyValue(42));
  EXPECT_EQ(fakes.defaults.value("CACHED_bramble_Last-Modified"), PropertyValue("Monday"));
}

TEST_F(StorebagServiceTest, AnEmptyAnswerCountsAsUnchanged) {
  serve({200, "", {{"Cache-Control", "max-age=42"}}, std::nullopt});
  EXPECT_EQ(fetch().section, std::nullopt);
  EXPECT_EQ(
      log.count("fetchNetworkStorebag: received zero-length storebag for 'bramble\xE2\x80\x98, treat as unchanged"), 1);
  EXPECT_EQ(fakes.defaults.value("CACHED_bramble_max-age"), PropertyValue(42));
}

TEST_F(StorebagServiceTest, ACopyThatDoesNotVerifyIsSetAsideAndFetchedAnew) {
  files.put("bramble", test::bytesOf("torn"));
  fakes.defaults.put("CACHED_bramble_max-age", 600);
  serveBag(bagWithSections("new"));
  EXPECT_EQ(fetch().version, "new");
  EXPECT_EQ(files.setAside(), std::set<std::string>{"bramble"});
  EXPECT_EQ(files.bytes("bramble"), key.envelope(bagWithSections("new")));
}

TEST_F(StorebagServiceTest, AnAgedCopyThatDoesNotVerifyStartsNoRefreshInItsWay) {
  files.put("bramble", test::bytesOf("torn"));
  advanceSeconds(100);
  serveBag(bagWithSections("new"));
  EXPECT_EQ(fetch().version, "new");
  EXPECT_TRUE(fakes.random.bounds().empty());
}

TEST_F(StorebagServiceTest, LeavesTheProtectionOfCopiesAloneOnReleasedBuilds) {
  putOnDisk("bramble", bagWithSections(), 600);
  fetch();
  EXPECT_TRUE(files.unprotected().empty());
}

TEST_F(StorebagServiceTest, LiftsTheProtectionOfCopiesOnInternalBuilds) {
  fakes.device.set("ReleaseType", "Internal");
  putOnDisk("bramble", bagWithSections(), 600);
  EXPECT_EQ(sectionName(fetch().section), "release");
  EXPECT_EQ(files.unprotected(), std::set<std::string>{"bramble"});
}

TEST_F(StorebagServiceTest, AStoppedServiceServesItsCopiesAndMakesNoTransport) {
  putOnDisk("bramble", bagWithSections("old"), 600);
  advanceSeconds(601);
  service->stop();
  EXPECT_EQ(fetch().version, "old");
  EXPECT_TRUE(http.sessions().empty());
}

TEST_F(StorebagServiceTest, TypesThatShareANameShareTheFile) {
  serveBag(bagWithSections());
  fetch(7);
  EXPECT_EQ(sectionName(fetch(20).section), "release");
  EXPECT_EQ(requestCount(), 1U);
}

TEST_F(StorebagServiceTest, KeepsACopyThatOnlyLacksAKeyToVerifyItWith) {
  putOnDisk("bramble", bagWithSections(), 600);
  const auto keyless = StorebagService::make(platform(), environment, files.cache(), [] { return nullptr; });
  serveBag(bagWithSections());
  EXPECT_EQ(keyless->fetchStorebagForEnvironmentAndClientType(kBramble).section, std::nullopt);
  EXPECT_TRUE(files.setAside().empty());
  EXPECT_TRUE(files.bytes("bramble").has_value());
  EXPECT_EQ(requestCount(), 0U) << "nothing that comes could be verified";
  advanceSeconds(601);
  EXPECT_EQ(keyless->fetchStorebagForEnvironmentAndClientType(kBramble).section, std::nullopt);
  keyless->startAfresh();
  EXPECT_TRUE(http.sessions().empty());
}

class PullDueTest : public StorebagServiceTest {
 protected:
  /// A copy that has expired.
  PullDueTest() {
    putOnDisk("bramble", bagWithSections("old"), 600);
    advanceSeconds(601);
    fakes.random.setRest(7199);
  }
  /// The next daemon, with the same files and settings.
  void restart() {
    service->stop();
    next = StorebagService::make(platform(), environment, files.cache(), key.source());
  }
  ~PullDueTest() override {
    if (next) next->startAfresh();
  }
  StorebagSection fetchAgain() { return next->fetchStorebagForEnvironmentAndClientType(kBramble); }

  std::shared_ptr<StorebagService> next;
};

TEST_F(PullDueTest, IsKeptWhileThePullWaits) {
  fetch();
  EXPECT_EQ(pullDue("bramble"), PropertyValue(fakes.clock().wallTime().seconds + 7199));
}

TEST_F(PullDueTest, IsTakenOverByTheNextDaemon) {
  fetch();
  const auto due = pullDue("bramble");
  restart();
  EXPECT_EQ(pullDue("bramble"), due);
  advanceSeconds(7000);
  EXPECT_EQ(fetchAgain().version, "old");
  EXPECT_EQ(pullsDelayedBy(199), 1);
  EXPECT_EQ(pullDue("bramble"), due);
}

TEST_F(PullDueTest, ThatHasPassedPullsAtOnceButNobodyWaits) {
  fetch();
  restart();
  advanceSeconds(100'000);
  EXPECT_EQ(fetchAgain().version, "old");
  const auto task = http.waitForTask(0);
  EXPECT_FALSE(task->request().isUrgent);
  EXPECT_EQ(pullsDelayedBy(0), 1);
  EXPECT_TRUE(pullDue("bramble").has_value());
  task->respond(200, test::textOf(key.envelope(bagWithSections("new"))));
  ASSERT_TRUE(waitForPulls(1));
  EXPECT_EQ(pullDue("bramble"), std::nullopt);
  EXPECT_EQ(fetchAgain().version, "new");
}

TEST_F(PullDueTest, IsOverWhateverThePullBrought) {
  for (const auto& answer : {test::FakeAnswer{304, "", {}, std::nullopt}, test::FakeAnswer{500, "", {}, std::nullopt},
                             test::FakeAnswer{0, "", {}, Error{"HttpErrorDomain", 7, "could not connect"}}}) {
    setPullDue("bramble", -1);
    serve(answer);
    fetch();
    ASSERT_TRUE(waitForPulls(1));
    EXPECT_EQ(pullDue("bramble"), std::nullopt);
    log.clear();
  }
  EXPECT_EQ(requestCount(), 3U);
  setPullDue("bramble", -1);
  http.failTaskCreation(Error{"HttpErrorDomain", 27, "Too many open files"});
  fetch();
  ASSERT_TRUE(log.waitFor("has been cancelled as NetSession data task creation has failed"));
  EXPECT_EQ(pullDue("bramble"), std::nullopt);
}

TEST_F(PullDueTest, StaysWhenStorebagsAreFetchedAfresh) {
  fetch();
  const auto due = pullDue("bramble");
  service->startAfresh();
  advanceSeconds(99);
  fetch();
  EXPECT_EQ(pullsDelayedBy(7100), 1);
  EXPECT_EQ(pullDue("bramble"), due);
}

TEST_F(PullDueTest, OfAPullThatTheEndOfTheDaemonCutsOffStays) {
  setPullDue("bramble", 0);
  fetch();
  const auto task = http.waitForTask(0);
  service->stop();
  task->fail(42, "the HTTP session service has ended");
  ASSERT_TRUE(waitForPulls(1));
  EXPECT_TRUE(pullDue("bramble").has_value());
}

TEST_F(PullDueTest, ThatNoDelayExplainsCountsAsNone) {
  const auto now = fakes.clock().wallTime().seconds;
  for (const PropertyValue& absurd : {PropertyValue(now + 7201), PropertyValue(INT64_MAX), PropertyValue(UINT64_MAX),
                                      PropertyValue("soon"), PropertyValue(true), PropertyValue(Date{5})}) {
    fakes.defaults.put("CACHED_bramble_pull-due", absurd);
    fetch();
    EXPECT_EQ(pullDue("bramble"), PropertyValue(now + 7199));
    service->startAfresh();
  }
  setPullDue("bramble", 7200);
  fetch();
  EXPECT_EQ(pullsDelayedBy(7200), 1);
}

TEST_F(PullDueTest, IsTheBusinessOfNoFreshCopy) {
  setPullDue("bramble", 50);
  putOnDisk("bramble", bagWithSections("new"), 600);
  fetch();
  pool->stop();
  EXPECT_TRUE(http.sessions().empty());
}

}  // namespace
}  // namespace velk
