// A client whose reporting queue is held up, with a daemon there: what is queued meanwhile has its turn at once,
// without a byte leaving in between.
#pragma once

#include <memory>

#include "tests/unit/client/ClientFixture.h"

namespace velk::test {

class HeldQueueTest : public VelkReportingTest {
 protected:
  void SetUp() override {
    _daemon.start();
    _client = makeClient();
    ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
    // A tick holds the queue until its callbacks have returned; updates send nothing of their own.
    const auto entered = std::make_shared<Semaphore>();
    _client->registerPeriodicTaskForModule(1, true, false, [entered, leave = _leave](auto*) {
      entered->signal();
      leave->wait();
    });
    _client->startLogTimerWithInterval(3600, 0, 3, 4);
    ASSERT_TRUE(entered->waitFor(kPatience));
  }
  void TearDown() override { letGo(); }
  void letGo() { _leave->signal(); }

  std::shared_ptr<VelkReporting> _client;

 private:
  const std::shared_ptr<Semaphore> _leave = std::make_shared<Semaphore>();
};

}  // namespace velk::test
