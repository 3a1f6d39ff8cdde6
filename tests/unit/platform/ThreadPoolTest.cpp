#include "platform/ThreadPool.h"

#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "foundation/Completion.h"
#include "platform/BlockingScope.h"
#include "platform/Lock.h"
#include "platform/Semaphore.h"

namespace velk {
namespace {

using namespace std::chrono_literals;

ThreadPoolOptions options(std::size_t running, std::size_t maximum = 512, Duration idle = 1h) {
  ThreadPoolOptions result;
  result.runningThreads = running;
  result.maximumThreads = maximum;
  result.idleThreadLifetime = idle;
  return result;
}

TEST(ThreadPool, StartsNoThreadBeforeThereIsWork) {
  const auto pool = makeThreadPool();
  const auto queue = pool->makeSerialQueue("queue");
  EXPECT_EQ(pool->threadCount(), 0u);
  Semaphore ran;
  queue->async([&] { ran.signal(); });
  ran.wait();
  EXPECT_EQ(pool->threadCount(), 1u);
}

TEST(ThreadPool, RunsNoMoreThanItsRunningThreadsWhileNoneIsBlocked) {
  const auto pool = makeThreadPool(options(3));
  std::atomic<int> running = 0;
  std::atomic<int> most = 0;
  for (int number = 0; number < 200; ++number) {
    pool->makeSerialQueue("queue")->async([&] {
      const int now = ++running;
      for (int seen = most; seen < now && !most.compare_exchange_weak(seen, now);) {
      }
      std::this_thread::yield();
      --running;
    });
  }
  pool->stop();
  EXPECT_LE(most, 3);
}

TEST(ThreadPool, BlockedTasksMakeRoomForTheOneTheyWaitFor) {
  const auto pool = makeThreadPool(options(2));
  Semaphore gate;
  Semaphore done;
  constexpr int kBlocked = 40;
  for (int number = 0; number < kBlocked; ++number) {
    pool->makeSerialQueue("blocked")->async([&] {
      gate.wait();
      done.signal();
    });
  }
  pool->makeSerialQueue("opener")->async([&] {
    for (int number = 0; number < kBlocked; ++number) gate.signal();
  });
  for (int number = 0; number < kBlocked; ++number) done.wait();
}

TEST(ThreadPool, WaitersForAMonitorCountAsBlocked) {
  const auto pool = makeThreadPool(options(2));
  Monitor monitor;
  Semaphore held;
  Semaphore release;
  Semaphore done;
  pool->makeSerialQueue("holder")->async([&] {
    Guard guard(monitor);
    held.signal();
    release.wait();
  });
  held.wait();
  for (int number = 0; number < 10; ++number) {
    pool->makeSerialQueue("waiter")->async([&] {
      { Guard guard(monitor); }
      done.signal();
    });
  }
  pool->makeSerialQueue("opener")->async([&] { release.signal(); });
  for (int number = 0; number < 10; ++number) done.wait();
}

TEST(ThreadPool, WaitersInSyncCountAsBlocked) {
  const auto pool = makeThreadPool(options(2));
  const auto shared = pool->makeSerialQueue("shared");
  Semaphore entered;
  Semaphore release;
  Semaphore done;
  shared->async([&] {
    entered.signal();
    release.wait();
  });
  entered.wait();
  for (int number = 0; number < 10; ++number) {
    pool->makeSerialQueue("waiter")->async([&] {
      shared->sync([] {});
      done.signal();
    });
  }
  pool->makeSerialQueue("opener")->async([&] { release.signal(); });
  for (int number = 0; number < 10; ++number) done.wait();
}

TEST(ThreadPool, NestedBlockingScopesCountOnce) {
  const auto pool = makeThreadPool(options(1));
  Semaphore gate;
  Semaphore done;
  pool->makeSerialQueue("nested")->async([&] {
    BlockingScope outer;
    {
      BlockingScope inner;
      gate.wait();
    }
    gate.wait();
    done.signal();
  });
  const auto opener = pool->makeSerialQueue("opener");
  opener->async([&] { gate.signal(); });
  opener->async([&] { gate.signal(); });
  done.wait();
}

TEST(ThreadPool, WorkWaitsWhenAllThreadsThatMayExistAreBlocked) {
  const auto pool = makeThreadPool(options(1, 3));
  Semaphore entered;
  Semaphore gate;
  std::atomic<int> ran = 0;
  for (int number = 0; number < 5; ++number) {
    pool->makeSerialQueue("blocked")->async([&] {
      entered.signal();
      gate.wait();
      ++ran;
    });
  }
  for (int number = 0; number < 3; ++number) entered.wait();
  EXPECT_EQ(pool->threadCount(), 3u);
  for (int number = 0; number < 5; ++number) gate.signal();
  pool->stop();
  EXPECT_EQ(ran, 5);
}

TEST(ThreadPool, ABlockedPoolStartsAnotherThreadForTheTaskThatAllWaitFor) {
  auto limits = options(2, 3);
  limits.emergencyThreads = 8;
  const auto pool = makeThreadPool(limits);
  constexpr int kBlocked = 6;
  Semaphore gate;
  Semaphore done;
  std::vector<std::shared_ptr<Queue>> queues;
  for (int number = 0; number < kBlocked; ++number) {
    queues.push_back(pool->makeSerialQueue("waiter"));
    queues.back()->async([&] {
      gate.wait();
      done.signal();
    });
  }
  Semaphore opened;
  const auto opener = pool->makeSerialQueue("opener");
  opener->async([&] {
    for (int number = 0; number < kBlocked; ++number) gate.signal();
    opened.signal();
  });
  const bool progressed = opened.waitFor(20s);
  EXPECT_TRUE(progressed);
  for (int number = 0; !progressed && number < kBlocked; ++number) gate.signal();
  for (int number = 0; number < kBlocked; ++number) done.wait();
}

TEST(ThreadPool, EmergencyThreadsAreBoundedToo) {
  auto limits = options(1, 1);
  limits.emergencyThreads = 1;
  const auto pool = makeThreadPool(limits);
  Semaphore gate;
  Semaphore blocked;
  std::vector<std::shared_ptr<Queue>> queues;
  for (int number = 0; number < 4; ++number) {
    queues.push_back(pool->makeSerialQueue("waiter"));
    queues.back()->async([&] {
      blocked.signal();
      gate.wait();
    });
  }
  blocked.wait();
  blocked.wait();
  EXPECT_LE(pool->threadCount(), 2u);
  for (int number = 0; number < 4; ++number) gate.signal();
  pool->stop();
}

/// The system refuses every thread while one lives: it has no room for such a stack.
class RefusedThreads {
 public:
  RefusedThreads() {
    pthread_getattr_default_np(&_usual);
    pthread_attr_t absurd;
    pthread_attr_init(&absurd);
    pthread_attr_setstacksize(&absurd, std::size_t{1} << 50);
    pthread_setattr_default_np(&absurd);
    pthread_attr_destroy(&absurd);
  }
  ~RefusedThreads() {
    pthread_setattr_default_np(&_usual);
    pthread_attr_destroy(&_usual);
  }

 private:
  pthread_attr_t _usual;
};

/// Ends the test when the pool stands still: its destructor would wait for ever.
void expectProgress(std::unique_ptr<ThreadPool>& pool, Semaphore& done) {
  if (done.waitFor(20s)) return;
  ADD_FAILURE() << "the pool stands still";
  static_cast<void>(pool.release());
}

TEST(ThreadPool, ASyncRunsWhatStandsBeforeItWhereNoThreadIsLeft) {
  auto pool = makeThreadPool(options(1, 1));
  const auto caller = pool->makeSerialQueue("caller");
  const auto other = pool->makeSerialQueue("other");
  static std::vector<int> order;
  static Semaphore done;
  order.clear();
  caller->async([other] {
    for (int number = 0; number < 200; ++number) other->async([number] { order.push_back(number); });
    other->sync([] { order.push_back(200); });
    other->async([] { order.push_back(201); });
    other->sync([] { order.push_back(202); });
    done.signal();
  });
  expectProgress(pool, done);
  ASSERT_EQ(order.size(), 203U);
  EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST(ThreadPool, ASyncThatSleepsRunsWhatStandsBeforeItWhereNoThreadIsLeft) {
  auto pool = makeThreadPool(options(1, 1));
  const auto caller = pool->makeSerialQueue("caller");
  const auto other = pool->makeSerialQueue("other");
  static std::vector<int> order;
  static Semaphore done;
  static Semaphore called;
  order.clear();
  other->sync([&] {
    other->async([] { order.push_back(1); });
    caller->async([other] {
      called.signal();
      other->sync([] { order.push_back(2); });
      done.signal();
    });
    // The pool's only thread sleeps, behind a task that wants it.
    called.wait();
    while (pool->threadCount() != 1) std::this_thread::yield();
  });
  expectProgress(pool, done);
  EXPECT_EQ(order, (std::vector{1, 2}));
}

TEST(ThreadPool, EverybodyMaySyncWithEverybodyElsesQueueOnFewThreads) {
  constexpr int kQueues = 30;
  auto pool = makeThreadPool(options(2, 3));
  std::vector<std::shared_ptr<Queue>> states;
  for (int number = 0; number < kQueues; ++number) states.push_back(pool->makeSerialQueue("state"));
  static Semaphore done;
  static std::atomic<int> left;
  left = kQueues;
  for (int number = 0; number < kQueues; ++number) {
    pool->makeSerialQueue("caller")->async([states, number] {
      for (int turn = 0; turn < 200; ++turn) {
        const auto& state = states[static_cast<std::size_t>(number + turn) % kQueues];
        for (int task = 0; task < turn % 5; ++task) state->async([] {});
        state->sync([] {});
      }
      if (--left == 0) done.signal();
    });
  }
  expectProgress(pool, done);
}

TEST(ThreadPool, KeepsAThreadFromPatientQueuesForWhatTheyWaitFor) {
  auto limits = options(4, 3);
  limits.patientQueues = {"patient"};
  limits.keptThreads = 1;
  auto pool = makeThreadPool(limits);
  constexpr int kPatient = 8;
  static Semaphore gate;
  static Semaphore ended;
  static Semaphore opened;
  for (int number = 0; number < kPatient; ++number) {
    pool->makeSerialQueue("patient")->async([] {
      gate.wait();
      ended.signal();
    });
  }
  pool->makeSerialQueue("opener")->async([] {
    for (int number = 0; number < kPatient; ++number) gate.signal();
    opened.signal();
  });
  expectProgress(pool, opened);
  for (int number = 0; number < kPatient; ++number) ended.wait();
}

TEST(ThreadPool, KeptThreadsStartAtOnceAndNeverEnd) {
  auto limits = options(2, 512, 1ms);
  limits.patientQueues = {"patient"};
  limits.keptThreads = 1;
  const auto pool = makeThreadPool(limits);
  EXPECT_EQ(pool->threadCount(), 1U);
  for (int turn = 0; turn < 5; ++turn) {
    Semaphore ran;
    pool->makeSerialQueue(turn % 2 == 0 ? "patient" : "other")->async([&] { ran.signal(); });
    ran.wait();
    while (pool->threadCount() != 1) std::this_thread::sleep_for(1ms);
  }
}

TEST(ThreadPool, AsksAgainForAThreadWithoutFurtherWork) {
  auto pool = makeThreadPool(options(2));
  static Semaphore waits;
  static Semaphore gate;
  static Semaphore ran;
  const auto first = pool->makeSerialQueue("first");
  first->asyncAfter(1ms, [] {
    waits.signal();
    gate.wait();
  });
  waits.wait();
  const auto second = pool->makeSerialQueue("second");
  {
    RefusedThreads refused;
    second->async([] { ran.signal(); });
    EXPECT_FALSE(ran.waitFor(50ms)) << "there is no thread for it";
  }
  expectProgress(pool, ran);
  gate.signal();
}

TEST(ThreadPool, StopNeedsNoNewThread) {
  auto pool = makeThreadPool(options(2));
  Semaphore waits;
  Semaphore gate;
  std::atomic<bool> ran = false;
  const auto blocked = pool->makeSerialQueue("blocked");
  const auto opener = pool->makeSerialQueue("opener");
  blocked->async([&] {
    waits.signal();
    gate.wait();
    ran = true;
  });
  waits.wait();
  RefusedThreads refused;
  opener->async([&] { gate.signal(); });
  pool->stop();
  EXPECT_TRUE(ran);
}

TEST(ThreadPool, IdleThreadsEnd) {
  const auto pool = makeThreadPool(options(2, 512, 1ms));
  const auto queue = pool->makeSerialQueue("queue");
  Semaphore ended;
  struct Sentinel {
    Semaphore* semaphore = nullptr;
    ~Sentinel() {
      if (semaphore != nullptr) semaphore->signal();
    }
  };
  for (int turn = 0; turn < 3; ++turn) {
    queue->async([&] {
      thread_local Sentinel sentinel;
      sentinel.semaphore = &ended;
    });
    ended.wait();
  }
  EXPECT_EQ(pool->threadCount(), 0u);
}

TEST(ThreadPool, BusyQueueLetsOthersHaveTheThread) {
  const auto pool = makeThreadPool(options(1));
  const auto greedy = pool->makeSerialQueue("greedy");
  const auto modest = pool->makeSerialQueue("modest");
  Semaphore entered;
  Semaphore go;
  greedy->async([&] {
    entered.signal();
    // Held without a BlockingScope, so that the pool has no other thread.
    while (!go.waitFor(0s)) std::this_thread::yield();
  });
  entered.wait();
  std::atomic<bool> modestRan = false;
  int before = 0;
  for (int number = 0; number < 1000; ++number) {
    greedy->async([&] {
      if (!modestRan) ++before;
    });
  }
  modest->async([&] { modestRan = true; });
  Semaphore done;
  greedy->async([&] { done.signal(); });
  go.signal();
  done.wait();
  EXPECT_TRUE(modestRan);
  EXPECT_LT(before, 200);
}

TEST(ThreadPool, ThreadIsNamedAfterTheLastComponentOfTheLabel) {
  const auto pool = makeThreadPool();
  const auto nameOn = [&](const char* label) {
    std::string name;
    Semaphore done;
    pool->makeSerialQueue(label)->async([&] {
      char text[16] = {};
      pthread_getname_np(pthread_self(), text, sizeof text);
      name = text;
      done.signal();
    });
    done.wait();
    return name;
  };
  EXPECT_EQ(nameOn("com.tavrin.velkreporting.state"), "state");
  EXPECT_EQ(nameOn("plain"), "plain");
  EXPECT_EQ(nameOn("com.tavrin.aVeryLongNameForAQueue"), "aVeryLongNameFo");
  EXPECT_EQ(nameOn("ends.in.dot."), "ends.in.dot.");
}

TEST(ThreadPool, TimersFireOnTheirQueue) {
  const auto pool = makeThreadPool();
  const auto queue = pool->makeSerialQueue("queue");
  Semaphore fired;
  const auto timer = pool->makeTimer(queue, [&] {
    EXPECT_TRUE(queue->isCurrent());
    fired.signal();
  });
  timer->start(1ms, 1ms, 0ms);
  fired.wait();
  fired.wait();
  queue->sync([&] { timer->cancel(); });
  Semaphore delayed;
  queue->asyncAfter(1ms, [&] { delayed.signal(); });
  delayed.wait();
}

TEST(ThreadPool, EarlierDeadlineDoesNotWaitForALaterOne) {
  const auto pool = makeThreadPool();
  const auto queue = pool->makeSerialQueue("queue");
  Semaphore fired;
  queue->asyncAfter(10h, [] { ADD_FAILURE(); });
  queue->asyncAfter(1ms, [&] { fired.signal(); });
  fired.wait();
}

TEST(ThreadPool, StopRunsWhatWasHandedOverWhatThatHandsOverAndNothingDelayed) {
  auto pool = makeThreadPool(options(2));
  const auto queue = pool->makeSerialQueue("queue");
  const auto other = pool->makeSerialQueue("other");
  std::atomic<int> ran = 0;
  bool dropped = false;
  queue->asyncAfter(
      1h, [completion = Completion<>([] { ADD_FAILURE(); }, [&] { dropped = true; })]() mutable { completion(); });
  const auto timer = pool->makeTimer(queue, [] { ADD_FAILURE(); });
  timer->start(1h, 1h, 0s);
  for (int number = 0; number < 100; ++number) {
    queue->async([&] {
      ++ran;
      other->async([&] { ++ran; });
    });
  }
  pool->stop();
  EXPECT_EQ(ran, 200);
  EXPECT_TRUE(dropped);
  EXPECT_EQ(pool->threadCount(), 0u);
  pool->stop();
}

TEST(ThreadPool, StoppedPoolDropsTasksAndStillRunsSyncInline) {
  auto pool = makeThreadPool();
  const auto queue = pool->makeSerialQueue("queue");
  pool->stop();
  int dropped = 0;
  const auto task = [&] {
    return [completion = Completion<>([] { ADD_FAILURE(); }, [&] { ++dropped; })]() mutable { completion(); };
  };
  queue->async(task());
  queue->asyncAfter(1s, task());
  EXPECT_EQ(dropped, 2);
  const auto timer = pool->makeTimer(queue, [] { ADD_FAILURE(); });
  timer->start(0s, std::nullopt, 0s);
  pool.reset();
  EXPECT_EQ(queue->sync([] { return 3; }), 3);
}

TEST(ThreadPool, TasksHandedOverDuringASyncThatOutlastsThePoolRunAtItsEnd) {
  auto pool = makeThreadPool();
  const auto queue = pool->makeSerialQueue("queue");
  bool ran = false;
  queue->sync([&] {
    queue->async([&] { ran = true; });
    pool.reset();
    EXPECT_FALSE(ran);
  });
  EXPECT_TRUE(ran);
}

TEST(ThreadPool, HandingOverWhileItStopsRunsOrDropsButNeverLosesATask) {
  for (int turn = 0; turn < 20; ++turn) {
    auto pool = makeThreadPool(options(2, 512, 1ms));
    std::atomic<int> ended = 0;
    Semaphore begun;
    std::vector<std::shared_ptr<Queue>> queues;
    for (int number = 0; number < 4; ++number) queues.push_back(pool->makeSerialQueue("queue"));
    std::thread producer([&] {
      begun.signal();
      for (int number = 0; number < 200; ++number) {
        queues[static_cast<std::size_t>(number % 4)]->async(
            [completion = Completion<>([&] { ++ended; }, [&] { ++ended; })]() mutable { completion(); });
        queues[static_cast<std::size_t>((number + 1) % 4)]->sync([] {});
      }
    });
    begun.wait();
    pool->stop();
    producer.join();
    for (auto& queue : queues) queue->sync([] {});
    EXPECT_EQ(ended, 200);
  }
}

/// Threads that have a pool's lock, or want it, all the time.
class BusyPool {
 public:
  BusyPool() {
    for (int number = 0; number < 3; ++number) {
      _threads.emplace_back([this] {
        const auto queue = _pool->makeSerialQueue("busy");
        while (!_isOver) {
          for (int task = 0; task < 100; ++task) queue->async([] {});
          queue->sync([] {});
        }
      });
    }
  }
  ~BusyPool() {
    _isOver = true;
    for (auto& thread : _threads) thread.join();
  }
  /// Forks in a task, runs `inChild` there, and returns the child's status.
  int fork(const std::function<void()>& inChild) {
    int status = -1;
    Semaphore forked;
    _pool->makeSerialQueue("forking")->async([&] {
      const pid_t child = ::fork();
      if (child == 0) {
        // A task's thread has its signals blocked: a child that hangs is to end all the same.
        sigset_t alarm;
        sigemptyset(&alarm);
        sigaddset(&alarm, SIGALRM);
        pthread_sigmask(SIG_UNBLOCK, &alarm, nullptr);
        ::alarm(60);
        return inChild();
      }
      while (::waitpid(child, &status, 0) < 0 && errno == EINTR) {
      }
      forked.signal();
    });
    forked.wait();
    return status;
  }
  [[nodiscard]] ThreadPool& pool() { return *_pool; }

 private:
  const std::unique_ptr<ThreadPool> _pool = makeThreadPool(options(4));
  std::atomic<bool> _isOver{false};
  std::vector<std::thread> _threads;
};

constexpr int kForks = 100;
// A fork beside allocating threads may leave the child with the address sanitizer's own allocator locked for ever:
// gcc's gives its locks no handlers at fork, which the C library's allocator and the thread sanitizer have.
#ifdef __SANITIZE_ADDRESS__
constexpr bool kChildrenMayAllocate = false;
#else
constexpr bool kChildrenMayAllocate = true;
#endif

TEST(ThreadPool, AChildThatATaskForkedMayWaitAndHandOver) {
  if (!kChildrenMayAllocate) GTEST_SKIP() << "the sanitizer's allocator does not outlive forks";
  BusyPool busy;
  const auto queue = busy.pool().makeSerialQueue("queue");
  for (int number = 0; number < kForks; ++number) {
    const int status = busy.fork([&] {
      static_cast<void>(Semaphore().waitFor(1ms));
      bool ran = false;
      busy.pool().makeSerialQueue("new")->async([&ran] { ran = true; });
      queue->async([&ran] { ran = true; });
      queue->asyncAfter(1ms, [&ran] { ran = true; });
      const bool isInert = !ran && busy.pool().threadCount() == 0 && queue->sync([] { return true; });
      ::_exit(isInert ? 0 : 1);
    });
    ASSERT_TRUE(WIFEXITED(status)) << "fork " << number << ", signal " << WTERMSIG(status);
    ASSERT_EQ(WEXITSTATUS(status), 0);
  }
}

TEST(ThreadPool, AChildThatReturnsFromTheTaskThatForkedItEnds) {
  if (!kChildrenMayAllocate) GTEST_SKIP() << "the sanitizer's allocator does not outlive forks";
  constexpr int kEndedByItself = 7;
  BusyPool busy;
  for (int number = 0; number < kForks; ++number) {
    const int status = busy.fork([] { static_cast<void>(std::atexit([] { ::_exit(kEndedByItself); })); });
    ASSERT_TRUE(WIFEXITED(status)) << "fork " << number << ", signal " << WTERMSIG(status);
    ASSERT_EQ(WEXITSTATUS(status), kEndedByItself) << "with its only thread";
  }
}

TEST(ThreadPoolDeathTest, StopFromItsOwnTaskEndsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        const auto pool = makeThreadPool();
        pool->makeSerialQueue("queue")->async([&] { pool->stop(); });
        Semaphore().wait();
      },
      "cannot be stopped by its own task");
}

}  // namespace
}  // namespace velk
