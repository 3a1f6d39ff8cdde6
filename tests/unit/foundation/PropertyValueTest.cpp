#include "foundation/PropertyValue.h"

#include <gtest/gtest.h>

#include <limits>
#include <thread>

namespace velk {
namespace {

TEST(PropertyValue, EqualNumbersAreEqualValuesWhateverTheirSign) {
  EXPECT_EQ(PropertyValue(5), PropertyValue(std::uint64_t{5}));
  EXPECT_EQ(PropertyValue(std::uint64_t{INT64_MAX}).type(), PropertyValue::Type::integer);
  EXPECT_EQ(PropertyValue(UINT64_MAX).type(), PropertyValue::Type::unsignedInteger);
  EXPECT_NE(PropertyValue(1), PropertyValue(true));
  EXPECT_NE(PropertyValue(1), PropertyValue(1.0));
}

TEST(PropertyDictionary, KeepsTheOrderOfInsertion) {
  PropertyDictionary dictionary{{"zulu", 1}, {"alpha", 2}};
  dictionary.set("mike", 3);
  dictionary.set("zulu", 4);
  std::string order;
  for (const auto& entry : dictionary) order += entry.key + " ";
  EXPECT_EQ(order, "zulu alpha mike ");
  EXPECT_EQ(integerValue(dictionary.find("zulu")), 4);
}

TEST(PropertyDictionary, CopiesShareUntilOneWrites) {
  PropertyDictionary original{{"inner", PropertyDictionary{{"a", 1}}}};
  PropertyDictionary copy = original;
  EXPECT_TRUE(copy.sharesStorageWith(original));
  copy.findMutable("inner")->dictionary()->set("a", 2);
  EXPECT_FALSE(copy.sharesStorageWith(original));
  EXPECT_EQ(integerValue(original.dictionary("inner")->find("a")), 1);
  EXPECT_EQ(integerValue(copy.dictionary("inner")->find("a")), 2);
}

TEST(PropertyDictionary, FindsAndRemovesAmongThousands) {
  PropertyDictionary dictionary;
  for (int number = 0; number < 5000; ++number) dictionary.set("key" + std::to_string(number), number);
  for (int number = 0; number < 5000; ++number) {
    ASSERT_EQ(integerValue(dictionary.find("key" + std::to_string(number))), number);
  }
  EXPECT_EQ(dictionary.find("key5000"), nullptr);
  EXPECT_TRUE(dictionary.remove("key17"));
  EXPECT_FALSE(dictionary.remove("key17"));
  EXPECT_EQ(integerValue(dictionary.find("key4999")), 4999);
  EXPECT_EQ(dictionary.size(), 4999U);
}

TEST(PropertyDictionary, ShrinkingBelowTheIndexStillFinds) {
  PropertyDictionary dictionary;
  for (int number = 0; number < 30; ++number) dictionary.set(std::to_string(number), number);
  for (int number = 0; number < 29; ++number) EXPECT_TRUE(dictionary.remove(std::to_string(number)));
  EXPECT_EQ(integerValue(dictionary.find("29")), 29);
}

TEST(PropertyDictionary, MergesLaterValuesOverEarlierOnes) {
  PropertyDictionary target{{"a", 1}, {"b", 2}};
  target.merge(PropertyDictionary{{"b", 3}, {"c", 4}});
  EXPECT_EQ(target, (PropertyDictionary{{"a", 1}, {"b", 3}, {"c", 4}}));
  target.merge(target);
  EXPECT_EQ(target.size(), 3U);
}

TEST(PropertyDictionary, EqualityIgnoresOrder) {
  EXPECT_EQ((PropertyDictionary{{"a", 1}, {"b", 2}}), (PropertyDictionary{{"b", 2}, {"a", 1}}));
  EXPECT_NE((PropertyDictionary{{"a", 1}}), (PropertyDictionary{{"a", 1}, {"b", 2}}));
}

TEST(PropertyDictionary, CopiesOnDifferentThreadsMayWrite) {
  const PropertyDictionary original{{"count", 0}, {"list", PropertyArray{1, 2, 3}}};
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([copy = original, thread]() mutable {
      for (int round = 0; round < 1000; ++round) {
        PropertyDictionary mine = copy;
        mine.set("count", thread);
        mine.findMutable("list")->array()->append(round);
        copy = mine;
        copy.set("list", PropertyArray{});
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(original.array("list")->size(), 3U);
}

TEST(IntegerValue, TruncatesDoublesTowardZero) {
  EXPECT_EQ(integerValue(PropertyValue(2.9)), 2);
  EXPECT_EQ(integerValue(PropertyValue(-2.9)), -2);
  EXPECT_EQ(integerValue(PropertyValue(1e300)), INT64_MAX);
  EXPECT_EQ(integerValue(PropertyValue(-1e300)), INT64_MIN);
  EXPECT_EQ(integerValue(PropertyValue(std::numeric_limits<double>::quiet_NaN())), 0);
}

TEST(IntegerValue, ReadsLeadingDigitsOfText) {
  EXPECT_EQ(integerValue(PropertyValue("600,")), 600);
  EXPECT_EQ(integerValue(PropertyValue("  +42abc")), 42);
  EXPECT_EQ(integerValue(PropertyValue("-7")), -7);
  EXPECT_EQ(integerValue(PropertyValue("+-7")), 0);
  EXPECT_EQ(integerValue(PropertyValue("x1")), 0);
  EXPECT_EQ(integerValue(PropertyValue("")), 0);
  EXPECT_EQ(integerValue(PropertyValue("99999999999999999999")), INT64_MAX);
  EXPECT_EQ(integerValue(PropertyValue("-99999999999999999999")), INT64_MIN);
}

TEST(IntegerValue, IsZeroForWhatIsNoNumber) {
  EXPECT_EQ(integerValue(nullptr), 0);
  EXPECT_EQ(integerValue(PropertyValue()), 0);
  EXPECT_EQ(integerValue(PropertyValue(PropertyArray{1})), 0);
  EXPECT_EQ(integerValue(PropertyValue(Date{5})), 0);
  EXPECT_EQ(integerValue(PropertyValue(true)), 1);
}

TEST(IntegerValue, CutsToTheWidthThatIsAskedFor) {
  const PropertyValue category(70000);
  EXPECT_EQ(uint16Value(&category), 4464);
  const PropertyValue negative(-1);
  EXPECT_EQ(uint32Value(&negative), 0xFFFFFFFFU);
}

TEST(BooleanValue, ReadsNumbersAndWords) {
  const PropertyValue yes("YES"), no("no"), zero(0), big(UINT64_MAX), half(0.5), digits("007"), array(PropertyArray{1});
  EXPECT_TRUE(booleanValue(&yes));
  EXPECT_FALSE(booleanValue(&no));
  EXPECT_FALSE(booleanValue(&zero));
  EXPECT_TRUE(booleanValue(&big));
  EXPECT_TRUE(booleanValue(&half));
  EXPECT_TRUE(booleanValue(&digits));
  EXPECT_FALSE(booleanValue(&array));
  EXPECT_FALSE(booleanValue(nullptr));
}

TEST(DoubleValue, ReadsTextAndNumbers) {
  const PropertyValue text(" 0.25x"), integer(3), nothing;
  EXPECT_DOUBLE_EQ(doubleValue(&text), 0.25);
  EXPECT_DOUBLE_EQ(doubleValue(&integer), 3.0);
  EXPECT_DOUBLE_EQ(doubleValue(&nothing), 0.0);
}

}  // namespace
}  // namespace velk
