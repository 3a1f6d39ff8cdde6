#include "foundation/FileUrl.h"

#include <gtest/gtest.h>

namespace velk {
namespace {

TEST(FileUrl, GivesThePath) {
  EXPECT_EQ(fileSystemPath("file:///tmp/a%20b"), "/tmp/a b");
  EXPECT_EQ(fileSystemPath("file://localhost/tmp/a"), "/tmp/a");
  EXPECT_EQ(fileSystemPath("FILE:/tmp/a"), "/tmp/a");
  EXPECT_EQ(fileSystemPath("/tmp/a%20b"), "/tmp/a%20b");
  EXPECT_EQ(fileSystemPath("File://HOST/tmp/%41"), "/tmp/A");
  EXPECT_EQ(fileSystemPath("file:////tmp/a"), "//tmp/a");
  EXPECT_EQ(fileSystemPath("file://host"), "");
  EXPECT_EQ(fileSystemPath(""), "");
}

TEST(FileUrl, MakesAnAddressOfAnAbsolutePath) {
  EXPECT_EQ(absoluteFileUrl("/tmp/a b.log"), "file:///tmp/a%20b.log");
  EXPECT_EQ(absoluteFileUrl("/tmp/50%?#\xC3\xA9\n"), "file:///tmp/50%25%3F%23%C3%A9%0A");
  EXPECT_EQ(fileSystemPath(absoluteFileUrl("/tmp/50%?#\xC3\xA9\n")), "/tmp/50%?#\xC3\xA9\n");
  for (const char* address : {"file:///tmp/a%20b", "FILE:/tmp/a", "a/b.log", ""}) {
    EXPECT_EQ(absoluteFileUrl(address), address);
  }
}

TEST(FileUrl, LeavesWhatIsNoEscape) {
  EXPECT_EQ(fileSystemPath("file:///a%2"), "/a%2");
  EXPECT_EQ(fileSystemPath("file:///a%zz%C3%A9"), "/a%zz\xC3\xA9");
  EXPECT_EQ(fileSystemPath("file:///a%00b"), "/a%00b");
}

TEST(FileUrl, TakesRelativePathsAsTheyAre) {
  for (const char* path : {"file:a%20b", "file:", "file", "files/a", "a/file:/b", "./file:///b"}) {
    EXPECT_EQ(fileSystemPath(path), path);
  }
}

}  // namespace
}  // namespace velk
