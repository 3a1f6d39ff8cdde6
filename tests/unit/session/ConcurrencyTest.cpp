// What other threads may do to a session while its own queue works. Meant for the thread sanitizer.
#include <atomic>
#include <thread>

#include "tests/unit/session/SessionFixture.h"

namespace velk::test {
namespace {

class ConcurrencyTest : public SessionTest {};

TEST_F(ConcurrencyTest, OthersReadWhileOneShotsReplaceTheBackends) {
  serveBackends({"splunk", "korrin"});
  delegate.parentID = "A";
  std::atomic<bool> stop{false};
  std::vector<std::thread> readers;
  for (int number = 0; number < 3; ++number) {
    readers.emplace_back([&] {
      while (!stop) {
        (void)session->statusDictionary();
        (void)session->batchedEventsSize();
        (void)session->description();
        (void)session->hasValidUserInfoKeys();
        session->updateCombinedSessionID();
        session->syncReportingStates();
      }
    });
  }
  for (int count = 0; count < 100; ++count) {
    sendOnce(PropertyDictionary{{kVelkReportingSessionInfoClientType, 8},
                                {kVelkReportingSessionInfoSessionID, count},
                                {kVelkReportingSessionInfoHierarchyToken,
                                 PropertyDictionary{{kVelkReportingHierarchyTokenTokenID, "T"},
                                                    {kVelkReportingHierarchyTokenLevel, 1}}}},
             userNamed(count % 2 == 0 ? "a" : "c", "b"), PropertyDictionary{{"p", count}});
  }
  session->teardown();
  stop = true;
  for (auto& reader : readers) reader.join();
  EXPECT_EQ(made.size(), 200U);
  EXPECT_EQ(session->backends(), nullptr);
}

TEST_F(ConcurrencyTest, OnlyMessagesOfItsClientWaitForRoom) {
  start({"splunk"}, {}, userNamed("a", "b"));
  fakes.scheduler.runUntilIdle();
  const auto helper = delegate.helper("a:b");
  auto& sender = backend("splunk").sender();
  EXPECT_NE(sender.number, 0U);
  for (std::size_t count = 0; count < RequestWindow::kMaximumRequests; ++count) {
    HttpRequest request;
    request.sender = sender.number;
    helper->postURLRequestWithCompletionHandler(std::move(request), {});
  }
  sender.hasPosted = true;
  // None of these would return if it waited: nothing is ever answered.
  describe({}, userNamed("a", "b"));
  configure();
  fetchStates(userNamed("a", "b"));
  session->flushMessagesWithCompletion({});
  session->finishSessionGracefully();
  session->teardown();
  EXPECT_EQ(backend("splunk").sent.size(), 1U) << "the health message";
  helper->invalidate();
}

TEST_F(ConcurrencyTest, ClientThatHasGoneWaitsForNoRoom) {
  start({"splunk"}, {}, userNamed("a", "b"));
  fakes.scheduler.runUntilIdle();
  const auto helper = delegate.helper("a:b");
  auto& sender = backend("splunk").sender();
  for (std::size_t count = 0; count < RequestWindow::kMaximumRequests; ++count) {
    HttpRequest request;
    request.sender = sender.number;
    helper->postURLRequestWithCompletionHandler(std::move(request), {});
  }
  sender.hasPosted = true;
  std::thread connectionsQueue([this] { send(message(1, 2)); });
  session->clientHasGone();
  connectionsQueue.join();
  sender.hasPosted = true;
  send(message(1, 2));
  EXPECT_EQ(backend("splunk").sent.size(), 2U);
}

TEST_F(ConcurrencyTest, SessionMayBeEndedFromAnyThread) {
  start({"splunk"}, {}, std::nullopt, true);
  std::thread agent([this] { session->invalidate(); });
  for (int count = 0; count < 100; ++count) send(message(1, 2, PropertyDictionary{{"p", count}}));
  agent.join();
  session->teardown();
  EXPECT_EQ(connection->invalidations, 1);
  EXPECT_EQ(backend("splunk").sent.size(), 101U);
}

}  // namespace
}  // namespace velk::test
