#include "daemon/SharedDataTable.h"

#include <gtest/gtest.h>

#include <string>

namespace velk {
namespace {

const SharedDataTable::Token kTree = "tree";

/// One entry that takes so many bytes with everything that belongs to it.
PropertyDictionary entryOf(std::size_t bytes) {
  PropertyDictionary small{{"key", ""}};
  SharedDataTable table;
  const auto overhead = SharedDataTable::memoryOf(small) - sizeof(PropertyValue);
  return PropertyDictionary{{"key", std::string(bytes - overhead, 'x')}};
}

TEST(SharedDataTableTest, HoldsAsMuchAsItSays) {
  SharedDataTable table;
  EXPECT_TRUE(table.merge(kTree, entryOf(SharedDataTable::kMaximumBytes)));
  SharedDataTable other;
  EXPECT_FALSE(other.merge(kTree, entryOf(SharedDataTable::kMaximumBytes + 1)));
  EXPECT_EQ(other.values(kTree), std::nullopt);
}

TEST(SharedDataTableTest, CountsWhatIsReplacedNoMore) {
  SharedDataTable table;
  const auto full = entryOf(SharedDataTable::kMaximumBytes);
  for (int update = 0; update < 3; ++update) EXPECT_TRUE(table.merge(kTree, full));
  EXPECT_FALSE(table.merge(kTree, {{"other", 1}}));
  EXPECT_TRUE(table.merge(kTree, {{"key", "short"}, {"other", std::string(500'000, 'x')}}));
  EXPECT_TRUE(table.merge(kTree, {{"third", std::string(500'000, 'x')}}));
}

TEST(SharedDataTableTest, CountsWhatIsRemovedNoMore) {
  SharedDataTable table;
  const auto full = entryOf(SharedDataTable::kMaximumBytes);
  ASSERT_TRUE(table.merge(kTree, full));
  table.removeKey(kTree, "absent");
  EXPECT_FALSE(table.merge(kTree, {{"other", 1}}));
  table.removeKey(kTree, "key");
  table.removeKey(kTree, "key");
  EXPECT_TRUE(table.merge(kTree, full));
}

TEST(SharedDataTableTest, CountsWhatContainersHold) {
  const PropertyArray texts{std::string(1000, 'x'), std::string(1000, 'y')};
  EXPECT_GE(SharedDataTable::memoryOf(texts), 2000U);
  EXPECT_LT(SharedDataTable::memoryOf(texts), 2500U);
  const PropertyDictionary nested{{"texts", texts}, {std::string(1000, 'k'), ByteData(1000)}};
  EXPECT_GE(SharedDataTable::memoryOf(nested), 4000U);
  EXPECT_LT(SharedDataTable::memoryOf(nested), 5000U);
}

TEST(SharedDataTableTest, AnUpdateTouchesNothingElse) {
  SharedDataTable table;
  const PropertyDictionary large{{"a", 1}, {"b", 2}};
  ASSERT_TRUE(table.merge(kTree, {{"large", large}, {"counter", 0}}));
  ASSERT_TRUE(table.merge(kTree, {{"counter", 1}}));
  EXPECT_TRUE(table.values(kTree)->dictionary("large")->sharesStorageWith(large));
}

}  // namespace
}  // namespace velk
