#include "backends/EventBatch.h"

#include <gtest/gtest.h>

#include "backends/MemoryEstimate.h"

namespace velk::test {
namespace {

/// A batch with the memory of a process of its own.
struct LoneBatch : EventBatch {
  LoneBatch() : EventBatch(std::make_shared<BatchMemory>()) {}
};

PropertyDictionary eventOf(std::size_t bytes) { return {{"text", std::string(bytes, 'x')}}; }

int countsUntilReached(EventBatch& batch, const PropertyValue* method, std::int32_t threshold) {
  for (int counted = 1; counted < 1000; ++counted) {
    if (batch.countReaches(method, threshold)) return counted;
  }
  return -1;
}

TEST(EventBatch, ExistsFromCreationToTaking) {
  LoneBatch batch;
  EXPECT_FALSE(batch.exists());
  batch.create();
  EXPECT_TRUE(batch.exists());
  batch.append({{"a", 1}});
  EXPECT_EQ(batch.take().size(), 1U);
  EXPECT_FALSE(batch.exists());
  EXPECT_TRUE(batch.take().empty());
}

TEST(EventBatch, CountsEachMethodByItself) {
  LoneBatch batch;
  const PropertyValue first(1);
  const PropertyValue second(2);
  EXPECT_FALSE(batch.countReaches(&second, 3));
  EXPECT_EQ(countsUntilReached(batch, &first, 3), 5);
  EXPECT_EQ(countsUntilReached(batch, &second, 3), 4);
  // The event that reached the threshold counted as the first of the next round.
  EXPECT_EQ(countsUntilReached(batch, &first, 3), 4);
}

TEST(EventBatch, CountsAnyKindOfMethod) {
  LoneBatch batch;
  for (const PropertyValue& method : {PropertyValue("seven"), PropertyValue(1.5), PropertyValue(PropertyArray{})}) {
    EXPECT_EQ(countsUntilReached(batch, &method, 3), 5);
  }
  EXPECT_EQ(countsUntilReached(batch, nullptr, 3), 5);
}

TEST(EventBatch, ReachesAtOnceBelowAZeroThreshold) {
  LoneBatch batch;
  EXPECT_TRUE(batch.countReaches(nullptr, -1));
  EXPECT_TRUE(batch.countReaches(nullptr, -5));
}

TEST(EventBatch, CountsAFixedNumberOfMethods) {
  LoneBatch batch;
  for (std::size_t method = 0; method < EventBatch::kMaximumCounters; ++method) {
    const PropertyValue key(method);
    EXPECT_FALSE(batch.countReaches(&key, 0));
  }
  const PropertyValue known(5);
  const PropertyValue surplus(EventBatch::kMaximumCounters + 5);
  EXPECT_TRUE(batch.countReaches(&known, 0));
  EXPECT_EQ(countsUntilReached(batch, &surplus, 0), -1);
  batch.clearCounters();
  EXPECT_EQ(countsUntilReached(batch, &surplus, 0), 2);
}

TEST(EventBatch, RefusesEventsWhenFull) {
  LoneBatch batch;
  const auto large = eventOf(10U * 1024 * 1024);
  int kept = 0;
  while (batch.append(large) == EventBatch::Appended::kept) ++kept;
  EXPECT_GT(kept, 0);
  EXPECT_LE(batch.estimatedSize(), BatchMemory::kMaximumBytes);
  EXPECT_EQ(batch.append(large), EventBatch::Appended::stillFull);
  EXPECT_EQ(batch.append({{"small", 1}}), EventBatch::Appended::kept);
  batch.discard();
  EXPECT_EQ(batch.append(large), EventBatch::Appended::kept);
}

TEST(EventBatch, LeavesRoomForTheBatchesOfOthers) {
  const auto memory = std::make_shared<BatchMemory>(100'000);
  EventBatch greedy(memory);
  EventBatch second(memory);
  EventBatch third(memory);
  const auto small = eventOf(1000);
  const auto fill = [&small](EventBatch& batch) {
    while (batch.append(small) == EventBatch::Appended::kept) continue;
    return batch.estimatedSize();
  };
  EXPECT_LE(fill(greedy), 50'000U);
  EXPECT_GT(fill(second), 20'000U);
  EXPECT_GT(fill(third), 10'000U);
  EXPECT_LE(memory->taken(), 100'000U);
  EXPECT_EQ(memory->taken(), greedy.estimatedSize() + second.estimatedSize() + third.estimatedSize());
}

TEST(EventBatch, GivesItsMemoryBack) {
  const auto memory = std::make_shared<BatchMemory>();
  {
    EventBatch taken(memory);
    EventBatch discarded(memory);
    EventBatch dropped(memory);
    for (auto* batch : {&taken, &discarded, &dropped}) batch->append(eventOf(1000));
    EXPECT_EQ(memory->taken(), 3 * taken.estimatedSize());
    EXPECT_EQ(taken.take().size(), 1U);
    discarded.discard();
    EXPECT_EQ(memory->taken(), dropped.estimatedSize());
    EXPECT_EQ(dropped.append(eventOf(BatchMemory::kMaximumBytes)), EventBatch::Appended::full);
    EXPECT_EQ(memory->taken(), dropped.estimatedSize());
  }
  EXPECT_EQ(memory->taken(), 0U);
}

TEST(EventBatch, WritesASessionIDIntoEveryEvent) {
  LoneBatch batch;
  batch.append({{"_sessionID", 5}});
  batch.append({{"a", 1}});
  batch.setSessionID("parent.child");
  for (const auto& event : batch.take()) EXPECT_EQ(*event.string("_sessionID"), "parent.child");
}

TEST(EventBatch, EstimatesItsSize) {
  LoneBatch batch;
  EXPECT_EQ(batch.estimatedSize(), 0U);
  const PropertyDictionary event{{"a", "some text"}};
  batch.append(event);
  batch.append(event);
  EXPECT_EQ(batch.estimatedSize(), 2U * memoryEstimate(event));
  EXPECT_EQ(batch.count(), 2U);
}

TEST(EventBatch, EstimatesItsSizeWithTheSessionIDThatWasSetLast) {
  const auto memory = std::make_shared<BatchMemory>();
  EventBatch batch(memory);
  const PropertyDictionary event{{"a", "some text"}, {"_sessionID", "short"}};
  batch.append(event);
  batch.append({{"b", 1}});
  const std::string longer(200, 'x');
  batch.setSessionID(longer);
  EXPECT_EQ(batch.estimatedSize(), memoryEstimate({{"a", "some text"}, {"_sessionID", longer}}) +
                                       memoryEstimate({{"b", 1}, {"_sessionID", longer}}));
  EXPECT_EQ(memory->taken(), batch.estimatedSize());
  batch.setSessionID("short");
  EXPECT_EQ(memory->taken(), batch.estimatedSize());
  batch.discard();
  EXPECT_EQ(batch.estimatedSize(), 0U);
  EXPECT_EQ(memory->taken(), 0U);
}

}  // namespace
}  // namespace velk::test
