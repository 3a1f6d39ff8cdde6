#include "tools/collector/PostStore.h"

#include <gtest/gtest.h>

#include <filesystem>

#include "tests/support/TemporaryDirectory.h"

namespace velk::collector {
namespace {

ReceivedPost somePost() {
  ReceivedPost post;
  post.postTime = 1.5;
  post.clientId = "c";
  post.events = {{{"_method", 3}, {"_sender", "SORREL"}}, {{"text", "'); DROP TABLE posts; --"}}};
  return post;
}

TEST(PostStore, NumbersThePostsThatItKeeps) {
  const test::TemporaryDirectory directory;
  const auto store = PostStore::open(directory.path() + "/posts.sqlite");
  ASSERT_TRUE(store) << store.error().description;
  EXPECT_EQ(*(*store)->add(somePost(), "/post", {{"Accept", "application/json"}}, {10, 0}), 1);
  EXPECT_EQ(*(*store)->add(somePost(), "/post", {}, {11, 0}), 2);
}

TEST(PostStore, GoesOnWhereAnEarlierRunStopped) {
  const test::TemporaryDirectory directory;
  const std::string path = directory.path() + "/posts.sqlite";
  ASSERT_TRUE((*PostStore::open(path))->add(somePost(), "/post", {}, {10, 0}));
  EXPECT_EQ(*(*PostStore::open(path))->add(somePost(), "/post", {}, {10, 0}), 2);
}

TEST(PostStore, KeepsItsFilesFromOthers) {
  const test::TemporaryDirectory directory;
  const auto store = PostStore::open(directory.path() + "/posts.sqlite");
  ASSERT_TRUE(store);
  ASSERT_TRUE((*store)->add(somePost(), "/post", {}, {10, 0}));
  using std::filesystem::perms;
  for (const auto& entry : std::filesystem::directory_iterator(directory.path())) {
    EXPECT_EQ(entry.status().permissions(), perms::owner_read | perms::owner_write) << entry.path();
  }
}

TEST(PostStore, SaysWhichFileIsNoDatabaseAndWhatToDo) {
  const test::TemporaryDirectory directory;
  const auto path = directory.write("posts.sqlite", std::string(5000, 'x'));
  const auto opened = PostStore::open(path);
  ASSERT_FALSE(opened);
  EXPECT_EQ(opened.error().description,
            "cannot use the database " + path + ": file is not a database. Put it aside, and a new one is begun");
  EXPECT_EQ(directory.read("posts.sqlite"), std::string(5000, 'x')) << "what may be mended is left alone";
}

TEST(PostStore, RefusesAFileThatIsNoDatabase) {
  const test::TemporaryDirectory directory;
  EXPECT_FALSE(PostStore::open(directory.write("posts.sqlite", std::string(5000, 'x'))));
  EXPECT_FALSE(PostStore::open(directory.path() + "/nowhere/posts.sqlite"));
}

}  // namespace
}  // namespace velk::collector
