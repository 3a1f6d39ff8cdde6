// What a client does with the events that the daemon hands it, on a callback queue that runs when the test says so.
#include <gtest/gtest.h>

#include <stdexcept>

#include "client/LogTexts.h"
#include "client/VelkReportingAggregationObject.h"
#include "tests/support/ManualScheduler.h"
#include "tests/support/RecordingLog.h"

namespace velk::test {
namespace {

class AggregationObjectTest : public ::testing::Test {
 protected:
  struct Heard {
    bool isEnd = false;
    std::uint16_t type = 0;
    std::optional<PropertyDictionary> payload;
  };

  std::shared_ptr<VelkReportingAggregationObject> make(VelkReportingAggregationBlock block) {
    return std::make_shared<VelkReportingAggregationObject>(std::move(block), scheduler.makeSerialQueue("callbacks"));
  }
  std::shared_ptr<VelkReportingAggregationObject> makeListening() {
    return make([this](const auto& client, double, std::uint16_t, std::uint16_t type, const auto& payload) {
      heard.push_back({!client, type, payload});
    });
  }
  static void send(VelkReportingAggregationObject& object, std::uint16_t type, std::size_t bytes = 0) {
    object.sendMessageToClient(PropertyDictionary{{"SessionID", 7}}, 1, 2, type,
                               PropertyDictionary{{"text", std::string(bytes, 'x')}});
  }
  static void end(VelkReportingAggregationObject& object) {
    object.sendMessageToClient(std::nullopt, 0, 0, 0, std::nullopt);
  }

  ManualScheduler scheduler;
  RecordingLog log;
  std::vector<Heard> heard;
};

TEST_F(AggregationObjectTest, WithoutABlockIgnoresEvents) {
  const auto object = make(nullptr);
  EXPECT_FALSE(object->hasAggregationBlock());
  send(*object, 1);
  EXPECT_EQ(scheduler.pendingTasks(), 0U);
  EXPECT_EQ(log.count("sendMessageToClient: 2, 1"), 1);
}

TEST_F(AggregationObjectTest, AbsentPayloadStaysAbsent) {
  const auto object = makeListening();
  object->sendMessageToClient(PropertyDictionary(), 1, 2, 3, std::nullopt);
  scheduler.runUntilIdle();
  ASSERT_EQ(heard.size(), 1U);
  EXPECT_FALSE(heard[0].isEnd);
  EXPECT_FALSE(heard[0].payload);
}

TEST_F(AggregationObjectTest, BlockThatThrowsHearsNothingOfWhatWaitedBehind) {
  int calls = 0;
  const auto object = make([&calls](auto&&...) {
    ++calls;
    throw std::runtime_error("the host's own mistake");
  });
  send(*object, 1);
  send(*object, 2);
  scheduler.runUntilIdle();
  send(*object, 3);
  scheduler.runUntilIdle();
  EXPECT_EQ(calls, 1);
  EXPECT_FALSE(object->hasAggregationBlock());
  EXPECT_EQ(log.count(texts::kAggregationBlockThrew), 1);
}

TEST_F(AggregationObjectTest, ReleasedBlockEndsWhereCallbacksRun) {
  auto owned = std::make_shared<int>(1);
  const std::weak_ptr<int> watched = owned;
  const auto object = make([owned = std::move(owned)](auto&&...) {});
  object->releaseAggregationBlock();
  EXPECT_FALSE(watched.expired());
  scheduler.runUntilIdle();
  EXPECT_TRUE(watched.expired());
}

TEST_F(AggregationObjectTest, WhatWaitsForASlowBlockIsBoundedInNumber) {
  const auto object = makeListening();
  for (std::size_t event = 0; event < CallbackRoom::kMaximumWaiting + 5; ++event) {
    send(*object, static_cast<std::uint16_t>(event));
  }
  EXPECT_EQ(scheduler.pendingTasks(), CallbackRoom::kMaximumWaiting);
  EXPECT_EQ(log.count(log::Level::error, texts::kAggregationBlockIsSlow), 1) << "at once: it may never catch up";
  scheduler.runUntilIdle();
  ASSERT_EQ(heard.size(), CallbackRoom::kMaximumWaiting) << "the oldest are kept, in order";
  EXPECT_EQ(heard.back().type, CallbackRoom::kMaximumWaiting - 1);
  EXPECT_EQ(log.count(log::Level::error,
                      "sendMessageToClient: 5 events were dropped: the aggregation block is slower than they come"),
            1);
  send(*object, 9);
  scheduler.runUntilIdle();
  EXPECT_EQ(heard.back().type, 9) << "there is room again";
}

TEST_F(AggregationObjectTest, WhatWaitsForASlowBlockIsBoundedInBytes) {
  const auto object = makeListening();
  constexpr std::size_t kBytes = CallbackRoom::kMaximumBytes / 8;
  for (std::uint16_t event = 0; event < 10; ++event) send(*object, event, kBytes);
  EXPECT_EQ(scheduler.pendingTasks(), 7U);
  scheduler.runUntilIdle();
  EXPECT_EQ(heard.size(), 7U);
}

TEST_F(AggregationObjectTest, EndIsHeardHoweverFarBehindTheBlockIs) {
  const auto object = makeListening();
  constexpr std::size_t kBytes = CallbackRoom::kMaximumBytes / 2;
  for (std::uint16_t event = 0; event < 3; ++event) send(*object, event, kBytes);
  end(*object);
  end(*object);
  scheduler.runUntilIdle();
  ASSERT_EQ(heard.size(), 2U) << "one event, one end";
  EXPECT_FALSE(heard[0].isEnd);
  EXPECT_TRUE(heard[1].isEnd);
  end(*object);
  scheduler.runUntilIdle();
  EXPECT_EQ(heard.size(), 3U) << "a later aggregation ends too";
}

}  // namespace
}  // namespace velk::test
