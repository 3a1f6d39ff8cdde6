// The helper on real queues, a real HTTP session and a real server.
#include <atomic>
#include <thread>

#include "platform/Semaphore.h"
#include "platform/ThreadPool.h"
#include "tests/support/TlsTestServer.h"
#include "tests/unit/connectivity/HelperFixture.h"

namespace velk {
namespace {

using namespace std::chrono_literals;
using test::TlsTestServer;

/// Says when the transactions have come back.
class WaitingOwner : public ConnectivityHelperDelegate {
 public:
  void releaseIPCTransactions(std::uint32_t count) override {
    total += count;
    returned.signal();
  }
  [[nodiscard]] Monitor& monitor() override { return _monitor; }
  std::atomic<std::uint32_t> total{0};
  Semaphore returned;

 private:
  Monitor _monitor;
};

class HelperOverTlsTest : public testing::Test {
 protected:
  HelperOverTlsTest() {
    HttpTrust trust;
    trust.caFile = server.caFile();
    service = makeHttpSessionService(std::move(trust));
  }

  [[nodiscard]] std::shared_ptr<ReportingSessionConnectivityHelper> makeActive(std::int32_t mode) {
    const auto fake = fakes.platform();
    const Platform platform{fake.clock,  *pool,          fake.defaults, fake.device,  fake.locale,       *service,
                            fake.random, fake.keepAlive, fake.consent,  fake.process, fake.logSubmission};
    auto helper = ReportingSessionConnectivityHelper::initWithDelegate(platform, owner, mode, {});
    helper->activate(30);
    return helper;
  }
  [[nodiscard]] HttpRequest post(const std::string& body) const {
    HttpRequest request;
    request.url = server.url("/events");
    request.method = "POST";
    request.body = std::make_shared<const std::string>(body);
    return request;
  }

  test::FakePlatform fakes;
  TlsTestServer server;
  std::unique_ptr<ThreadPool> pool = makeThreadPool();
  std::unique_ptr<HttpSessionService> service;
  std::shared_ptr<WaitingOwner> owner = std::make_shared<WaitingOwner>();
};

TEST_F(HelperOverTlsTest, PostsOfAClosingHelperAreNotCutOff) {
  constexpr int kThreads = 4;
  constexpr int kPosts = 25;
  std::atomic<int> succeeded{0};
  auto helper = makeActive(4);
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, helper] {
      for (int i = 0; i < kPosts; ++i) {
        helper->postURLRequestWithCompletionHandler(
            post(std::to_string(i)),
            [&](ByteData, std::shared_ptr<const HttpResponse> response, std::optional<Error> error) {
              if (!error && response && response->statusCode == 200) ++succeeded;
            });
        helper->incrementTotalSessionsServedCount();
        (void)helper->status();
      }
    });
  }
  for (auto& thread : threads) thread.join();
  helper->invalidate();
  helper.reset();
  ASSERT_TRUE(owner->returned.waitFor(60s));
  EXPECT_EQ(succeeded, kThreads * kPosts);
  EXPECT_EQ(owner->total, static_cast<std::uint32_t>(kThreads * kPosts));
  EXPECT_EQ(server.requests().size(), static_cast<std::size_t>(kThreads * kPosts));
}

TEST_F(HelperOverTlsTest, NobodyWaitsForAnIgnoredPull) {
  server.setResponse({.body = "bag"});
  const auto helper = makeActive(8);
  HttpRequest request;
  request.url = server.url("/bag");
  for (int i = 0; i < 2; ++i) {
    Semaphore answered;
    bool called = false;
    helper->getURLRequestWithCompletionHandler(
        request, true,
        HttpCompletion(
            [&](ByteData, std::shared_ptr<const HttpResponse>, std::optional<Error>) {
              called = true;
              answered.signal();
            },
            [&] { answered.signal(); }));
    ASSERT_TRUE(answered.waitFor(60s));
    EXPECT_EQ(called, i == 0);
  }
  helper->invalidate();
  ASSERT_TRUE(owner->returned.waitFor(60s));
}

TEST_F(HelperOverTlsTest, TheEndOfTheServiceEndsPostsAndReleasesTheHelper) {
  server.setResponse({.silent = true});
  auto helper = makeActive(4);
  Semaphore ended;
  std::optional<Error> failure;
  helper->postURLRequestWithCompletionHandler(
      post("x"), [&](ByteData, std::shared_ptr<const HttpResponse>, std::optional<Error> error) {
        failure = std::move(error);
        ended.signal();
      });
  ASSERT_TRUE(server.waitForRequests(1));
  helper->invalidate();
  service.reset();
  ASSERT_TRUE(ended.waitFor(60s));
  EXPECT_TRUE(failure);
  const std::weak_ptr<ReportingSessionConnectivityHelper> weak = std::exchange(helper, nullptr);
  pool->stop();
  EXPECT_TRUE(weak.expired());
}

}  // namespace
}  // namespace velk
