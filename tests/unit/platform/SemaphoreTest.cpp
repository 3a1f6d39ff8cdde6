#include "platform/Semaphore.h"

#include <gtest/gtest.h>

#include <memory>
#include <thread>

namespace velk {
namespace {

using namespace std::chrono_literals;

TEST(Semaphore, CountsSignalsThatCameBeforeTheWait) {
  Semaphore semaphore(1);
  semaphore.signal();
  semaphore.wait();
  EXPECT_TRUE(semaphore.waitFor(0s));
  EXPECT_FALSE(semaphore.waitFor(0s));
}

TEST(Semaphore, WaitForAnAgeIsAWaitWithoutLimit) {
  Semaphore semaphore;
  std::thread signaller([&] { semaphore.signal(); });
  EXPECT_TRUE(semaphore.waitFor(Duration::max()));
  signaller.join();
}

TEST(Semaphore, GivesUpAfterItsTimeout) {
  Semaphore semaphore;
  EXPECT_FALSE(semaphore.waitFor(1ms));
}

TEST(Semaphore, MayEndAsSoonAsTheWaiterReturns) {
  for (int turn = 0; turn < 500; ++turn) {
    auto semaphore = std::make_unique<Semaphore>();
    std::thread signaller([raw = semaphore.get()] { raw->signal(); });
    semaphore->wait();
    semaphore.reset();
    signaller.join();
  }
}

}  // namespace
}  // namespace velk
