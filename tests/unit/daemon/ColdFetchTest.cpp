#include <atomic>

#include "platform/Semaphore.h"
#include "tests/unit/daemon/AgentFixture.h"

namespace velk {
namespace {

using test::FakeReportingdSession;

class ColdFetchTest : public test::AgentFixture {
 protected:
  ColdFetchTest() { setEnvironment(kEnvironmentRelease); }

  std::shared_ptr<Queue> queue(const char* label) { return pool->makeSerialQueue(label); }
};

// One session holds the agent's lock while the network is slow; everybody else wants that lock, the threads that the
// answer needs included.
TEST_F(ColdFetchTest, DoesNotStarveTheQueuesThatItsAnswerNeeds) {
  constexpr int kSessions = 40;
  constexpr std::size_t kNames = 21;
  Semaphore answered;
  Semaphore released;
  std::atomic<int> served{0};
  std::vector<std::shared_ptr<Queue>> queues;
  for (int number = 0; number < kSessions; ++number) {
    queues.push_back(queue("session"));
    queues.back()->async([&, type = 5 + number % 26] {
      if (agent->storebagForSession(*FakeReportingdSession::ofType(type))) ++served;
      answered.signal();
    });
  }
  static_cast<void>(http.waitForTask(0));
  // What transports do on their own queues when they let go.
  for (int number = 0; number < kSessions; ++number) {
    queues.push_back(queue("transport"));
    queues.back()->async([&] {
      agent->releaseIPCTransactions(1);
      released.signal();
    });
  }
  const auto envelope = test::textOf(key.envelope(bagWithSections()));
  for (std::size_t name = 0; name < kNames; ++name) http.waitForTask(name)->respond(200, envelope);
  for (int number = 0; number < kSessions; ++number) {
    answered.wait();
    released.wait();
  }
  EXPECT_EQ(served, kSessions);
  EXPECT_EQ(requestCount(), kNames);
}

// Nothing answers any more, and the agent's lock must be free for the end of the sessions.
TEST_F(ColdFetchTest, StoppingEndsTheWaitAndAsksNobodyFromThenOn) {
  Semaphore answered;
  const auto session = FakeReportingdSession::ofType(test::kBramble);
  const auto other = FakeReportingdSession::ofType(test::kConference);
  const auto sessionQueue = queue("session");
  sessionQueue->async([&] {
    EXPECT_EQ(agent->storebagForSession(*session), std::nullopt);
    EXPECT_EQ(agent->storebagForSession(*other), std::nullopt);
    answered.signal();
  });
  const auto task = http.waitForTask(0);
  service->stop();
  const bool ended = answered.waitFor(std::chrono::seconds(20));
  EXPECT_TRUE(ended);
  // An answer that comes after all disturbs nobody.
  task->respond(200, test::textOf(key.envelope(bagWithSections())));
  if (!ended) answered.wait();
  EXPECT_EQ(requestCount(), 1U);
}

TEST_F(ColdFetchTest, AsksOnceForANameThatSeveralSessionsWaitFor) {
  Semaphore answered;
  std::vector<std::shared_ptr<Queue>> queues;
  for (int number = 0; number < 5; ++number) {
    queues.push_back(queue("session"));
    queues.back()->async([&] {
      EXPECT_TRUE(agent->storebagForSession(*FakeReportingdSession::ofType(test::kBramble)).has_value());
      answered.signal();
    });
  }
  http.waitForTask(0)->respond(200, test::textOf(key.envelope(bagWithSections())));
  for (int number = 0; number < 5; ++number) answered.wait();
  EXPECT_EQ(requestCount(), 1U);
}

TEST_F(ColdFetchTest, AFreshStartDuringAFetchLetsItEndAndFetchesAgainNextTime) {
  Semaphore answered;
  const auto session = FakeReportingdSession::ofType(test::kBramble);
  const auto sessionQueue = queue("session");
  sessionQueue->async([&] {
    static_cast<void>(agent->storebagForSession(*session));
    answered.signal();
  });
  const auto task = http.waitForTask(0);
  const auto reload = queue("reload");
  reload->async([&] { agent->refreshStorebags(); });
  task->respond(200, test::textOf(key.envelope(bagWithSections("1"))));
  answered.wait();
  reload->sync([] {});
  files.remove("bramble");
  serveBag(bagWithSections("2"));
  EXPECT_TRUE(agent->storebagForSession(*session).has_value());
  EXPECT_EQ(agent->storebagVersionForSession(*session), "2");
}

}  // namespace
}  // namespace velk
