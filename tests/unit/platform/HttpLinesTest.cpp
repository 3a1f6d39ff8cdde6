// How requests stand in line for their servers.
#include <atomic>
#include <memory>
#include <thread>
#include <vector>

#include "tests/unit/platform/HttpFixture.h"

namespace velk {
namespace {

using test::TlsTestServer;
using namespace std::chrono_literals;

class HttpLinesTest : public HttpSessionTest {
 protected:
  /// At nine servers that never answer, so many requests each; returns when each server has one.
  void startAtSlowServers(int requestsEach, bool areBulk) {
    constexpr int kSlowServers = 9;
    for (int server = 0; server < kSlowServers; ++server) {
      _slow.push_back(std::make_unique<TlsTestServer>(false));
      _slow.back()->setResponse({.silent = true});
      for (int number = 0; number < requestsEach; ++number) {
        auto slow = request();
        slow.url = _slow.back()->url();
        slow.requiresHttps = false;
        slow.isBulk = areBulk;
        start(std::move(slow), "slow");
      }
    }
    for (const auto& server : _slow) ASSERT_TRUE(server->waitForRequests(1));
  }

  /// Twenty such requests, of which a server is asked eight at once; `bulk` is one like them.
  void startBulkThatIsNeverAnswered(HttpRequest& bulk) {
    _server.setHandler([](const TlsTestServer::Request& request) {
      return TlsTestServer::Response{.silent = request.target == "/bulk"};
    });
    bulk = request("/bulk");
    bulk.isBulk = true;
    for (int number = 0; number < 20; ++number) start(bulk, std::to_string(number));
    ASSERT_TRUE(_server.waitForRequests(8));
  }

 private:
  std::vector<std::unique_ptr<TlsTestServer>> _slow;
};

TEST_F(HttpLinesTest, AServerGetsEightRequestsAtOnceAndTheRestInOrder) {
  std::atomic<int> underWay{0};
  std::atomic<int> most{0};
  _server.setHandler([&](const TlsTestServer::Request&) {
    const int now = ++underWay;
    int seen = most;
    while (now > seen && !most.compare_exchange_weak(seen, now)) {
    }
    // The first eight answer only when all of them are there.
    for (; most < 8; std::this_thread::yield()) {
    }
    --underWay;
    return TlsTestServer::Response{};
  });
  for (int number = 0; number < 100; ++number) start(request(), std::to_string(number));
  ASSERT_TRUE(waitForCompletions(100));
  for (const auto& [name, outcome] : _delegate->outcomes) EXPECT_FALSE(outcome.error) << name;
  EXPECT_EQ(most, 8);
  EXPECT_LE(_server.connectionCount(), 8);
}

TEST_F(HttpLinesTest, SlowServersHoldNoOthersUpHoweverManyTheyAre) {
  // More requests than are made at once.
  ASSERT_NO_FATAL_FAILURE(startAtSlowServers(16, false));
  EXPECT_FALSE(fetch(request()).error);
  EXPECT_EQ(_delegate->completed, 1);
}

TEST_F(HttpLinesTest, BulkLeavesRoomForEverythingElse) {
  ASSERT_NO_FATAL_FAILURE(startAtSlowServers(8, true));
  // Eight at once, as if nobody else were there.
  std::atomic<int> underWay{0};
  _server.setHandler([&](const TlsTestServer::Request&) {
    const auto deadline = std::chrono::steady_clock::now() + 60s;
    for (++underWay; underWay < 8 && std::chrono::steady_clock::now() < deadline; std::this_thread::yield()) {
    }
    return TlsTestServer::Response{};
  });
  for (int number = 0; number < 8; ++number) start(request(), "small");
  ASSERT_TRUE(waitForCompletions(8));
  EXPECT_FALSE(_delegate->outcomes["small"].error);
}

TEST_F(HttpLinesTest, ATaskInLineEndsAtItsTimeout) {
  _server.setResponse({.silent = true});
  for (int number = 0; number < 8; ++number) start(request(), std::to_string(number));
  ASSERT_TRUE(_server.waitForRequests(8));
  auto late = request();
  late.timeout = 100ms;
  start(std::move(late), "late");
  ASSERT_TRUE(waitForCompletions(1));
  const auto& outcome = _delegate->outcomes["late"];
  ASSERT_TRUE(outcome.error);
  EXPECT_EQ(outcome.error->code, 28);
  EXPECT_EQ(outcome.error->description, "127.0.0.1: too many requests before it within the request's time");
  EXPECT_EQ(_server.requests().size(), 8U);
}

TEST_F(HttpLinesTest, BulkStandsInALineOfItsOwn) {
  HttpRequest bulk;
  ASSERT_NO_FATAL_FAILURE(startBulkThatIsNeverAnswered(bulk));
  EXPECT_FALSE(fetch(request("/small")).error);
  EXPECT_EQ(_delegate->completed, 1);
  EXPECT_EQ(_server.requests().size(), 9U) << "no more of the bulk either";
}

TEST_F(HttpLinesTest, TheEndOfBulkEndsItWhereverItIsAndNothingElse) {
  HttpRequest bulk;
  ASSERT_NO_FATAL_FAILURE(startBulkThatIsNeverAnswered(bulk));
  _service->endBulk();
  ASSERT_TRUE(waitForCompletions(20));
  start(bulk, "later");
  ASSERT_TRUE(waitForCompletions(21));
  for (const auto& [name, outcome] : _delegate->outcomes) {
    ASSERT_TRUE(outcome.error) << name;
    EXPECT_EQ(outcome.error->code, 42) << name;
  }
  _delegate->outcomes.clear();
  EXPECT_FALSE(fetch(request("/small")).error);
  EXPECT_EQ(_server.requests().size(), 9U) << "nothing moved up in the line of those that have ended";
}

TEST_F(HttpLinesTest, TheEndOfBulkMayComeBeforeTheFirstRequest) {
  _service->endBulk();
  auto bulk = request();
  bulk.isBulk = true;
  EXPECT_TRUE(fetch(bulk).error);
  _delegate->outcomes.clear();
  EXPECT_FALSE(fetch(request()).error);
}

TEST_F(HttpLinesTest, TheEndOfTheServiceEndsTasksInLine) {
  _server.setResponse({.silent = true});
  for (int number = 0; number < 20; ++number) start(request(), std::to_string(number));
  ASSERT_TRUE(_server.waitForRequests(8));
  _session.reset();
  _service.reset();
  ASSERT_TRUE(waitForCompletions(20));
  for (const auto& [name, outcome] : _delegate->outcomes) EXPECT_TRUE(outcome.error) << name;
}

}  // namespace
}  // namespace velk
