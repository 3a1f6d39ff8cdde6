#include "daemon/StorebagTable.h"

#include <gtest/gtest.h>

#include <set>
#include <string>

namespace velk {
namespace {

TEST(StorebagTable, NamesTwentyOneStorebagsForTheTypesFromFiveToThirty) {
  std::set<std::string_view> names;
  for (std::int32_t type = 5; type <= 30; ++type) {
    const auto name = storebagNameForClientType(type);
    ASSERT_TRUE(name.has_value()) << type;
    names.insert(*name);
    // Names are file names and parts of addresses.
    EXPECT_EQ(name->find_first_not_of("abcdefghijklmnopqrstuvwxyz"), std::string_view::npos) << *name;
  }
  EXPECT_EQ(names.size(), 21U);
}

TEST(StorebagTable, GivesTheConferencingTypesOneName) {
  for (const std::int32_t type : {7, 11, 13, 20}) EXPECT_EQ(storebagNameForClientType(type), "sorrel");
  EXPECT_NE(storebagNameForClientType(8), "sorrel");
}

TEST(StorebagTable, HasNoNameForAnyOtherType) {
  for (const std::int32_t type : {0, 4, 31, -1, INT32_MAX, INT32_MIN}) {
    EXPECT_EQ(storebagNameForClientType(type), std::nullopt) << type;
  }
}

TEST(StorebagTable, DefaultServersSpeakHttpsUnderTheirPaths) {
  EXPECT_TRUE(kInternalStorebagServer.starts_with("https://"));
  EXPECT_TRUE(kInternalStorebagServer.ends_with("/storebags/vindle"));
  EXPECT_TRUE(kProductionStorebagServer.starts_with("https://"));
  EXPECT_TRUE(kProductionStorebagServer.ends_with("/bags/vindle"));
}

}  // namespace
}  // namespace velk
