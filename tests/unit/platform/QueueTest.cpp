#include "platform/Queue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <thread>
#include <vector>

#include "platform/Lock.h"
#include "platform/Semaphore.h"
#include "platform/ThreadPool.h"

namespace velk {
namespace {

class QueueTest : public testing::Test {
 protected:
  /// Keeps `queue` busy until the returned semaphore is signalled; returns once it is.
  static std::shared_ptr<Semaphore> occupy(Queue& queue) {
    auto gate = std::make_shared<Semaphore>();
    Semaphore entered;
    queue.async([gate, &entered] {
      entered.signal();
      gate->wait();
    });
    entered.wait();
    return gate;
  }
  static void drain(Queue& queue) {
    Semaphore done;
    queue.async([&] { done.signal(); });
    done.wait();
  }

  std::unique_ptr<ThreadPool> pool = makeThreadPool();
  std::shared_ptr<Queue> queue = pool->makeSerialQueue("com.tavrin.test.queue");
};

TEST_F(QueueTest, KeepsItsLabel) { EXPECT_EQ(queue->label(), "com.tavrin.test.queue"); }

TEST_F(QueueTest, RunsTasksInOrder) {
  std::vector<int> order;
  for (int number = 0; number < 1000; ++number) queue->async([&order, number] { order.push_back(number); });
  queue->sync([] {});
  ASSERT_EQ(order.size(), 1000u);
  for (int number = 0; number < 1000; ++number) EXPECT_EQ(order[static_cast<std::size_t>(number)], number);
}

TEST_F(QueueTest, RunsTasksThatTasksHandOverAfterTheOthers) {
  std::vector<int> order;
  const auto gate = occupy(*queue);
  queue->async([&] {
    order.push_back(1);
    queue->async([&] { order.push_back(3); });
  });
  queue->async([&] { order.push_back(2); });
  gate->signal();
  drain(*queue);
  queue->sync([] {});
  EXPECT_EQ(order, (std::vector{1, 2, 3}));
}

TEST_F(QueueTest, IdleQueueRunsSyncInlineWithoutAThread) {
  const auto caller = std::this_thread::get_id();
  EXPECT_EQ(queue->sync([] { return std::this_thread::get_id(); }), caller);
  EXPECT_EQ(pool->threadCount(), 0u);
}

TEST_F(QueueTest, SyncHandsOutWhatTheWorkReturns) {
  const auto moved = queue->sync([] { return std::make_unique<int>(7); });
  EXPECT_EQ(*moved, 7);
}

TEST_F(QueueTest, SyncOnABusyQueueRunsAfterWhatIsPendingOnTheCallingThread) {
  std::vector<int> order;
  const auto gate = occupy(*queue);
  for (int number = 0; number < 100; ++number) queue->async([&order, number] { order.push_back(number); });
  std::thread opener([&] { gate->signal(); });
  const auto caller = std::this_thread::get_id();
  queue->sync([&] {
    EXPECT_EQ(order.size(), 100u);
    EXPECT_EQ(std::this_thread::get_id(), caller);
    EXPECT_TRUE(queue->isCurrent());
  });
  opener.join();
}

TEST_F(QueueTest, TasksHandedOverDuringSyncRunAfterwards) {
  std::atomic<bool> left = false;
  bool ranAfter = false;
  queue->sync([&] {
    queue->async([&] { ranAfter = left; });
    // A second task must not begin either, on whatever thread.
    queue->async([&] { EXPECT_TRUE(left); });
    left = true;
  });
  queue->sync([] {});
  EXPECT_TRUE(ranAfter);
}

TEST_F(QueueTest, SyncFromItsOwnTaskRunsAtOnce) {
  std::vector<int> order;
  queue->async([&] {
    queue->async([&] { order.push_back(3); });
    queue->sync([&] {
      order.push_back(1);
      queue->sync([&] { order.push_back(2); });
    });
  });
  drain(*queue);
  queue->sync([] {});
  EXPECT_EQ(order, (std::vector{1, 2, 3}));
}

TEST_F(QueueTest, IsCurrentInTasksAndNestedSyncsOnly) {
  const auto other = pool->makeSerialQueue("other");
  EXPECT_FALSE(queue->isCurrent());
  queue->sync([&] {
    EXPECT_TRUE(queue->isCurrent());
    EXPECT_FALSE(other->isCurrent());
    other->sync([&] {
      EXPECT_TRUE(queue->isCurrent());
      EXPECT_TRUE(other->isCurrent());
      queue->sync([&] { assertOnQueue(*queue); });
    });
    EXPECT_FALSE(other->isCurrent());
  });
  EXPECT_FALSE(queue->isCurrent());
  Semaphore done;
  queue->async([&] {
    EXPECT_TRUE(queue->isCurrent());
    EXPECT_FALSE(other->isCurrent());
    done.signal();
  });
  done.wait();
}

TEST_F(QueueTest, SyncThatWaitsKeepsTheCallersQueuesAndLocks) {
  const auto outer = pool->makeSerialQueue("outer");
  Monitor monitor;
  const auto gate = occupy(*queue);
  std::thread opener([&] { gate->signal(); });
  outer->sync([&] {
    Guard guard(monitor);
    queue->sync([&] {
      Guard again(monitor);
      EXPECT_TRUE(outer->isCurrent());
      outer->sync([&] { EXPECT_TRUE(queue->isCurrent()); });
    });
  });
  opener.join();
}

TEST_F(QueueTest, PendingTasksRunAfterTheLastReferenceHasGone) {
  Semaphore ran;
  const auto gate = occupy(*queue);
  queue->async([&] { ran.signal(); });
  queue.reset();
  gate->signal();
  ran.wait();
}

TEST_F(QueueTest, LastReferenceMayGoInItsOwnTaskAndInItsOwnSync) {
  Semaphore ran;
  queue->async([&, own = queue]() mutable {
    own.reset();
    ran.signal();
  });
  queue.reset();
  ran.wait();
  queue = pool->makeSerialQueue("another");
  auto* const raw = queue.get();
  raw->sync([&] { queue.reset(); });
}

TEST_F(QueueTest, TaskEndsOnItsQueueBeforeTheNextOneBegins) {
  struct Owned {
    Queue& queue;
    bool& ended;
    ~Owned() {
      EXPECT_TRUE(queue.isCurrent());
      ended = true;
    }
  };
  bool ended = false;
  const auto gate = occupy(*queue);
  queue->async([owned = std::unique_ptr<Owned>(new Owned{*queue, ended})] { EXPECT_TRUE(owned); });
  queue->async([&] { EXPECT_TRUE(ended); });
  gate->signal();
  queue->sync([] {});
}

TEST_F(QueueTest, SyncsFromManyThreadsExcludeEachOtherAndTheTasks) {
  int plain = 0;  // Unguarded on purpose.
  std::vector<std::thread> threads;
  for (int number = 0; number < 4; ++number) {
    threads.emplace_back([&] {
      for (int turn = 0; turn < 500; ++turn) {
        queue->async([&] { ++plain; });
        queue->sync([&] { ++plain; });
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(queue->sync([&] { return plain; }), 4000);
}

TEST_F(QueueTest, TasksOfManyQueuesUnderStressRunOnceAndInOrder) {
  constexpr std::size_t kQueues = 32;
  constexpr int kTasks = 400;
  struct Lane {
    std::shared_ptr<Queue> queue;
    int next[3] = {};
    int outOfOrder = 0;
  };
  std::vector<Lane> lanes(kQueues);
  for (auto& lane : lanes) lane.queue = pool->makeSerialQueue("lane");
  std::vector<std::thread> producers;
  for (int producer = 0; producer < 3; ++producer) {
    producers.emplace_back([&, producer] {
      for (int number = 0; number < kTasks; ++number) {
        for (auto& lane : lanes) {
          lane.queue->async([&lane, producer, number] {
            if (lane.next[producer]++ != number) ++lane.outOfOrder;
          });
        }
        if (number % 50 == 0) lanes[static_cast<std::size_t>(number) % kQueues].queue->sync([] {});
      }
    });
  }
  for (auto& producer : producers) producer.join();
  pool->stop();
  for (auto& lane : lanes) {
    EXPECT_EQ(lane.outOfOrder, 0);
    for (const int count : lane.next) EXPECT_EQ(count, kTasks);
  }
}

TEST(QueueDeathTest, AssertOnQueueEndsTheProcessElsewhere) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        const auto pool = makeThreadPool();
        assertOnQueue(*pool->makeSerialQueue("com.tavrin.state"));
      },
      "called off its queue: com.tavrin.state");
}

}  // namespace
}  // namespace velk
