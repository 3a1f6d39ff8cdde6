#include "daemon/StorebagMetrics.h"

#include <gtest/gtest.h>

#include "daemon/LogTexts.h"
#include "foundation/Format.h"
#include "tests/support/FakeUserDefaults.h"
#include "tests/support/RecordingLog.h"

namespace velk {
namespace {

std::int32_t maxAgeOf(const std::string& cacheControl) { return maxAgeOfCacheControl(&cacheControl); }

TEST(MaxAgeOfCacheControl, TakesTheComponentBehindMaxAge) {
  EXPECT_EQ(maxAgeOf("max-age=600"), 600);
  EXPECT_EQ(maxAgeOf("public, max-age=600, must-revalidate"), 600);
  EXPECT_EQ(maxAgeOf("max-age 60"), 60);
  EXPECT_EQ(maxAgeOf("max-age="), 0);
}

TEST(MaxAgeOfCacheControl, GivesADayWithoutAnExactComponent) {
  EXPECT_EQ(maxAgeOfCacheControl(nullptr), 86400);
  EXPECT_EQ(maxAgeOf(""), 86400);
  EXPECT_EQ(maxAgeOf("no-cache"), 86400);
  EXPECT_EQ(maxAgeOf("max-age"), 86400);
  EXPECT_EQ(maxAgeOf("no-cache,max-age=600"), 86400);
  EXPECT_EQ(maxAgeOf("s-maxage=600"), 86400);
}

class StorebagMetricsTest : public ::testing::Test {
 protected:
  test::RecordingLog log;
  test::FakeUserDefaults defaults;
  StorebagMetrics metrics{defaults};
};

TEST_F(StorebagMetricsTest, KeepsWhatTheServerSaid) {
  metrics.save("clover", {200, {{"Cache-Control", "max-age=600"}, {"Last-Modified", "Monday"}}});
  EXPECT_EQ(defaults.value("CACHED_clover_max-age"), PropertyValue(600));
  EXPECT_EQ(defaults.value("CACHED_clover_Last-Modified"), PropertyValue("Monday"));
  EXPECT_EQ(metrics.maxAge("clover"), 600);
  EXPECT_EQ(log.count(formatText(daemontexts::kMetricsSaved, {"clover", 600, "Monday"})), 1);
  EXPECT_EQ(log.count(formatText(daemontexts::kMaxAgeRead, {600, "clover"})), 1);
}

TEST_F(StorebagMetricsTest, ForgetsADateThatTheLatestAnswerDidNotGive) {
  metrics.save("clover", {200, {{"Last-Modified", "Monday"}}});
  metrics.save("clover", {200, {}});
  EXPECT_EQ(defaults.value("CACHED_clover_Last-Modified"), std::nullopt);
  EXPECT_EQ(metrics.maxAge("clover"), 86400);
}

TEST_F(StorebagMetricsTest, HasAMaxAgeOfZeroBeforeAnythingWasStored) { EXPECT_EQ(metrics.maxAge("clover"), 0); }

TEST_F(StorebagMetricsTest, TellsAChangedDateFromTheSameOne) {
  defaults.put("CACHED_clover_Last-Modified", "Monday");
  std::optional<std::string> lastModified;
  EXPECT_FALSE(metrics.updateLastModified("clover", lastModified));
  EXPECT_EQ(lastModified, "Monday");
  EXPECT_EQ(log.count(formatText(daemontexts::kLastModifiedChanged, {"Monday", "clover"})), 1);
  EXPECT_TRUE(metrics.updateLastModified("clover", lastModified));
  EXPECT_EQ(log.count(formatText(daemontexts::kLastModifiedSame, {"clover", "Monday"})), 1);
  EXPECT_FALSE(metrics.updateLastModified("fennel", lastModified));
  EXPECT_EQ(lastModified, "Monday");
}

TEST_F(StorebagMetricsTest, CountsValuesOfTheWrongTypesAsNone) {
  defaults.put("CACHED_clover_max-age", PropertyArray{1});
  defaults.put("CACHED_clover_Last-Modified", 5);
  std::optional<std::string> lastModified;
  EXPECT_EQ(metrics.maxAge("clover"), 0);
  EXPECT_FALSE(metrics.updateLastModified("clover", lastModified));
  EXPECT_EQ(lastModified, std::nullopt);
}

TEST_F(StorebagMetricsTest, ReportsASuiteThatCannotBeWritten) {
  defaults.setFailsWrites(true);
  metrics.save("clover", {200, {}});
  EXPECT_TRUE(log.contains("could not store the metrics"));
}

}  // namespace
}  // namespace velk
