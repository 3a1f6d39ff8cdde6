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
    ASSERT_TRUE(listener->resume());
  }
  bool stopsIfUnused() { return Listener::stopIfUnused({&listener, 1}); }
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
    EXPECT_FALSE(stopsIfUnused());
    client->invalidate();
  }
  EXPECT_TRUE(invalidations.wait());
  // The connection is counted until its socket has been closed, which follows its handler.
  while (!stopsIfUnused()) std::this_thread::yield();
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
  ASSERT_TRUE(listener->resume());
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

TEST_F(ListenerTest, AsksForNoProgramThatNobodyNeeds) {
  auto with = options();
  std::atomic<int> lookUps{0};
  with.findExecutable = [&](std::int32_t, std::uint32_t) {
    ++lookUps;
    return std::optional<std::string>("/bin/x");
  };
  Event asked;
  std::string executable = "not asked";
  with.shouldAcceptNewConnection = [&](const std::shared_ptr<Connection>& connection) {
    executable = connection->peer().executable;
    asked.happen();
    return false;
  };
  listen(std::move(with));
  connectClient()->invalidate();
  ASSERT_TRUE(asked.wait());
  EXPECT_EQ(executable, "");
  EXPECT_EQ(lookUps, 0);
}

TEST_F(ListenerTest, ALookUpThatDoesNotReturnHoldsUpItsPeerAlone) {
  auto with = options();
  Event lookedUp;
  Event diskAnswers;
  std::atomic<int> peers{0};
  with.dependsOnExecutable = [&](const PeerCredentials&) { return peers++ == 0; };
  with.findExecutable = [&](std::int32_t, std::uint32_t) {
    lookedUp.happen();
    EXPECT_TRUE(diskAnswers.wait());
    return std::optional<std::string>("/bin/slow");
  };
  Event decided;
  std::vector<std::string> executables;
  with.shouldAcceptNewConnection = [&](const std::shared_ptr<Connection>& connection) {
    executables.push_back(connection->peer().executable);
    decided.happen();
    return false;
  };
  listen(std::move(with));
  const auto slow = connectClient();
  EXPECT_TRUE(lookedUp.wait());
  const auto other = connectClient();
  EXPECT_TRUE(decided.wait());
  diskAnswers.happen();
  EXPECT_TRUE(decided.wait());
  EXPECT_EQ(executables, (std::vector<std::string>{"", "/bin/slow"}));
}

TEST_F(ListenerTest, LooksForTheProgramsOfAFewPeersOfAUserAtOnce) {
  auto with = options();
  constexpr int kPeers = static_cast<int>(ipc::kMaximumLookUpsPerUser) + 3;
  std::atomic<int> underWay{0};
  std::atomic<int> most{0};
  Event lookedUp;
  Event diskAnswers;
  with.dependsOnExecutable = [](const PeerCredentials&) { return true; };
  with.findExecutable = [&](std::int32_t, std::uint32_t) {
    most = std::max<int>(most, ++underWay);
    lookedUp.happen();
    EXPECT_TRUE(diskAnswers.wait());
    --underWay;
    return std::optional<std::string>();
  };
  Event decided;
  with.shouldAcceptNewConnection = [&](const std::shared_ptr<Connection>&) {
    decided.happen();
    return false;
  };
  listen(std::move(with));
  std::vector<std::shared_ptr<Connection>> clients;
  for (int peer = 0; peer < kPeers; ++peer) clients.push_back(connectClient());
  for (std::size_t peer = 0; peer < ipc::kMaximumLookUpsPerUser; ++peer) ASSERT_TRUE(lookedUp.wait());
  for (int peer = 0; peer < kPeers; ++peer) diskAnswers.happen();
  for (int peer = 0; peer < kPeers; ++peer) ASSERT_TRUE(decided.wait());
  EXPECT_LE(most, static_cast<int>(ipc::kMaximumLookUpsPerUser));
}

TEST_F(ListenerTest, ClosesWhoeverIsStillBeingLookedAtWhenItStops) {
  auto with = options();
  Event lookedUp;
  Event diskAnswers;
  with.dependsOnExecutable = [](const PeerCredentials&) { return true; };
  with.findExecutable = [&](std::int32_t, std::uint32_t) {
    lookedUp.happen();
    EXPECT_TRUE(diskAnswers.wait());
    return std::optional<std::string>();
  };
  std::atomic<int> decisions{0};
  with.shouldAcceptNewConnection = [&](const std::shared_ptr<Connection>&) {
    ++decisions;
    return false;
  };
  listen(std::move(with));
  const auto client = connectClient();
  ASSERT_TRUE(lookedUp.wait());
  listener->stop();
  EXPECT_TRUE(listener->waitUntilDecided(Duration::zero())) << "nothing is being decided";
  diskAnswers.happen();
  while (listener->openConnections() != 0) std::this_thread::yield();
  EXPECT_EQ(decisions, 0);
}

TEST_F(ListenerTest, WaitsForTheDecisionThatIsUnderWay) {
  auto with = options();
  Event asked;
  Event answers;
  with.shouldAcceptNewConnection = [&](const std::shared_ptr<Connection>&) {
    asked.happen();
    EXPECT_TRUE(answers.wait());
    return false;
  };
  listen(std::move(with));
  const auto client = connectClient();
  ASSERT_TRUE(asked.wait());
  listener->stop();
  EXPECT_FALSE(listener->waitUntilDecided(std::chrono::milliseconds(1)));
  answers.happen();
  EXPECT_TRUE(listener->waitUntilDecided(kPatience));
}

TEST_F(ListenerTest, SaysThatItCannotListen) {
  auto bound = Listener::bind(path, options());
  ASSERT_TRUE(bound);
  loop.stop();
  EXPECT_FALSE((*bound)->resume());
}

TEST_F(ListenerTest, StopsSeveralOnlyWhileAllAreUnused) {
  std::vector<std::unique_ptr<Listener>> both;
  const std::string second = directory.path() + "/second";
  for (const auto& each : {path, second}) {
    auto bound = Listener::bind(each, options());
    ASSERT_TRUE(bound);
    ASSERT_TRUE((*bound)->resume());
    both.push_back(std::move(*bound));
  }
  auto client = Connection::connect(second, loop, loop.makeLoopQueue("client"));
  ASSERT_TRUE(client);
  (*client)->resume();
  EXPECT_FALSE(Listener::stopIfUnused(both));
  EXPECT_NE(connectClient(), nullptr) << "the first one listens as well";
  (*client)->invalidate();
  while (!Listener::stopIfUnused(both)) std::this_thread::yield();
  EXPECT_FALSE(Connection::connect(path, loop, loop.makeLoopQueue("late")));
  EXPECT_FALSE(Connection::connect(second, loop, loop.makeLoopQueue("late")));
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
