#include "daemon/WorkingDirectories.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "tests/support/RecordingLog.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

class WorkingDirectoriesTest : public ::testing::Test {
 protected:
  Result<void> prepare(const std::string& state, const std::string& cache) {
    return prepareWorkingDirectories(state, cache, cache + "/storebags");
  }

  test::RecordingLog log;
  const test::TemporaryDirectory directory;
  const std::string state = directory / "state";
  const std::string cache = directory / "cache";
};

TEST_F(WorkingDirectoriesTest, AreMadeWithoutAWord) {
  ASSERT_TRUE(prepare(state, cache));
  EXPECT_TRUE(std::filesystem::is_directory(state));
  EXPECT_TRUE(std::filesystem::is_directory(cache));
  EXPECT_FALSE(log.contains("velkreportingd"));
}

TEST_F(WorkingDirectoriesTest, AreSweptOfWhatACrashLeft) {
  directory.write("state/suite.tmp-a1B2c3", "half");
  directory.write("state/suite", "whole");
  directory.write("cache/storebags/heather.tmp-a1B2c3", "half");
  directory.write("cache/storebags/heather", "whole");
  ASSERT_TRUE(prepare(state, cache));
  EXPECT_FALSE(std::filesystem::exists(state + "/suite.tmp-a1B2c3"));
  EXPECT_FALSE(std::filesystem::exists(cache + "/storebags/heather.tmp-a1B2c3"));
  EXPECT_EQ(directory.read("state/suite"), "whole");
  EXPECT_EQ(directory.read("cache/storebags/heather"), "whole");
  EXPECT_TRUE(log.contains("velkreportingd: removed 1 half-written files from " + state));
  EXPECT_TRUE(log.contains("velkreportingd: removed 1 half-written files from " + cache + "/storebags"));
}

TEST_F(WorkingDirectoriesTest, AreReportedWhereNothingCanBeWritten) {
  ASSERT_TRUE(prepare("/proc/self", cache));
  EXPECT_TRUE(log.contains("velkreportingd: cannot write into /proc/self"));
  EXPECT_TRUE(log.contains("so settings and identifiers are not kept"));
  EXPECT_FALSE(log.contains("storebags are fetched anew"));
  ASSERT_TRUE(prepare(state, "/proc/self"));
  EXPECT_TRUE(log.contains("storebags are fetched anew"));
}

TEST_F(WorkingDirectoriesTest, ThatCannotBeMadeAreAnError) {
  const auto file = directory.write("file", "x");
  const auto made = prepare(file + "/below", cache);
  ASSERT_FALSE(made);
  EXPECT_NE(made.error().description.find(file), std::string::npos);
}

}  // namespace
}  // namespace velk
