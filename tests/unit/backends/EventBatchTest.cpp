#include "backends/EventBatch.h"

#include <gtest/gtest.h>
#include <malloc.h>

#include <cmath>
#include <deque>
#include <limits>
#include <random>

#include "backends/MemoryEstimate.h"
#include "foundation/Format.h"

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define VELK_SANITIZED_HEAP
#endif

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

TEST(EventBatch, GivesBackWhatItHoldsWithAnotherSessionID) {
  const auto memory = std::make_shared<BatchMemory>();
  EventBatch batch(memory);
  batch.append({{"_sessionID", std::string(100, 'x')}});
  for (const auto& sessionID : {std::string(500, 'y'), std::string("z")}) {
    batch.setSessionID(sessionID);
    EXPECT_EQ(memory->taken(), batch.estimatedSize());
  }
  batch.discard();
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
  LoneBatch batch;
  const PropertyDictionary event{{"a", "some text"}, {"_sessionID", "short"}};
  batch.append(event);
  batch.append({{"b", 1}});
  const std::string longer(200, 'x');
  batch.setSessionID(longer);
  EXPECT_EQ(batch.estimatedSize(), memoryEstimate({{"a", "some text"}, {"_sessionID", longer}}) +
                                       memoryEstimate({{"b", 1}, {"_sessionID", longer}}));
  batch.discard();
  EXPECT_EQ(batch.estimatedSize(), 0U);
}

/// Text in which order, types and signs of zeros show.
std::string exactText(const PropertyDictionary& event) {
  std::string text;
  for (const auto& [key, value] : event) {
    text += key + ":" + std::to_string(static_cast<int>(value.type())) + "=";
    if (const auto* dictionary = value.dictionary()) {
      text += "{" + exactText(*dictionary) + "}";
    } else if (value.date() != nullptr) {
      text += std::to_string(value.date()->secondsSince1970);
    } else {
      text += description(&value);
    }
    text += ";";
  }
  return text;
}

/// The memory of a process that holds more than it keeps as dictionaries.
std::shared_ptr<BatchMemory> takenMemory() {
  auto memory = std::make_shared<BatchMemory>();
  static_cast<void>(memory->take(EventBatch::kMaximumBytesAsDictionaries + 1, 0));
  return memory;
}

TEST(EventBatch, GivesEventsBackAsTheyWere) {
  std::mt19937 random(7);
  const std::vector<PropertyValue> values{PropertyValue(),
                                          true,
                                          false,
                                          0,
                                          1,
                                          -5,
                                          std::numeric_limits<std::int64_t>::min(),
                                          std::numeric_limits<std::uint64_t>::max(),
                                          0.0,
                                          -0.0,
                                          1.0,
                                          std::nan(""),
                                          Date{1.5},
                                          "",
                                          "1",
                                          std::string(300, 'x'),
                                          std::string("nul\0inside", 10),
                                          ByteData{},
                                          ByteData{0, 128, 255},
                                          PropertyArray{1, "two"},
                                          PropertyDictionary{{"a", 1}, {"b", 2}},
                                          PropertyDictionary{{"b", 2}, {"a", 1}},
                                          std::string(20'000, 'l')};
  for (int round = 0; round < 50; ++round) {
    EventBatch batch(takenMemory());
    std::vector<std::string> texts;
    std::uint64_t size = 0;
    for (int number = 0; number < 60; ++number) {
      PropertyDictionary event;
      const unsigned kind = random() % 20;
      for (unsigned key = 0; key < kind % 7 * 5; ++key) {
        event.set("key" + std::to_string(kind) + "." + std::to_string(key), values[random() % values.size()]);
      }
      texts.push_back(exactText(event));
      size += memoryEstimate(event);
      batch.append(std::move(event));
    }
    EXPECT_EQ(batch.estimatedSize(), size);
    const auto events = batch.take();
    ASSERT_EQ(events.size(), texts.size());
    for (std::size_t i = 0; i < texts.size(); ++i) EXPECT_EQ(exactText(events[i]), texts[i]) << i;
    EXPECT_EQ(batch.estimatedSize(), 0U);
  }
}

TEST(EventBatch, AppendsAfterASessionIDWasSetAsTheEventsSay) {
  EventBatch batch(takenMemory());
  batch.append({{"_sessionID", "a"}, {"number", 1}});
  batch.append({{"_sessionID", "a"}, {"number", 2}});
  batch.setSessionID("parent.a");
  batch.append({{"_sessionID", "b"}, {"number", 3}});
  const auto size = batch.estimatedSize();
  const auto events = batch.take();
  EXPECT_EQ(*events[1].string("_sessionID"), "parent.a");
  EXPECT_EQ(integerValue(events[1].find("number")), 2);
  EXPECT_EQ(*events[2].string("_sessionID"), "b");
  std::uint64_t expected = 0;
  for (const auto& event : events) expected += memoryEstimate(event);
  EXPECT_EQ(size, expected);
}

/// An event as sessions build them: some thirty entries, few of which differ.
PropertyDictionary usualEvent(int number) {
  PropertyDictionary event;
  event.reserve(32);
  event.set("screen", "settings/network/details");
  event.set("duration", number * 0.25);
  event.set("outcome", number % 3 == 0 ? "cancelled" : "completed");
  event.set("_eventNumber", number);
  event.set("_clientTS", 1'780'000'000.25 + number);
  event.set("eventTime", 1'780'000'000.25 + number);
  event.set("_sessionID", "Zm9vYmFyYmF6cXV4cXV1eA==.Zm9vYmFyYmF6cXV4cXV1eA==");
  for (int field = 0; field < 21; ++field)
    event.set("_fixedField" + std::to_string(field), "value" + std::to_string(field));
  return event;
}

TEST(EventBatch, TakesLittleMemory) {
#ifdef VELK_SANITIZED_HEAP
  GTEST_SKIP() << "the sanitizer's heap counts otherwise";
#endif
  constexpr int kSessions = 200;
  constexpr int kEvents = 45;
  const auto memory = std::make_shared<BatchMemory>();
  std::deque<EventBatch> batches;
  for (int session = 0; session < kSessions; ++session) batches.emplace_back(memory);
  const auto before = ::mallinfo2().uordblks;
  for (auto& batch : batches) {
    for (int number = 0; number < kEvents; ++number) batch.append(usualEvent(number));
  }
  const auto each = (::mallinfo2().uordblks - before) / kSessions;
  RecordProperty("bytes", static_cast<int>(each));
  EXPECT_LT(each, 16U * 1024);
}

}  // namespace
}  // namespace velk::test
