#include "platform/EventLoop.h"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <memory>
#include <thread>

#include "tests/unit/ipc/WireHarness.h"

namespace velk {
namespace {

using namespace test;

TEST(EventLoop, RunsTasksInOrderOnItsOwnThread) {
  EventLoop loop("test-loop");
  std::vector<int> ran;
  Event done;
  for (int number = 0; number < 100; ++number) loop.post([&, number] { ran.push_back(number); });
  loop.post([&] {
    EXPECT_TRUE(loop.isCurrent());
    done.happen();
  });
  ASSERT_TRUE(done.wait());
  EXPECT_EQ(ran.size(), 100U);
  EXPECT_EQ(ran[99], 99);
  EXPECT_FALSE(loop.isCurrent());
}

TEST(EventLoop, RunsWhatWasPostedBeforeStopAndDestroysTheRest) {
  EventLoop loop("test-loop");
  int ran = 0;
  auto token = std::make_shared<int>(1);
  for (int number = 0; number < 10; ++number) loop.post([&ran, token] { ++ran; });
  loop.postAfter(std::chrono::hours(1), [&ran, token] { ++ran; });
  loop.stop();
  loop.post([&ran, token] { ++ran; });
  loop.makeLoopQueue("late")->async([&ran, token] { ++ran; });
  EXPECT_EQ(ran, 10);
  EXPECT_EQ(token.use_count(), 1);
}

TEST(EventLoop, MayBeGivenUpOnItsOwnThread) {
  auto loop = std::make_shared<EventLoop>("test-loop");
  Event gone;
  auto* raw = loop.get();
  raw->post([&gone, loop = std::move(loop)]() mutable {
    loop.reset();
    gone.happen();
  });
  ASSERT_TRUE(gone.wait());
}

TEST(EventLoop, WatchesADescriptor) {
  EventLoop loop("test-loop");
  std::array<int, 2> ends{};
  ASSERT_EQ(::pipe(ends.data()), 0);
  const FileDescriptor reading(ends[0]);
  const FileDescriptor writing(ends[1]);
  std::unique_ptr<DescriptorWatch> watch;
  Event ready;
  loop.post([&] {
    watch = loop.watch(reading.get());
    watch->whenReadable([&] { ready.happen(); });
  });
  ASSERT_EQ(::write(writing.get(), "x", 1), 1);
  EXPECT_TRUE(ready.wait());
  Event dropped;
  loop.post([&] {
    watch.reset();
    dropped.happen();
  });
  EXPECT_TRUE(dropped.wait());
}

TEST(EventLoop, DropsTheHandlersOfWatchesWhenStopped) {
  EventLoop loop("test-loop");
  std::array<int, 2> ends{};
  ASSERT_EQ(::pipe(ends.data()), 0);
  const FileDescriptor reading(ends[0]);
  const FileDescriptor writing(ends[1]);
  auto token = std::make_shared<int>(1);
  std::shared_ptr<DescriptorWatch> watch;
  loop.post([&] {
    watch = loop.watch(reading.get());
    watch->whenReadable([token, watch] {});
  });
  loop.stop();
  EXPECT_EQ(token.use_count(), 1);
}

// A connection whose last frame is just being run may be let go of by that thread, not by the loop's.
TEST(EventLoop, StopsWhileAnotherThreadGivesItsWatchesUp) {
  constexpr int kWatches = 200;
  EventLoop loop("test-loop");
  std::array<int, 2> ends{};
  ASSERT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
  const FileDescriptor reading(ends[0]);
  const FileDescriptor writing(ends[1]);
  std::vector<FileDescriptor> copies;
  std::vector<std::unique_ptr<DescriptorWatch>> watches;
  Event made;
  auto token = std::make_shared<int>(1);
  loop.post([&] {
    for (int count = 0; count < kWatches; ++count) {
      copies.emplace_back(::fcntl(reading.get(), F_DUPFD_CLOEXEC, 0));
      watches.push_back(loop.watch(copies.back().get()));
      watches.back()->whenReadable([token] {});
    }
    made.happen();
  });
  ASSERT_TRUE(made.wait());
  std::thread other([&] { watches.clear(); });
  loop.stop();
  other.join();
  EXPECT_EQ(token.use_count(), 1);
}

TEST(LoopQueue, RunsItsTasksOneByOneAndKnowsItself) {
  EventLoop loop("test-loop");
  const auto queue = loop.makeLoopQueue("queue");
  std::vector<int> ran;
  for (int number = 0; number < 500; ++number) queue->async([&, number] { ran.push_back(number); });
  const bool current = queue->sync([&] { return queue->isCurrent(); });
  EXPECT_TRUE(current);
  EXPECT_FALSE(queue->isCurrent());
  ASSERT_EQ(ran.size(), 500U);
  EXPECT_EQ(ran[499], 499);
}

TEST(LoopQueue, RunsSyncInlineWhenIdle) {
  EventLoop loop("test-loop");
  const auto queue = loop.makeLoopQueue("queue");
  EXPECT_EQ(queue->sync([] { return std::this_thread::get_id(); }), std::this_thread::get_id());
}

TEST(LoopQueue, LastReferenceMayGoInItsOwnSync) {
  EventLoop loop("test-loop");
  auto queue = loop.makeLoopQueue("queue");
  auto* const raw = queue.get();
  raw->sync([&] { queue.reset(); });
}

TEST(LoopQueue, SyncsOntoEachOtherOnTheLoopsThread) {
  EventLoop loop("test-loop");
  const auto first = loop.makeLoopQueue("first");
  const auto second = loop.makeLoopQueue("second");
  Event done;
  std::vector<int> ran;
  first->async([&] {
    second->async([&] { ran.push_back(1); });
    second->sync([&] {
      ran.push_back(2);
      first->sync([&] { ran.push_back(3); });
    });
    done.happen();
  });
  ASSERT_TRUE(done.wait());
  EXPECT_EQ(ran, (std::vector<int>{1, 2, 3}));
}

TEST(LoopQueue, ExcludesManyThreads) {
  EventLoop loop("test-loop");
  const auto queue = loop.makeLoopQueue("queue");
  int count = 0;
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([&] {
      for (int turn = 0; turn < 500; ++turn) {
        queue->async([&] { ++count; });
        queue->sync([&] { ++count; });
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(queue->sync([&] { return count; }), 4000);
}

TEST(LoopQueue, FiresTimersOnTheLoopsThread) {
  EventLoop loop("test-loop");
  const auto queue = loop.makeLoopQueue("queue");
  Event fired;
  const auto timer = loop.makeTimer(queue, [&] {
    EXPECT_TRUE(queue->isCurrent());
    fired.happen();
  });
  timer->start(std::chrono::milliseconds(1), std::chrono::milliseconds(1), {});
  EXPECT_TRUE(fired.wait());
  EXPECT_TRUE(fired.wait());
  timer->cancel();
  Event delayed;
  queue->asyncAfter(std::chrono::milliseconds(1), [&] { delayed.happen(); });
  EXPECT_TRUE(delayed.wait());
}

}  // namespace
}  // namespace velk
