#include "backends/MemoryEstimate.h"

#include <gtest/gtest.h>

namespace velk::test {
namespace {

TEST(MemoryEstimate, OfAPlainValueIsItsAllocation) {
  for (const PropertyValue& value : {PropertyValue(5), PropertyValue(true), PropertyValue(1.5), PropertyValue(Date{1}),
                                     PropertyValue("text"), PropertyValue(ByteData(100))}) {
    EXPECT_GT(allocationSize(value), 0U);
    EXPECT_EQ(memoryEstimate(value), allocationSize(value));
  }
}

TEST(MemoryEstimate, GrowsWithTheText) {
  EXPECT_GE(memoryEstimate(PropertyValue(std::string(1000, 'x'))), 1000U);
  EXPECT_LT(memoryEstimate(PropertyValue(std::string(1000, 'x'))), 1100U);
}

TEST(MemoryEstimate, CountsTheBlocksOfADictionarysValuesTwice) {
  const PropertyValue number(5);
  const PropertyDictionary dictionary{{"key", number}};
  const std::uint32_t key = allocationSize(PropertyValue("key"));
  EXPECT_EQ(memoryEstimate(dictionary),
            key + memoryEstimate(number) + allocationSize(number) + allocationSize(PropertyValue(dictionary)));
}

TEST(MemoryEstimate, CountsTheBlocksOfAnArraysElementsTwice) {
  const PropertyValue text("some text");
  const PropertyArray array{text, text};
  EXPECT_EQ(memoryEstimate(array), 4 * allocationSize(text) + allocationSize(PropertyValue(array)));
}

TEST(MemoryEstimate, FollowsNesting) {
  const PropertyDictionary inner{{"a", 1}};
  const PropertyValue value{PropertyDictionary{{"inner", inner}}};
  EXPECT_EQ(memoryEstimate(value), allocationSize(PropertyValue("inner")) + memoryEstimate(inner) +
                                       allocationSize(PropertyValue(inner)) + allocationSize(value));
}

TEST(MemoryEstimate, WrapsAtThirtyTwoBits) {
  PropertyArray texts;
  for (int i = 0; i < 4; ++i) texts.append(std::string(std::size_t{16} << 20, 'x'));
  PropertyArray many;
  for (int i = 0; i < 40; ++i) many.append(texts);
  const std::uint64_t inner = 8ULL * allocationSize(texts[0]) + allocationSize(PropertyValue(texts));
  const std::uint64_t sum = 40 * (inner + allocationSize(PropertyValue(texts))) + allocationSize(PropertyValue(many));
  ASSERT_GT(sum, std::uint64_t{1} << 32);
  EXPECT_EQ(memoryEstimate(many), static_cast<std::uint32_t>(sum));
}

}  // namespace
}  // namespace velk::test
