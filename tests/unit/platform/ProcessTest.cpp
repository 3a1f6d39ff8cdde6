#include "platform/Process.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>

#include <cstdlib>
#include <thread>

namespace velk {
namespace {

using process::RunLoop;

// Each in a process of its own: signals are blocked for good.
class RunLoopDeathTest : public ::testing::Test {
 protected:
  RunLoopDeathTest() { GTEST_FLAG_SET(death_test_style, "threadsafe"); }

  /// Exits with 0 when `signal` makes the loop tell `event`.
  [[noreturn]] static void receive(int signal, RunLoop::Event event) {
    const auto loop = RunLoop::make();
    if (!loop) std::_Exit(2);
    ::kill(::getpid(), signal);
    std::_Exit((*loop)->wait() == event ? 0 : 1);
  }
};

TEST_F(RunLoopDeathTest, TellsReloadFromStop) {
  EXPECT_EXIT(receive(SIGHUP, RunLoop::Event::reload), testing::ExitedWithCode(0), "");
  EXPECT_EXIT(receive(SIGTERM, RunLoop::Event::stop), testing::ExitedWithCode(0), "");
  EXPECT_EXIT(receive(SIGINT, RunLoop::Event::stop), testing::ExitedWithCode(0), "");
}

[[noreturn]] void wakeUpFromAnotherThread() {
  const auto loop = RunLoop::make();
  std::thread other([&] { (*loop)->wakeUp(); });
  const auto event = (*loop)->wait();
  other.join();
  std::_Exit(event == RunLoop::Event::wakeUp ? 0 : 1);
}

TEST_F(RunLoopDeathTest, IsWokenByOtherThreads) {
  EXPECT_EXIT(wakeUpFromAnotherThread(), testing::ExitedWithCode(0), "");
}

[[noreturn]] void interruptTwice() {
  const auto loop = RunLoop::make();
  ::kill(::getpid(), SIGINT);
  static_cast<void>((*loop)->wait());
  (*loop)->letInterruptEndTheProcess();
  ::kill(::getpid(), SIGINT);
  std::_Exit(0);
}

TEST_F(RunLoopDeathTest, ASecondInterruptEndsAProcessThatTakesItsTimeToEnd) {
  EXPECT_EXIT(interruptTwice(), testing::KilledBySignal(SIGINT), "");
}

[[noreturn]] void writeToClosedPipe() {
  const auto loop = RunLoop::make();
  int ends[2];
  if (::pipe(ends) != 0) std::_Exit(2);
  ::close(ends[0]);
  std::_Exit(::write(ends[1], "x", 1) < 0 ? 0 : 1);
}

TEST_F(RunLoopDeathTest, APeerThatHangsUpDoesNotEndTheProcess) {
  EXPECT_EXIT(writeToClosedPipe(), testing::ExitedWithCode(0), "");
}

TEST(Process, RestrictsNewFilesToItsUser) {
  const auto before = ::umask(022);
  process::restrictNewFiles();
  EXPECT_EQ(::umask(before), 077u);
}

}  // namespace
}  // namespace velk
