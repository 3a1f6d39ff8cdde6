#include "daemon/StorebagMemoryCache.h"

#include "tests/unit/daemon/AgentFixture.h"

namespace velk {
namespace {

using test::FakeReportingdSession;
using test::kBramble;

class StorebagMemoryCacheTest : public test::AgentFixture {
 protected:
  StorebagMemoryCacheTest() { setEnvironment(kEnvironmentRelease); }
  std::optional<PropertyDictionary> storebag(std::int32_t clientType = kBramble) {
    return agent->storebagForSession(*FakeReportingdSession::ofType(clientType));
  }
  std::optional<std::string> version(std::int32_t clientType = kBramble) {
    return agent->storebagVersionForSession(*FakeReportingdSession::ofType(clientType));
  }
};

TEST_F(StorebagMemoryCacheTest, HasNothingForATypeWithoutStorebagAndSaysNothing) {
  EXPECT_EQ(storebag(3), std::nullopt);
  EXPECT_EQ(version(3), std::nullopt);
  EXPECT_EQ(agent->storebagForSession(*std::make_shared<FakeReportingdSession>()), std::nullopt);
  EXPECT_TRUE(log.lines().empty());
  EXPECT_EQ(files.loads(), 0);
}

TEST_F(StorebagMemoryCacheTest, NeverFetchesForTheVersionAlone) {
  putOnDisk("bramble", bagWithSections("3"), 600);
  EXPECT_EQ(version(), std::nullopt);
  EXPECT_EQ(sectionName(storebag()), "release");
  EXPECT_EQ(version(), "3");
  EXPECT_EQ(logged(daemontexts::kRetrievingStorebag, 7, kBramble), 1);
  EXPECT_EQ(logged(daemontexts::kFetchingStorebag, kBramble), 1);
  EXPECT_EQ(logged(daemontexts::kStorebagMaxAge, 600), 1);
}

TEST_F(StorebagMemoryCacheTest, KeepsAGoodStorebagForItsMaxAge) {
  putOnDisk("bramble", bagWithSections(), 600);
  storebag();
  advanceSeconds(599);
  storebag();
  EXPECT_EQ(files.loads(), 1);
  EXPECT_EQ(logged(daemontexts::kCachedStorebagFound, kBramble), 1);
  advanceSeconds(1);
  storebag();
  EXPECT_EQ(files.loads(), 2);
}

TEST_F(StorebagMemoryCacheTest, SharesOneEntryAmongTypesOfOneName) {
  putOnDisk("sorrel", bagWithSections("9"), 600);
  storebag(7);
  EXPECT_EQ(sectionName(storebag(13)), "release");
  EXPECT_EQ(version(20), "9");
  EXPECT_EQ(files.loads(), 1);
}

TEST_F(StorebagMemoryCacheTest, WaitsAQuarterOfAnHourBetweenAttemptsThatFail) {
  serveNothing();
  EXPECT_EQ(storebag(), std::nullopt);
  EXPECT_EQ(loggedAsError(daemontexts::kUnableToFetch, kBramble), 1);
  advanceSeconds(899.9);
  EXPECT_EQ(storebag(), std::nullopt);
  EXPECT_EQ(logged(daemontexts::kStorebagMustWait, kBramble, 900), 1);
  EXPECT_EQ(logged(daemontexts::kFetchingStorebag, kBramble), 1);
  advanceSeconds(0.1);
  serveStatus(404);
  EXPECT_EQ(storebag(), std::nullopt);
  EXPECT_EQ(requestCount(), 2U);
  advanceSeconds(899);
  serveBag(bagWithSections("1"));
  EXPECT_EQ(storebag(), std::nullopt);
  EXPECT_EQ(logged(daemontexts::kStorebagMustWait, kBramble, 900), 2);
  advanceSeconds(1);
  EXPECT_EQ(sectionName(storebag()), "release");
  EXPECT_EQ(version(), "1");
  EXPECT_EQ(requestCount(), 3U);
}

TEST_F(StorebagMemoryCacheTest, PicksUpANewStorebagWithoutARestart) {
  serveBag(bagWithSections("1"), {{"Cache-Control", "max-age=600"}});
  storebag();
  for (const auto* next : {"2", "3"}) {
    advanceSeconds(601);
    serveBag(bagWithSections(next), {{"Cache-Control", "max-age=600"}});
    storebag();
    EXPECT_NE(version(), next) << "nobody waits for the refresh";
    ASSERT_TRUE(log.waitFor("has been completed with error", next[0] - '0'));
    // The refresh was so quick that its file is no younger than the fetch that started it.
    EXPECT_EQ(sectionName(storebag()), "release");
    EXPECT_EQ(version(), next);
  }
  EXPECT_EQ(requestCount(), 3U);
  storebag();
  EXPECT_EQ(logged(daemontexts::kCachedStorebagFound, kBramble), 1);
}

TEST_F(StorebagMemoryCacheTest, AnUnchangedStorebagIsAskedForAgainWhenItHasAgedAgain) {
  putOnDisk("bramble", bagWithSections("1"), 600);
  serveStatus(304);
  for (int round = 1; round <= 3; ++round) {
    advanceSeconds(601);
    EXPECT_EQ(sectionName(storebag()), "release");
    ASSERT_TRUE(waitForPulls(round));
  }
  EXPECT_EQ(version(), "1");
  EXPECT_EQ(requestCount(), 3U);
}

TEST_F(StorebagMemoryCacheTest, ACopyThatCannotBeReadIsTriedAgainAfterAQuarterOfAnHourAsWell) {
  putOnDisk("bramble", bagWithSections(), 600);
  files.setUnreadable(true);
  serveNothing();
  EXPECT_EQ(storebag(), std::nullopt);
  EXPECT_EQ(storebag(), std::nullopt);
  EXPECT_EQ(logged(daemontexts::kStorebagMustWait, kBramble, 900), 1);
  files.setUnreadable(false);
  advanceSeconds(900);
  serveStatus(304);
  EXPECT_EQ(sectionName(storebag()), "release");
}

TEST_F(StorebagMemoryCacheTest, ServesTheLastGoodSectionWhileFetchesFail) {
  putOnDisk("bramble", bagWithSections("3"), 600);
  storebag();
  files.remove("bramble");
  serveNothing();
  advanceSeconds(601);
  EXPECT_EQ(sectionName(storebag()), "release");
  EXPECT_EQ(version(), "3");
  EXPECT_EQ(loggedAsError(daemontexts::kUnableToFetch, kBramble), 1);
  advanceSeconds(1);
  EXPECT_EQ(sectionName(storebag()), "release");
  EXPECT_EQ(logged(daemontexts::kStorebagMustWait, kBramble, 900), 1);
}

TEST_F(StorebagMemoryCacheTest, ReadsACopyThatWasWrittenAfterTheLastFetch) {
  putOnDisk("bramble", bagWithSections("old"), 600);
  storebag();
  advanceSeconds(1);
  putOnDisk("bramble", bagWithSections("new"), 600);
  storebag();
  EXPECT_EQ(version(), "new");
  EXPECT_TRUE(
      log.contains("storebagForSession: Override maxAge as disk cache for storebag 'bramble' was updated: "
                   "modification time '"));
  EXPECT_FALSE(log.lines().empty());
  for (const auto& line : log.lines()) {
    if (line.text.find("Override maxAge as disk cache") != std::string::npos) {
      EXPECT_NE(line.text.back(), '\'');
    }
  }
}

TEST_F(StorebagMemoryCacheTest, AClockThatWasSetBackAgesAnEntryAsWell) {
  putOnDisk("bramble", bagWithSections(), 600);
  storebag();
  files.setModificationDate("bramble", {0, 0});
  fakes.clock().setWallTime({fakes.clock().wallTime().seconds - 700, 0});
  serveStatus(304);
  storebag();
  EXPECT_EQ(files.loads(), 2);
}

TEST_F(StorebagMemoryCacheTest, FetchesAfreshWhenToldTo) {
  serveBag(bagWithSections("1"));
  storebag();
  EXPECT_EQ(requestCount(), 1U);
  // The copy is gone, and the transport would ignore what it has been asked for before.
  files.remove("bramble");
  serveBag(bagWithSections("2"));
  agent->refreshStorebags();
  EXPECT_EQ(sectionName(storebag()), "release");
  EXPECT_EQ(version(), "2");
  EXPECT_EQ(requestCount(), 2U);
  storebag();
  EXPECT_EQ(requestCount(), 2U);
}

TEST_F(StorebagMemoryCacheTest, ServesTheOldSectionWhenTheFreshFetchFails) {
  putOnDisk("bramble", bagWithSections("1"), 600);
  storebag();
  files.remove("bramble");
  serveNothing();
  agent->refreshStorebags();
  EXPECT_EQ(sectionName(storebag()), "release");
  EXPECT_EQ(version(), "1");
}

TEST_F(StorebagMemoryCacheTest, TellsItsEntriesInTheStatus) {
  putOnDisk("bramble", bagWithSections("3"), 600);
  storebag();
  advanceSeconds(10);
  const auto status = agent->copyStatus();
  const auto& row = *(*status.array("storebags"))[0].dictionary();
  EXPECT_EQ(*row.string("name"), "bramble");
  EXPECT_EQ(*row.string("version"), "3");
  EXPECT_EQ(*row.string("state"), "Fetch Successful");
  EXPECT_EQ(doubleValue(row.find("ageSeconds")), 10.0);
}

}  // namespace
}  // namespace velk
