// The daemon's own life: when it may leave, when it must stay, and how it ends.

#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>

#include "tests/integration/RawConnection.h"
#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

const PropertyValue kSplunk = PropertyArray{"splunk"};

Daemon::Options idleExit() {
  Daemon::Options options;
  options.arguments = {"--idle-exit", "1"};
  return options;
}
/// It goes up to a second later than it might.
constexpr std::chrono::milliseconds kLongerThanIdle{2500};

/// Opens a session with a daemon that leaves when idle. It takes a program its time to start, so somebody who says
/// nothing is there until then.
PropertyArray openInTime(const Daemon& daemon, std::unique_ptr<ControlledSession>& session) {
  RawConnection bystander(daemon);
  EXPECT_TRUE(bystander.isConnected());
  session = std::make_unique<ControlledSession>(daemon);
  return session->open(9, 1);
}

PropertyDictionary quickBag(const ReportingServer& server, const PropertyDictionary& more = {}) {
  auto bag = storebagWith(server, more);
  bag.set("release_timeout", 1);
  return bag;
}

TEST(Lifecycle, StartsInOrder) {
  ReportingServer server;
  Daemon daemon(server);
  const auto lines = daemon.log().lines();
  const auto at = [&](const std::string& line) { return std::find(lines.begin(), lines.end(), line) - lines.begin(); };
  EXPECT_EQ(at("<6>startLogging: Daemon starts logging..."), 0);
  EXPECT_LT(at("<6>startLogging: Daemon starts logging..."), at("<6>main: Listener resumes with sandbox, start loop."));
}

TEST(Lifecycle, LeavesWhenIdle) {
  ReportingServer server;
  Daemon daemon(server, idleExit());
  EXPECT_EQ(daemon.process().wait(), 0);
}

TEST(Lifecycle, LeavesOnlyAfterTheLastHelperLetGo) {
  ReportingServer server;
  server.setStorebag("heather", quickBag(server));
  Daemon daemon(server, idleExit());
  std::unique_ptr<ControlledSession> session;
  ASSERT_EQ(openInTime(daemon, session)[0], kSplunk);
  EXPECT_EQ(session->finish(), 0);
  EXPECT_EQ(daemon.process().wait(), 0);
  EXPECT_TRUE(server.waitForEvents(2, {0})) << "start and health message had arrived before";
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "releaseIPCTransactions: IPC transaction ended"), 1U);
}

TEST(Lifecycle, StaysWhileAConnectionIsOpen) {
  ReportingServer server;
  server.setStorebag("heather", quickBag(server));
  Daemon daemon(server, idleExit());
  std::unique_ptr<ControlledSession> session;
  ASSERT_EQ(openInTime(daemon, session)[0], kSplunk);

  EXPECT_EQ(daemon.process().wait(kLongerThanIdle), std::nullopt);
  EXPECT_EQ(session->call({{"method", "startConfigWithCompletionHandler"}})[0], kSplunk);
  EXPECT_EQ(session->finish(), 0);
  EXPECT_EQ(daemon.process().wait(), 0);
}

TEST(Lifecycle, StaysWhileAPostIsUnderWay) {
  ReportingServer server;
  server.setStorebag("heather", quickBag(server));
  TlsTestServer::Response never;
  never.silent = true;
  server.setPostResponse(never);
  Daemon daemon(server, idleExit());
  std::unique_ptr<ControlledSession> session;
  ASSERT_EQ(openInTime(daemon, session)[0], kSplunk);
  EXPECT_EQ(session->finish(), 0);
  ASSERT_TRUE(server.waitForPosts(2));
  EXPECT_EQ(daemon.process().wait(kLongerThanIdle), std::nullopt);
  server.setPostResponse({});
  server.tls().closeConnections();
  EXPECT_EQ(daemon.process().wait(), 0);
}

TEST(Lifecycle, EndsInOrderWithSessionsOpen) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1, {{"BatchEvents", true}})[0], kSplunk);
  ASSERT_FALSE(session.reply(session.sendEvent(7, 1, PropertyDictionary{{"a", 1}})).empty());

  EXPECT_EQ(daemon.stop(), 0);

  EXPECT_TRUE(server.waitForEvents(1, {7})) << "what was batched is delivered";
  EXPECT_EQ(eventsOf(server, 0).size(), 2U) << "and so is the health message";
  EXPECT_EQ(session.process().wait(), 69);
  EXPECT_FALSE(std::filesystem::exists(daemon.socketPath()));
}

TEST(Lifecycle, EndsInTimeAlthoughAServerIsSilent) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  TlsTestServer::Response never;
  never.silent = true;
  server.setPostResponse(never);
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1)[0], kSplunk);
  EXPECT_EQ(daemon.stop(), 0);
}

TEST(Lifecycle, ComesBackAfterACrash) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  {
    ControlledSession session(daemon);
    ASSERT_EQ(session.open(9, 1)[0], kSplunk);
    daemon.kill();
    EXPECT_EQ(session.process().wait(), 69);
    EXPECT_FALSE(session.event("interrupted").empty() && session.event("invalidated").empty());
  }
  daemon.start();
  ControlledSession session(daemon);
  EXPECT_EQ(session.open(9, 2)[0], kSplunk);
}

TEST(Lifecycle, SecondDaemonLeavesTheFirstAlone) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ChildProcess::Options second;
  second.command = {daemonProgram(), "--socket", daemon.socketPath()};
  second.environment = daemon.environment();
  EXPECT_NE(runProgram(second).status, 0);
  ControlledSession session(daemon);
  EXPECT_EQ(session.open(9, 2)[0], kSplunk);
}

TEST(Lifecycle, CorruptSettingsAreSetAside) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon::Options options;
  options.starts = false;
  Daemon daemon(server, options);
  const auto suite = fileNamed(daemon.directory() + "/state", "com.tavrin.velkreporting.json");
  ASSERT_TRUE(suite);
  writeContents(*suite, "{\"environmentType\": ");
  daemon.start();
  ControlledSession session(daemon);
  EXPECT_EQ(session.open(9, 1).size(), 3U) << "the daemon serves, with what holds without settings";
}

TEST(Lifecycle, NeverTouchesItsSecretsOfTheEnvironment) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon::Options options;
  TemporaryDirectory directory;
  options.environment = {{"SSLKEYLOGFILE", directory / "keys"}};
  Daemon daemon(server, options);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1)[0], kSplunk);
  ASSERT_TRUE(server.waitForPosts(1));
  EXPECT_FALSE(std::filesystem::exists(directory / "keys"));
}

}  // namespace
}  // namespace velk::test
