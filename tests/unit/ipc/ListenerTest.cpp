#include "ipc/Listener.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <thread>

#include "ipc/LogTexts.h"
#include "ipc/SessionProxies.h"
#include "platform/ThreadPool.h"
#include "tests/support/RecordingLog.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/unit/ipc/WireHarness.h"

namespace velk {
namespace {

using namespace test;

class ListenerTest : public testing::Test {
 protected:
  ~ListenerTest() override {
    listener.reset();
    loop.stop();
    pool->stop();
  }

  Listener::Options options() {
    Listener::Options made;
    made.loop = &loop;
    made.acceptQueue = pool->makeSerialQueue("accept");
    made.makeDeliveryQueue = [this] { return pool->makeSerialQueue("delivery"); };
    made.shouldAcceptNewConnection = [this](const std::shared_ptr<Connection>& connection) {
      if (refuses) return false;
      connection->setExportedDispatcher(std::make_shared<FunctionDispatcher>([this](IncomingCall& call) {
        ++calls;
        call.reply.sendValues({call.arguments[0]});
        return Result<void>();
      }));
      connection->setInvalidationHandler([this] { invalidations.happen(); });
      connection->resume();
      return true;
    };
    return made;
  }
  void listen(Listener::Options with) {
    auto bound = Listener::bind(path, std::move(with));
    ASSERT_TRUE(bound) << bound.error().description;
    listener = std::move(*bound);
    listener->resume();
  }
  std::shared_ptr<Connection> connectClient() {
    auto connected = Connection::connect(path, loop, loop.makeLoopQueue("client"));
    EXPECT_TRUE(connected);
    return connected ? *connected : nullptr;
  }

  TemporaryDirectory directory;
  const std::string path = directory.path() + "/socket";
  RecordingLog recorded;
  EventLoop loop{"test-io"};
  std::unique_ptr<ThreadPool> pool = makeThreadPool();
  std::atomic<bool> refuses{false};
  std::atomic<int> calls{0};
  Event invalidations;
  std::unique_ptr<Listener> listener;
};

TEST_F(ListenerTest, StopsUnusedOnlyWhileNobodyIsThere) {
  listen(options());
  {
    const auto client = connectClient();
    ASSERT_TRUE(client);
    client->resume();
    EXPECT_FALSE(listener->stopIfUnused());
    client->invalidate();
  }
  EXPECT_TRUE(invalidations.wait());
  // The connection is counted until its socket has been closed, which follows its handler.
  while (!listener->stopIfUnused()) std::this_thread::yield();
  EXPECT_FALSE(Connection::connect(path, loop, loop.makeLoopQueue("late")));
}

TEST_F(ListenerTest, OpensItsSocketToEverybodyAndRemovesIt) {
  listen(options());
  struct stat status {};
  ASSERT_EQ(::stat(path.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 0777, 0666U);
  listener->stop();
  EXPECT_NE(::stat(path.c_str(), &status), 0);
  EXPECT_FALSE(listener->hasWaitingConnection());
}

TEST_F(ListenerTest, RefusesToListenBesideAnother) {
  listen(options());
  const auto second = Listener::bind(path, options());
  ASSERT_FALSE(second);
  EXPECT_EQ(second.error().description, "another velkreportingd is listening on " + path);
}

TEST_F(ListenerTest, ReplacesASocketThatNobodyAnswersOn) {
  {
    auto dead = bindLocalSocket(path, "x");
    ASSERT_TRUE(dead);
  }
  listen(options());
  EXPECT_NE(connectClient(), nullptr);
}

TEST_F(ListenerTest, LeavesAFileThatIsNoSocketAlone) {
  const FileDescriptor file(::open(path.c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0600));
  EXPECT_FALSE(Listener::bind(path, options()));
  EXPECT_EQ(::access(path.c_str(), F_OK), 0);
}

TEST_F(ListenerTest, AdoptsAnInheritedSocketAndLeavesItsPath) {
  auto inherited = bindLocalSocket(path, "manager");
  ASSERT_TRUE(inherited);
  auto adopted = Listener::adopt(std::move(inherited->socket), options());
  ASSERT_TRUE(adopted);
  listener = std::move(*adopted);
  const auto early = connectClient();
  EXPECT_TRUE(listener->hasWaitingConnection());
  listener->resume();
  Event answered;
  early->resume();
  ASSERT_TRUE(early->callMethod(2, {1}, [&](Result<PropertyArray> result) {
    EXPECT_TRUE(result);
    answered.happen();
  }));
  ASSERT_TRUE(answered.wait());
  early->closeAfterSending();
  listener->stop();
  EXPECT_EQ(::access(path.c_str(), F_OK), 0);
}

TEST_F(ListenerTest, RefusesWhatIsNoListeningSocket) {
  auto ends = makeLocalSocketPair();
  EXPECT_FALSE(Listener::adopt(std::move(ends->first), options()));
  EXPECT_FALSE(Listener::adopt(FileDescriptor(), options()));
}

TEST_F(ListenerTest, ClosesARefusedConnectionUnread) {
  refuses = true;
  listen(options());
  const auto client = connectClient();
  Event invalidated;
  Event failed;
  client->setInvalidationHandler([&] { invalidated.happen(); });
  ASSERT_TRUE(client->callMethod(2, {1}, [&](Result<PropertyArray> result) {
    EXPECT_FALSE(result);
    failed.happen();
  }));
  client->resume();
  EXPECT_TRUE(failed.wait());
  EXPECT_TRUE(invalidated.wait());
  EXPECT_EQ(calls, 0);
}

TEST_F(ListenerTest, KnowsThePeer) {
  auto with = options();
  Event asked;
  PeerCredentials peer;
  with.shouldAcceptNewConnection = [&](const std::shared_ptr<Connection>& connection) {
    peer = connection->peer();
    asked.happen();
    return false;
  };
  listen(std::move(with));
  connectClient()->invalidate();
  ASSERT_TRUE(asked.wait());
  EXPECT_EQ(peer.uid, ::getuid());
  EXPECT_EQ(peer.pid, ::getpid());
}

TEST_F(ListenerTest, BoundsTheConnectionsOfAUser) {
  auto with = options();
  with.maximumConnectionsPerUser = 2;
  listen(std::move(with));
  std::vector<std::shared_ptr<Connection>> clients;
  Event answered;
  for (int count = 0; count < 2; ++count) {
    clients.push_back(connectClient());
    clients.back()->resume();
    ASSERT_TRUE(clients.back()->callMethod(2, {1}, [&](Result<PropertyArray>) { answered.happen(); }));
    ASSERT_TRUE(answered.wait());
  }
  EXPECT_EQ(listener->openConnections(), 2U);
  const auto third = connectClient();
  Event interrupted;
  third->setInterruptionHandler([&] { interrupted.happen(); });
  third->resume();
  ASSERT_TRUE(interrupted.wait());
  third->invalidate();
  EXPECT_EQ(recorded.count(formatText(ipc::texts::kTooManyConnections, {::getuid(), 2})), 1);
  for (const auto& client : clients) client->closeAfterSending();
  ASSERT_TRUE(invalidations.wait());
  ASSERT_TRUE(invalidations.wait());
}

TEST_F(ListenerTest, LosesNothingOfManyClientsThatSendAndLeave) {
  listen(options());
  constexpr int kClients = 40;
  constexpr int kCalls = 200;
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([&] {
      for (int client = 0; client < kClients / 4; ++client) {
        const auto connection = connectClient();
        connection->resume();
        for (int call = 0; call < kCalls; ++call) ASSERT_TRUE(connection->callMethod(5, {call}, {}));
        connection->closeAfterSending();
      }
    });
  }
  for (auto& thread : threads) thread.join();
  for (int client = 0; client < kClients; ++client) ASSERT_TRUE(invalidations.wait());
  EXPECT_EQ(calls, kClients * kCalls);
}

TEST_F(ListenerTest, AnswersManyClientsAtOnce) {
  listen(options());
  constexpr int kClients = 32;
  constexpr int kCalls = 100;
  std::atomic<int> answers{0};
  Event done;
  std::vector<std::shared_ptr<Connection>> clients;
  for (int client = 0; client < kClients; ++client) {
    clients.push_back(connectClient());
    clients.back()->resume();
  }
  for (int call = 0; call < kCalls; ++call) {
    for (const auto& client : clients) {
      ASSERT_TRUE(client->callMethod(5, {call}, [&](Result<PropertyArray> result) {
        EXPECT_TRUE(result);
        if (++answers == kClients * kCalls) done.happen();
      }));
    }
  }
  EXPECT_TRUE(done.wait());
  for (const auto& client : clients) client->invalidate();
  for (int client = 0; client < kClients; ++client) ASSERT_TRUE(invalidations.wait());
}

}  // namespace
}  // namespace velk
