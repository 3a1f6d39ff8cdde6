#include "daemon/StorebagDiskCache.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "daemon/StorebagEnvelope.h"
#include "foundation/Uuid.h"
#include "platform/Files.h"
#include "tests/support/RecordingLog.h"
#include "tests/unit/daemon/StorebagFakes.h"

namespace velk {
namespace {

namespace fs = std::filesystem;

/// A directory of the test's own, gone with it.
class TemporaryDirectory {
 public:
  TemporaryDirectory() { fs::create_directories(path()); }
  ~TemporaryDirectory() {
    std::error_code ignored;
    fs::remove_all(path(), ignored);
  }
  [[nodiscard]] std::string path() const { return _path; }

 private:
  const std::string _path = (fs::temp_directory_path() / ("velk-" + randomUuidText())).string();
};

class StorebagDiskCacheTest : public ::testing::Test {
 protected:
  test::RecordingLog log;
  TemporaryDirectory temporary;
  const std::string directory = temporary.path() + "/cache/storebags";
  const std::unique_ptr<StorebagDiskCache> cache = makeStorebagDiskCache(directory);
  const ByteData envelope = test::bytesOf("envelope");
};

TEST_F(StorebagDiskCacheTest, GivesBackWhatWasSaved) {
  EXPECT_EQ(cache->modificationDate("clover"), std::nullopt);
  EXPECT_TRUE(cache->saveStorebagToDisk("clover", envelope));
  EXPECT_EQ(cache->loadStorebagFromDisk("clover"), envelope);
  EXPECT_TRUE(cache->modificationDate("clover").has_value());
  EXPECT_TRUE(files::exists(directory + "/clover"));
}

TEST_F(StorebagDiskCacheTest, IsForItsUserAlone) {
  ASSERT_TRUE(cache->saveStorebagToDisk("clover", envelope));
  EXPECT_EQ(fs::status(directory).permissions(), fs::perms::owner_all);
  EXPECT_EQ(fs::status(directory + "/clover").permissions(), fs::perms::owner_read | fs::perms::owner_write);
}

TEST_F(StorebagDiskCacheTest, LiftsTheProtectionOfAFileAndItsDirectories) {
  ASSERT_TRUE(cache->saveStorebagToDisk("clover", envelope));
  fs::permissions(directory + "/clover", fs::perms::group_read);
  fs::permissions(directory, fs::perms::owner_all | fs::perms::others_read);
  cache->setStorageClassProtectionLevel("clover");
  EXPECT_EQ(fs::status(directory + "/clover").permissions(), fs::perms::owner_read | fs::perms::owner_write);
  EXPECT_EQ(fs::status(directory).permissions(), fs::perms::owner_all);
  EXPECT_FALSE(log.contains("setStorageClassProtectionLevel"));
}

TEST_F(StorebagDiskCacheTest, SaysWhichProtectionCannotBeLifted) {
  cache->setStorageClassProtectionLevel("clover");
  EXPECT_TRUE(log.contains("setStorageClassProtectionLevel: could not set attribute mode 0600 to file '" + directory +
                           "/clover'. Error is '"));
}

TEST_F(StorebagDiskCacheTest, SaysThatAFileCannotBeLoaded) {
  EXPECT_EQ(cache->loadStorebagFromDisk("clover"), std::nullopt);
  EXPECT_TRUE(log.contains("loadStorebagFromDisk: could not load storebag 'clover' from file '" + directory +
                           "/clover'. Error is '"));
}

TEST_F(StorebagDiskCacheTest, ReportsThatAFileCannotBeSaved) {
  std::ofstream(temporary.path() + "/cache") << "in the way";
  EXPECT_FALSE(cache->saveStorebagToDisk("clover", envelope));
  EXPECT_TRUE(log.contains("saveStorebagToDisk: could not save storebag 'clover' to file '"));
  EXPECT_EQ(log.lines().front().level, log::Level::error);
}

TEST_F(StorebagDiskCacheTest, SetsAFileAsideWhereItCanBeLookedAt) {
  ASSERT_TRUE(cache->saveStorebagToDisk("clover", envelope));
  cache->setAside("clover");
  EXPECT_FALSE(files::exists(directory + "/clover"));
  const auto names = files::list(directory);
  ASSERT_TRUE(names && names->size() == 1);
  EXPECT_TRUE(names->front().starts_with("clover.corrupt-"));
}

class StorebagPublicKeyTest : public ::testing::Test {
 protected:
  StorebagPublicKeyTest() {
    fs::create_directories(configuration);
    fs::create_directories(data);
  }
  void put(const std::string& folder, const ByteData& bytes) {
    ASSERT_TRUE(files::writeAtomically(folder + "/publicKey.der", bytes));
  }
  bool hasKey() { return storebagPublicKeyFromDirectories(configuration, data)() != nullptr; }

  test::RecordingLog log;
  TemporaryDirectory temporary;
  const std::string configuration = temporary.path() + "/etc";
  const std::string data = temporary.path() + "/share";
  const ByteData& der = test::SigningKey::shared().publicKeyDer();
};

TEST_F(StorebagPublicKeyTest, IsTheInstalledOneWithoutOneInTheConfiguration) {
  EXPECT_FALSE(hasKey());
  put(data, der);
  EXPECT_TRUE(hasKey());
}

TEST_F(StorebagPublicKeyTest, OfTheConfigurationWinsEvenWhenItIsOfNoUse) {
  put(data, der);
  put(configuration, test::bytesOf("no key"));
  EXPECT_FALSE(hasKey());
  put(configuration, der);
  EXPECT_TRUE(hasKey());
}

TEST_F(StorebagPublicKeyTest, ThatOthersCanWriteIsRefused) {
  put(data, der);
  put(configuration, der);
  fs::permissions(configuration + "/publicKey.der", fs::perms::others_write, fs::perm_options::add);
  EXPECT_FALSE(hasKey());
  EXPECT_EQ(log.lines().front().level, log::Level::error);
}

}  // namespace
}  // namespace velk
