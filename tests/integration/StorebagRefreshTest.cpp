// How a daemon comes by a storebag that it did not get at first, or that has changed since: without a restart, and
// across one.

#include <gtest/gtest.h>
#include <sys/resource.h>

#include "platform/Files.h"
#include "platform/Platform.h"
#include "platform/UserDefaults.h"
#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

constexpr char kPullDue[] = "CACHED_heather_pull-due";
constexpr char kCompleted[] = "new storebag pull for '";

bool isConfigured(const PropertyArray& lists) { return lists.size() == 3 && lists[0] == PropertyArray{"splunk"}; }

PropertyArray openOnce(const Daemon& daemon, int clientType, int sessionID) {
  ControlledSession session(daemon);
  PropertyArray lists = session.open(clientType, sessionID);
  EXPECT_EQ(session.finish(), 0);
  return lists;
}

/// Whether a session that is opened now gets its configuration.
bool configures(const Daemon& daemon, int sessionID) { return isConfigured(openOnce(daemon, 9, sessionID)); }

std::unique_ptr<UserDefaults> suiteOf(const Daemon& daemon) {
  return openUserDefaults(kVelkReportingDefaultsSuite, daemon.directory() + "/state", "");
}

std::int64_t wallSeconds() { return std::chrono::system_clock::to_time_t(std::chrono::system_clock::now()); }

void makeOlder(const Daemon& daemon, std::chrono::hours age) {
  const auto file = fileNamed(daemon.directory() + "/cache", "heather");
  ASSERT_TRUE(file);
  std::filesystem::last_write_time(*file, std::filesystem::last_write_time(*file) - age);
}

/// The wall clock of a daemon, and of nothing else in it: waits and delays go by as always.
class WallClock {
 public:
  WallClock() { moveTo(0); }
  void moveTo(int seconds) {
    const std::string offset = "+" + std::to_string(seconds) + "s\n";
    EXPECT_TRUE(files::writeAtomically(path(), ByteData(offset.begin(), offset.end()), 0644));
  }
  [[nodiscard]] Daemon::Options options() const {
    Daemon::Options options;
#ifdef VELK_FAKETIME_LIBRARY
    options.environment = {{"LD_PRELOAD", VELK_FAKETIME_LIBRARY},
                           {"FAKETIME_TIMESTAMP_FILE", path()},
                           {"FAKETIME_NO_CACHE", "1"},
                           {"FAKETIME_DONT_FAKE_MONOTONIC", "1"}};
#endif
    return options;
  }

 private:
  [[nodiscard]] std::string path() const { return _directory.path() + "/offset"; }
  TemporaryDirectory _directory;
};

class StorebagOverTime : public testing::Test {
 protected:
  void SetUp() override {
#ifndef VELK_FAKETIME_LIBRARY
    GTEST_SKIP() << "libfaketime, which moves the daemon's clock, is not installed or does not go with the sanitizers";
#endif
  }
  WallClock clock;
};

TEST_F(StorebagOverTime, IsFetchedAQuarterOfAnHourAfterItWasNotThere) {
  ReportingServer server;
  Daemon daemon(server, clock.options());
  EXPECT_FALSE(configures(daemon, 1));
  server.setStorebag("heather", storebagWith(server));
  clock.moveTo(890);
  EXPECT_FALSE(configures(daemon, 2));
  EXPECT_EQ(server.storebagRequests("heather"), 1U);

  clock.moveTo(960);
  EXPECT_TRUE(configures(daemon, 3));
  EXPECT_EQ(server.storebagRequests("heather"), 2U);
  EXPECT_TRUE(configures(daemon, 4));
  EXPECT_EQ(server.storebagRequests("heather"), 2U);
}

TEST_F(StorebagOverTime, IsFetchedAQuarterOfAnHourAfterARefusedConnection) {
  ReportingServer server(false);
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server, clock.options());
  EXPECT_FALSE(configures(daemon, 1));
  EXPECT_TRUE(daemon.log().waitForPart("fetchNetworkStorebag: Error resolving with lookup server "));
  server.tls().startListening();

  clock.moveTo(960);
  EXPECT_TRUE(configures(daemon, 2));
}

TEST_F(StorebagOverTime, IsFetchedAQuarterOfAnHourAfterDescriptorsWereShort) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server, clock.options());
  const auto pid = daemon.process().pid();
  // The HTTP service runs, and has no connection to the server any more.
  ASSERT_EQ(openOnce(daemon, 6, 1), noLists());
  server.tls().closeConnections();
  ControlledSession poor(daemon);
  ASSERT_EQ(poor.call({{"method", "fetchDisplayURL"}}).size(), 1U) << "the connection is open";
  rlimit usual{};
  ASSERT_EQ(::prlimit(pid, RLIMIT_NOFILE, nullptr, &usual), 0);
  const rlimit none{1, usual.rlim_max};
  ASSERT_EQ(::prlimit(pid, RLIMIT_NOFILE, &none, nullptr), 0);
  EXPECT_FALSE(isConfigured(poor.open(9, 2)));
  ASSERT_EQ(::prlimit(pid, RLIMIT_NOFILE, &usual, nullptr), 0);
  EXPECT_EQ(poor.finish(), 0);
  EXPECT_EQ(server.storebagRequests("heather"), 0U);

  clock.moveTo(960);
  EXPECT_TRUE(configures(daemon, 3));
}

TEST_F(StorebagOverTime, ReachesTheSessionsOfARunningDaemonWhenItHasChanged) {
  ReportingServer server;
  server.setStorebag("heather", storebagOf({{"splunk", PropertyDictionary{}}}));
  Daemon daemon(server, clock.options());
  EXPECT_FALSE(configures(daemon, 1));
  server.setStorebag("heather", storebagWith(server));
  clock.moveTo(700);
  makeOlder(daemon, std::chrono::hours(1));
  // The delay is over, and nobody waits for the answer.
  ASSERT_TRUE(suiteOf(daemon)->set(kPullDue, wallSeconds()));
  EXPECT_FALSE(configures(daemon, 2)) << "the copy is served";
  EXPECT_EQ(daemon.log().countOnceThereAre(2, kCompleted), 2U);
  EXPECT_EQ(suiteOf(daemon)->value(kPullDue), std::nullopt);

  EXPECT_TRUE(configures(daemon, 3));
  EXPECT_TRUE(configures(daemon, 4));
  EXPECT_EQ(server.storebagRequests("heather"), 2U);
}

TEST(StorebagRefresh, IsTakenOverByTheNextDaemon) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ASSERT_TRUE(configures(daemon, 1));
  makeOlder(daemon, std::chrono::hours(1));
  ASSERT_EQ(daemon.stop(), 0);

  // It ends long before the pull is due.
  daemon.start();
  const auto before = wallSeconds();
  EXPECT_TRUE(configures(daemon, 2));
  const auto due = suiteOf(daemon)->value(kPullDue);
  ASSERT_TRUE(due.has_value());
  EXPECT_GE(integerValue(*due), before);
  EXPECT_LT(integerValue(*due), wallSeconds() + 7200);
  ASSERT_EQ(daemon.stop(), 0);

  // So does the next one, which has less time left.
  ASSERT_TRUE(suiteOf(daemon)->set(kPullDue, wallSeconds() + 1000));
  daemon.start();
  EXPECT_TRUE(configures(daemon, 3));
  EXPECT_TRUE(daemon.log().waitForPart("storebag delayed pull for '"));
  const auto delays = linesWith(daemon.log(), "storebag delayed pull for '");
  ASSERT_EQ(delays.size(), 1U);
  const auto delay = std::stoi(delays[0].substr(delays[0].find("' delayed by ") + 13));
  EXPECT_LE(delay, 1000);
  EXPECT_GT(delay, 900);
  ASSERT_EQ(daemon.stop(), 0);
  EXPECT_EQ(server.storebagRequests("heather"), 1U);

  ASSERT_TRUE(suiteOf(daemon)->set(kPullDue, wallSeconds() - 50'000));
  daemon.start();
  EXPECT_TRUE(configures(daemon, 4));
  EXPECT_EQ(daemon.log().countOnceThereAre(1, kCompleted), 1U);
  EXPECT_EQ(server.storebagRequests("heather"), 2U);
  EXPECT_EQ(suiteOf(daemon)->value(kPullDue), std::nullopt);
}

TEST(StorebagRefresh, IsNotAskedForWithoutAKey) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ASSERT_TRUE(configures(daemon, 1));
  ASSERT_EQ(daemon.stop(), 0);
  writeContents(daemon.directory() + "/config/publicKey.der", "no key");
  daemon.start();
  EXPECT_FALSE(configures(daemon, 2));
  EXPECT_EQ(server.storebagRequests("heather"), 1U);
}

}  // namespace
}  // namespace velk::test
