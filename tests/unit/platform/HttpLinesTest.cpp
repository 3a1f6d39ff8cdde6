// How requests stand in line for their servers.
#include <algorithm>
#include <atomic>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/CurlEngine.h"
#include "platform/linux/CurlSession.h"
#include "tests/support/RecordingLog.h"
#include "tests/unit/platform/HttpFixture.h"

namespace velk {
namespace {

using test::TlsTestServer;
using namespace std::chrono_literals;

/// Holds threads until it is opened.
class Gate {
 public:
  void pass() {
    Guard guard(_lock);
    while (!_isOpen) _changed.wait(_lock);
  }
  void open() {
    Guard guard(_lock);
    _isOpen = true;
    _changed.notifyAll();
  }

 private:
  Lock _lock;
  Condition _changed;
  bool _isOpen VELK_GUARDED_BY(_lock) = false;
};

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

  /// A session on an engine of its own.
  void makeSessionOnEngineWith(CurlEngine::Options options) {
    HttpTrust trusted;
    trusted.caFile = _server.caFile();
    _engine = std::make_shared<CurlEngine>(trusted, std::move(options));
    _session = std::make_shared<CurlSession>(_engine, HttpSessionConfiguration{}, _delegate, _queue);
  }
  void endEngine() { _engine->stop(); }

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
  std::shared_ptr<CurlEngine> _engine;
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

TEST_F(HttpLinesTest, TimeInLineDoesNotCount) {
  _server.setResponse({.delay = 300ms});
  auto post = request();
  post.timeout = 800ms;
  // Five rounds of eight: the last of them begins after the timeout of all.
  for (int number = 0; number < 40; ++number) start(post, std::to_string(number));
  ASSERT_TRUE(waitForCompletions(40));
  for (const auto& [name, outcome] : _delegate->outcomes) EXPECT_FALSE(outcome.error) << name;
}

TEST_F(HttpLinesTest, SendersOfOneServerTakeTurns) {
  Gate gate;
  _server.setHandler([&](const TlsTestServer::Request&) {
    gate.pass();
    return TlsTestServer::Response{};
  });
  const auto startAs = [&](std::uint64_t sender, const std::string& path) {
    auto post = request(path);
    post.sender = sender;
    start(std::move(post), path);
  };
  for (int number = 0; number < 60; ++number) startAs(1, "/backlog");
  ASSERT_TRUE(_server.waitForRequests(8));
  startAs(2, "/other");
  startAs(3, "/third");
  gate.open();
  ASSERT_TRUE(waitForCompletions(62));
  std::vector<std::string> targets;
  for (const auto& received : _server.requests()) targets.push_back(received.target);
  for (const auto* target : {"/other", "/third"}) {
    const auto place = std::find(targets.begin(), targets.end(), target) - targets.begin();
    EXPECT_LT(place, 24) << target << " came behind the backlog";
  }
}

TEST_F(HttpLinesTest, AnUrgentRequestStandsInNoLine) {
  _server.setHandler([](const TlsTestServer::Request& received) {
    return TlsTestServer::Response{.silent = received.target == "/slow"};
  });
  for (int number = 0; number < 20; ++number) start(request("/slow"), "slow");
  ASSERT_TRUE(_server.waitForRequests(8));
  auto urgent = request("/urgent");
  urgent.isUrgent = true;
  EXPECT_NE(fetch(urgent).response, nullptr);
  EXPECT_EQ(_delegate->completed, 1);
}

TEST_F(HttpLinesTest, BeyondItsBytesTheLineLosesItsOldest) {
  test::RecordingLog log;
  makeSessionOnEngineWith({.maximumStandingBytes = 100000});
  _server.setResponse({.silent = true});
  auto post = request();
  post.method = "POST";
  post.body = std::make_shared<const std::string>(30'000, 'x');
  for (int number = 0; number < 8; ++number) start(post, "running");
  ASSERT_TRUE(_server.waitForRequests(8));
  for (int number = 0; number < 5; ++number) start(post, std::to_string(number));
  ASSERT_TRUE(waitForCompletions(2));
  for (const auto* name : {"0", "1"}) {
    ASSERT_TRUE(_delegate->outcomes[name].error) << name;
    EXPECT_EQ(_delegate->outcomes[name].error->description, "127.0.0.1: dropped, because too much waits to be sent");
  }
  // One that is larger than all may be costs the others nothing.
  post.body = std::make_shared<const std::string>(100'001, 'x');
  start(post, "giant");
  ASSERT_TRUE(waitForCompletions(3));
  EXPECT_TRUE(_delegate->outcomes["giant"].error);
  // The end tells what the limit of one line a minute has held back.
  endEngine();
  ASSERT_TRUE(waitForCompletions(14));
  const auto lines = linesWith(log, "more than 100000 bytes wait to be sent; ");
  EXPECT_GE(lines, 1);
  EXPECT_LE(lines, 2);
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
