#include "daemon/FrameworkVersion.h"

#include <gtest/gtest.h>

#include "platform/Files.h"
#include "tests/support/RecordingLog.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

class FrameworkVersionTest : public ::testing::Test {
 protected:
  std::optional<std::string> versionIn(std::string_view text) {
    EXPECT_TRUE(files::writeAtomically(directory.path() + "/version", ByteData(text.begin(), text.end())));
    return installedFrameworkVersion(directory.path());
  }

  test::RecordingLog log;
  test::TemporaryDirectory directory;
};

TEST_F(FrameworkVersionTest, IsTheFirstLineOfTheInstalledFile) {
  EXPECT_EQ(versionIn("9.1"), "9.1");
  EXPECT_EQ(versionIn("10.2.3-rc1\n"), "10.2.3-rc1");
  EXPECT_EQ(versionIn("9.1\nof the first of May\n"), "9.1");
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(FrameworkVersionTest, IsUnknownWithoutAFile) {
  EXPECT_EQ(installedFrameworkVersion(directory.path()), std::nullopt);
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(FrameworkVersionTest, IsNothingThatWouldNotFitIntoAnAddress) {
  for (const auto* text : {"", "\n", "9.1 ", "9&x=1", "9\r\n", "123456789012345678901234567890123"}) {
    EXPECT_EQ(versionIn(text), std::nullopt) << text;
    EXPECT_EQ(log.count(log::Level::error,
                        "frameworkVersion: '" + directory.path() + "/version' holds no version in its first line"),
              1);
    log.clear();
  }
  EXPECT_EQ(versionIn(std::string(2000, '1')), std::nullopt);
  EXPECT_TRUE(log.contains("frameworkVersion: cannot read '"));
}

}  // namespace
}  // namespace velk
