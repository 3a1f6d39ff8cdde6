// Threads that register, unregister, start, stop and release while ticks run: for the sanitizers above all.
#include <array>
#include <atomic>
#include <thread>

#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

constexpr std::uint32_t kThreads = 4;
constexpr int kTicks = 30;

/// What one registration's callback owns.
struct Registration {
  explicit Registration(Semaphore& whenEnded) : ended(whenEnded) {}
  ~Registration() { ended.signal(); }
  Semaphore& ended;
  std::atomic<bool> isGone{false};
};

class PeriodicRaceTest : public VelkReportingTest {
 protected:
  /// Registers and unregisters modules of this thread's own, over and over.
  void change(const std::shared_ptr<VelkReporting>& client, std::uint32_t thread) {
    for (int round = 0; !_isOver; ++round) {
      const std::uint32_t module = thread * 10 + static_cast<std::uint32_t>(round) % 3;
      const auto registration = std::make_shared<Registration>(_ended);
      ++_made;
      client->registerPeriodicTaskForModule(
          module, round % 2 == 0, true,
          [this, registration, module, weak = std::weak_ptr(client)](PropertyDictionary* statistics) {
            EXPECT_FALSE(registration->isGone) << "it was unregistered";
            ++_calls;
            if (statistics != nullptr) statistics->set("list", PropertyArray{module});
            if (_calls % 7 == 0) throw 7;
            const auto strong = weak.lock();
            if (strong && _calls % 5 == 0) strong->unregisterPeriodTaskForModule((module + 10) % 40);
          });
      if (round % 5 == 0) client->registerPeriodicTaskForModule(module, true, true, [registration](auto&&) {});
      if (round % 4 == 0) client->sendMessageWithCategory(1, 1);
      for (int turn = 0; turn < round % 64; ++turn) std::this_thread::yield();
      EXPECT_TRUE(client->unregisterPeriodTaskForModule(module));
      registration->isGone = true;
    }
  }

  Semaphore _ended;
  std::atomic<int> _made{0};
  std::atomic<int> _calls{0};
  std::atomic<bool> _isOver{false};
};

TEST_F(PeriodicRaceTest, ChangesWhileTicksRun) {
  _daemon.start();
  auto client = makeClient();
  std::vector<std::thread> threads;
  for (std::uint32_t thread = 0; thread < kThreads; ++thread)
    threads.emplace_back([&, thread] { change(client, thread); });
  Semaphore ticked;
  client->registerPeriodicTaskForModule(99, true, true, [&ticked](auto&&) { ticked.signal(); });
  for (int tick = 0; tick < kTicks; ++tick) {  // each start ticks at once
    client->startLogTimerWithInterval(1, tick % 3, 3, 4);
    ASSERT_TRUE(ticked.waitFor(kPatience));
    client->stopLogTimer();
  }
  _isOver = true;
  for (auto& thread : threads) thread.join();
  EXPECT_GT(_calls.load(), 0);
  EXPECT_FALSE(flush(*client));
  client.reset();
  for (int made = _made; made != 0; --made) ASSERT_TRUE(_ended.waitFor(kPatience));
  ASSERT_TRUE(_daemon.waitForEnds(1));
  EXPECT_EQ(_daemon.count("finishSessionGracefully"), 1U);
}

TEST_F(PeriodicRaceTest, LastReleasesOnAllSides) {
  _daemon.start();
  constexpr std::size_t kClients = 40;
  for (std::size_t number = 0; number < kClients; ++number) {
    // References in callbacks and here: whoever is the last ends the session, wherever that happens.
    const auto holder = std::make_shared<std::array<std::shared_ptr<VelkReporting>, 4>>();
    holder->fill(makeClient());
    auto client = holder->front();
    for (std::uint32_t module = 0; module < 3; ++module) {
      client->registerPeriodicTaskForModule(module, true, true,
                                            [holder, module](PropertyDictionary*) { (*holder)[module + 1].reset(); });
    }
    client->startLogTimerWithInterval(1, 2, 3, 4);
    if (number % 2 == 0) static_cast<void>(client->unregisterPeriodTaskForModule(9));  // after the first tick
    (*holder)[0].reset();
    client.reset();
  }
  ASSERT_TRUE(_daemon.waitForCalls("finishSessionGracefully", kClients));
  ASSERT_TRUE(_daemon.waitForEnds(kClients));
  EXPECT_EQ(_daemon.count("finishSessionGracefully"), kClients);
}

}  // namespace
}  // namespace velk::test
