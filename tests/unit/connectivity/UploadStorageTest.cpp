#include "connectivity/UploadStorage.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include "platform/Files.h"

namespace velk {
namespace {

TEST(UploadStorageTest, RemovesLeftContainersAndNothingElse) {
  std::string folder = testing::TempDir() + "velk-storage-XXXXXX";
  ASSERT_NE(::mkdtemp(folder.data()), nullptr);
  for (const auto* name : {"a.velkdiag", "B.VELKDIAG", ".velkdiag", "velkdiag", "a.velkdiag.txt", "keep"}) {
    ASSERT_TRUE(files::writeAtomically(folder + "/" + name, {}));
  }
  cleanUploadStorage(folder);
  EXPECT_EQ(files::list(folder).value(), (std::vector<std::string>{"a.velkdiag.txt", "keep", "velkdiag"}));
}

TEST(UploadStorageTest, CreatesItsFolder) {
  std::string folder = testing::TempDir() + "velk-storage-XXXXXX";
  ASSERT_NE(::mkdtemp(folder.data()), nullptr);
  cleanUploadStorage(folder + "/deep/er");
  EXPECT_TRUE(files::exists(folder + "/deep/er"));
}

}  // namespace
}  // namespace velk
