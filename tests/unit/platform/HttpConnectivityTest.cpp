// Requests on a machine without a network: each test runs on a thread with a network namespace of its own, which the
// HTTP thread inherits.
#include <atomic>

#include "platform/Semaphore.h"
#include "platform/linux/CurlEngine.h"
#include "platform/linux/CurlSession.h"
#include "platform/linux/RouteMonitor.h"
#include "tests/support/NetworkNamespace.h"
#include "tests/support/RecordingLog.h"
#include "tests/support/TlsTestServer.h"
#include "tests/unit/platform/HttpRecorder.h"

namespace velk {
namespace {

using test::connectNetwork;
using test::disconnectNetwork;
using test::startLoopback;
using test::TlsTestServer;
using namespace std::chrono_literals;

#define VELK_WITHOUT_NETWORK(...)                     \
  if (!test::runInEmptyNetworkNamespace(__VA_ARGS__)) \
  GTEST_SKIP() << "no network namespaces here: they are made by root"

struct Network {
  explicit Network(bool waits = true, CurlEngine::Options options = {})
      : engine(std::make_shared<CurlEngine>(HttpTrust{}, std::move(options))) {
    HttpSessionConfiguration configuration;
    configuration.waitsForConnectivity = waits;
    session = std::make_shared<CurlSession>(engine, configuration, delegate, queue);
  }
  ~Network() {
    engine->stop();
    // What the queue still holds holds the queue: its tasks know their session.
    queue->runPending();
  }

  [[nodiscard]] static HttpRequest request(Duration timeout = 20s) {
    HttpRequest request;
    request.url = "http://192.0.2.1:9/";
    request.requiresHttps = false;
    request.timeout = timeout;
    return request;
  }
  void start(HttpRequest request, const std::string& name = "task") {
    auto task = session->makeDataTask(std::move(request));
    ASSERT_TRUE(task) << task.error().description;
    (*task)->setTaskDescription(name);
    (*task)->resume();
  }
  [[nodiscard]] bool completed(int count, Duration limit = 20s) {
    return queue->runUntil([&] { return delegate->completed >= count; }, limit);
  }
  [[nodiscard]] bool waiting(int count) {
    return queue->runUntil([&] { return delegate->waiting >= count; });
  }
  [[nodiscard]] std::optional<Error> error(const std::string& name = "task") { return delegate->outcomes[name].error; }

  std::shared_ptr<PumpedQueue> queue = std::make_shared<PumpedQueue>();
  std::shared_ptr<Recorder> delegate = std::make_shared<Recorder>();
  std::shared_ptr<CurlEngine> engine;
  std::shared_ptr<HttpSession> session;
};

TEST(HttpConnectivityTest, FailsAtOnceUnlessItMayWait) {
  VELK_WITHOUT_NETWORK([] {
    Network network(false);
    network.start(Network::request());
    ASSERT_TRUE(network.completed(1));
    EXPECT_EQ(network.error()->code, 7);
    EXPECT_EQ(network.delegate->waiting, 0);
  });
}

TEST(HttpConnectivityTest, AnUrgentRequestWaitsWithinItsTimeoutOnly) {
  VELK_WITHOUT_NETWORK([] {
    EXPECT_FALSE(defaultRoutes().any());
    Network network;
    auto urgent = Network::request(200ms);
    urgent.isUrgent = true;
    network.start(urgent);
    ASSERT_TRUE(network.completed(1));
    EXPECT_EQ(network.error()->code, 28);
    EXPECT_NE(network.error()->description.find("no network"), std::string::npos);
  });
}

TEST(HttpConnectivityTest, WaitsForARouteAsLongAsItTakesAndSaysSoOnce) {
  VELK_WITHOUT_NETWORK([] {
    Network network;
    network.start(Network::request(100ms));
    ASSERT_TRUE(network.waiting(1));
    EXPECT_FALSE(network.completed(1, 300ms)) << "the time of a request begins with the route";
    startLoopback();  // a change that does not help
    EXPECT_FALSE(network.completed(1, 100ms));
    connectNetwork();
    ASSERT_TRUE(network.completed(1));
    // The address is there now, and nobody listens at it.
    EXPECT_EQ(network.error()->code, 7);
    EXPECT_EQ(network.delegate->events, (std::vector<std::string>{"task waits", "task completed"}));
  });
}

TEST(HttpConnectivityTest, WhatStoodInLineWaitsAsWellAndArrivesWithTheRoute) {
  VELK_WITHOUT_NETWORK([] {
    TlsTestServer server(false, true, TlsTestServer::kOtherAddress);
    server.setResponse({.delay = 200ms});
    Network network;
    auto post = Network::request(1s);
    post.url = server.url();
    for (int number = 0; number < 50; ++number) network.start(post, std::to_string(number));
    ASSERT_TRUE(network.waiting(50));
    connectNetwork();
    ASSERT_TRUE(network.completed(50));
    for (const auto& [name, outcome] : network.delegate->outcomes) EXPECT_FALSE(outcome.error) << name;
    EXPECT_EQ(server.requests().size(), 50U);
    EXPECT_EQ(network.delegate->waiting, 50);
  });
}

// The connection from before would swallow the request: it is established, and nothing that is sent over it arrives.
TEST(HttpConnectivityTest, ALostRouteIsNoticedInSpiteOfAnOpenConnection) {
  VELK_WITHOUT_NETWORK([] {
    connectNetwork();
    TlsTestServer server(false, true, TlsTestServer::kOtherAddress);
    Network network;
    auto post = Network::request(10s);
    post.url = server.url();
    network.start(post);
    ASSERT_TRUE(network.completed(1));
    disconnectNetwork();
    network.start(post);
    ASSERT_TRUE(network.waiting(1));
    connectNetwork();
    ASSERT_TRUE(network.completed(2));
    EXPECT_FALSE(network.error());
  });
}

TEST(HttpConnectivityTest, TheEndOfTheServiceEndsWhatWaits) {
  VELK_WITHOUT_NETWORK([] {
    Network network;
    network.start(Network::request());
    ASSERT_TRUE(network.waiting(1));
    network.engine->stop();
    ASSERT_TRUE(network.completed(1));
    EXPECT_NE(network.error()->description.find("has ended"), std::string::npos);
  });
}

TEST(HttpConnectivityTest, BeyondTheBoundTheOldestThatWaitsIsDroppedAndCounted) {
  VELK_WITHOUT_NETWORK([] {
    test::RecordingLog log;
    Network network(true, {.maximumStandingBytes = 10'000});
    auto post = Network::request();
    post.method = "POST";
    post.body = std::make_shared<const std::string>(3'000, 'x');
    for (const auto* name : {"0", "1", "2", "3", "4"}) {
      network.start(post, name);
      ASSERT_TRUE(network.waiting(name[0] - '0' + 1));
    }
    ASSERT_TRUE(network.completed(2));
    EXPECT_TRUE(network.error("0"));
    EXPECT_TRUE(network.error("1"));
    connectNetwork();
    ASSERT_TRUE(network.completed(5));
    EXPECT_EQ(network.error("4")->code, 7) << "it went on its way";
    network.engine->stop();
    EXPECT_EQ(linesWith(log, "; 1 of the oldest requests were dropped"), 2)
        << "the first at once, the second at the end";
  });
}

/// Routes as the test says: a change is heard when the namespace changes.
struct ToldRoutes {
  [[nodiscard]] RouteLookup::Look look() {
    return [this] {
      DefaultRoutes routes;
      routes.ipv4 = "wwan0";
      routes.isMobile4 = isMobile;
      return routes;
    };
  }
  std::atomic<bool> isMobile{true};
};

[[nodiscard]] HttpRequest requestWithoutMobile() {
  auto request = Network::request();
  request.allowsCellularAccess = false;
  return request;
}

TEST(HttpConnectivityTest, ARequestThatMayNotUseAMobileNetworkWaitsForAnother) {
  VELK_WITHOUT_NETWORK([] {
    ToldRoutes routes;
    Network network(true, {.look = routes.look()});
    network.start(requestWithoutMobile());
    ASSERT_TRUE(network.waiting(1));
    startLoopback();  // a change, but the network is a mobile one still
    EXPECT_FALSE(network.completed(1, 100ms));
    routes.isMobile = false;
    connectNetwork();
    ASSERT_TRUE(network.completed(1));
    EXPECT_EQ(network.error()->code, 7);
    EXPECT_EQ(network.error()->description.find("mobile"), std::string::npos) << network.error()->description;
  });
}

TEST(HttpConnectivityTest, ARequestThatMayNotUseAMobileNetworkFailsAtOnceUnlessItMayWait) {
  VELK_WITHOUT_NETWORK([] {
    ToldRoutes routes;
    Network network(false, {.look = routes.look()});
    network.start(requestWithoutMobile());
    ASSERT_TRUE(network.completed(1));
    EXPECT_NE(network.error()->description.find("mobile network, which may not be used"), std::string::npos);
  });
}

TEST(HttpConnectivityTest, LookingRoutesUpHoldsNoOtherRequestUp) {
  Semaphore answered;
  TlsTestServer server(false);
  {
    Network network(true, {.look = [&] {
                      answered.wait();
                      return DefaultRoutes{};
                    }});
    network.start(requestWithoutMobile(), "asks");
    auto other = Network::request();
    other.url = server.url();
    network.start(other, "other");
    ASSERT_TRUE(network.completed(1));
    EXPECT_FALSE(network.error("other"));
    answered.signal();
  }
}

}  // namespace
}  // namespace velk
