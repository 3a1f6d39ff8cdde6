#include "connectivity/RequestWindow.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

#include "platform/Semaphore.h"
#include "tests/unit/connectivity/HelperFixture.h"

namespace velk {
namespace {

constexpr std::uint64_t kSender = 7;
constexpr std::uint64_t kOther = 8;

void fill(RequestWindow& window) {
  for (std::size_t request = 0; request < RequestWindow::kMaximumRequests; ++request) window.enter(kSender);
}

/// A sender on a thread of its own.
class Waiter {
 public:
  explicit Waiter(RequestWindow& window)
      : _thread([this, &window] {
          _begun.signal();
          window.waitForRoom(kSender);
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

TEST(RequestWindow, ASenderWaitsUntilARequestOfItsOwnHasEnded) {
  RequestWindow window;
  window.enter(kOther);
  fill(window);
  Waiter waiter(window);
  window.leave(kOther);
  waiter.note("a request ended");
  window.leave(kSender);
  EXPECT_EQ(waiter.orderAtEnd(), (std::vector<std::string>{"a request ended", "went on"}));
}

TEST(RequestWindow, AFullShareHoldsNoOtherSenderUp) {
  RequestWindow window;
  fill(window);
  window.waitForRoom(kOther);  // would never return
}

TEST(RequestWindow, NobodyWaitsWhileThereIsRoomOrForAClosedOne) {
  RequestWindow window;
  window.waitForRoom(kSender);
  fill(window);
  Waiter waiter(window);
  window.close();
  EXPECT_EQ(waiter.orderAtEnd().size(), 1U);
  window.waitForRoom(kSender);
}

TEST(RequestWindow, ASenderWhoseClientHasGoneWaitsNoMore) {
  RequestWindow window;
  fill(window);
  Waiter waiter(window);
  window.stopWaiting(kSender);
  EXPECT_EQ(waiter.orderAtEnd().size(), 1U);
  window.waitForRoom(kSender);
}

TEST(RequestWindow, SendersWithoutRequestsAreForgotten) {
  RequestWindow window;
  for (std::uint64_t sender = 1; sender < 10'000; ++sender) {
    window.enter(sender);
    window.leave(sender);
    window.stopWaiting(sender);
  }
  EXPECT_EQ(window.senderCount(), 0U);
}

TEST(RequestWindow, ARequestGivesItsPlaceUpOnce) {
  const auto window = std::make_shared<RequestWindow>();
  window->enter(kSender);
  {
    PlaceInWindow place(window, kSender);
    place.leave();
  }
  EXPECT_EQ(window->senderCount(), 1U) << "the other request is under way still";
}

class HelperWindow : public ConnectivityHelperTest {
 protected:
  void post(const std::shared_ptr<Helper>& helper, std::size_t times) {
    for (std::size_t turn = 0; turn < times; ++turn) {
      auto post = request();
      post.sender = kSender;
      helper->postURLRequestWithCompletionHandler(std::move(post), [](auto&&...) {});
    }
    scheduler().runUntilIdle();
  }
  void endAll() {
    for (const auto& task : http.startedTasks()) task->complete();
    scheduler().runUntilIdle();
  }
};

TEST_F(HelperWindow, DroppedRequestsTakeNoRoom) {
  const auto helper = make(4);
  post(helper, 200);
  helper->waitForRoom(kSender);  // would never return
}

TEST_F(HelperWindow, AnsweredAndFailedRequestsLeaveIt) {
  const auto helper = makeActive(4);
  post(helper, RequestWindow::kMaximumRequests);
  http.startedTasks().front()->complete();
  scheduler().runUntilIdle();
  helper->waitForRoom(kSender);
  endAll();
}

TEST_F(HelperWindow, RequestsThatWaitForARouteLeaveIt) {
  const auto helper = makeActive(4);
  post(helper, RequestWindow::kMaximumRequests);
  http.startedTasks().front()->waitForConnectivity();
  scheduler().runUntilIdle();
  helper->waitForRoom(kSender);
  endAll();
}

TEST_F(HelperWindow, StrangersAndClientsThatHaveGoneAreNotHeldUp) {
  const auto helper = makeActive(4);
  post(helper, RequestWindow::kMaximumRequests);
  helper->waitForRoom(kOther);
  helper->stopWaiting(kSender);
  helper->waitForRoom(kSender);
  endAll();
}

}  // namespace
}  // namespace velk
