#include "connectivity/RequestWindow.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

#include "platform/Semaphore.h"
#include "tests/unit/connectivity/HelperFixture.h"

namespace velk {
namespace {

void fill(RequestWindow& window) {
  for (std::size_t request = 0; request < RequestWindow::kMaximumRequests; ++request) window.enter();
}

class Waiter {
 public:
  explicit Waiter(RequestWindow& window)
      : _thread([this, &window] {
          _begun.signal();
          window.waitForRoom();
          note("went on");
        }) {
    _begun.wait();
  }
  void note(std::string what) {
    Guard guard(_lock);
    _order.push_back(std::move(what));
  }
  [[nodiscard]] std::vector<std::string> orderAtEnd() {
    _thread.join();
    Guard guard(_lock);
    return _order;
  }

 private:
  Semaphore _begun;
  Lock _lock;
  std::vector<std::string> _order VELK_GUARDED_BY(_lock);
  std::thread _thread;
};

TEST(RequestWindow, SendersWaitUntilARequestHasEnded) {
  RequestWindow window;
  fill(window);
  Waiter waiter(window);
  waiter.note("a request ended");
  window.leave();
  EXPECT_EQ(waiter.orderAtEnd(), (std::vector<std::string>{"a request ended", "went on"}));
}

TEST(RequestWindow, NobodyWaitsWhileThereIsRoomOrForAClosedOne) {
  RequestWindow window;
  window.waitForRoom();
  fill(window);
  Waiter waiter(window);
  window.close();
  EXPECT_EQ(waiter.orderAtEnd().size(), 1U);
  window.waitForRoom();
}

class HelperWindow : public ConnectivityHelperTest {
 protected:
  void post(const std::shared_ptr<Helper>& helper, int times) {
    for (int turn = 0; turn < times; ++turn) {
      helper->postURLRequestWithCompletionHandler(request(), [](auto&&...) {});
    }
    scheduler().runUntilIdle();
  }
};

TEST_F(HelperWindow, DroppedRequestsTakeNoRoom) {
  const auto helper = make(4);
  post(helper, 200);
  helper->waitForRoom(0);  // would never return
}

TEST_F(HelperWindow, AnsweredAndFailedRequestsLeaveIt) {
  const auto helper = makeActive(4);
  post(helper, static_cast<int>(RequestWindow::kMaximumRequests));
  http.startedTasks().front()->complete();
  scheduler().runUntilIdle();
  helper->waitForRoom(0);
  for (const auto& task : http.startedTasks()) {
    if (task != http.startedTasks().front()) task->complete();
  }
  scheduler().runUntilIdle();
}

}  // namespace
}  // namespace velk
