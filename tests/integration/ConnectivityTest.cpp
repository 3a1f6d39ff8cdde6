// A device whose network comes and goes (everything in a network namespace of its own), and servers that do not answer.

#include <gtest/gtest.h>

#include "tests/integration/Scenario.h"
#include "tests/support/NetworkNamespace.h"

namespace velk::test {
namespace {

#define VELK_WITHOUT_NETWORK(...) \
  if (!runInEmptyNetworkNamespace(__VA_ARGS__)) GTEST_SKIP() << "no network namespaces here: they are made by root"

/// Storebags come over loopback; events go to an address that is not there until `connectNetwork`.
class Device {
 public:
  Device() {
    startLoopback();
    _storebags.emplace();
    _posts.emplace(true, true, TlsTestServer::kOtherAddress);
    auto bag = storebagWith(*_storebags, {{"post_url", _posts->url("/post")}});
    _storebags->setStorebag("heather", bag);
    writeContents(_directory.path() + "/ca.pem", contentsOf(_storebags->tls().caFile()) + contentsOf(_posts->caFile()));
    Daemon::Options options;
    options.deviceConfiguration = kDeviceLines;
    options.environment["SSL_CERT_FILE"] = _directory.path() + "/ca.pem";
    daemon.emplace(*_storebags, options);
  }
  [[nodiscard]] TlsTestServer& posts() { return *_posts; }

 private:
  TemporaryDirectory _directory;
  std::optional<ReportingServer> _storebags;
  std::optional<TlsTestServer> _posts;

 public:
  std::optional<Daemon> daemon;
};

/// Sends realtime events and waits until the daemon has taken the last of them.
void sendEvents(ControlledSession& session, int count) {
  std::size_t line = 0;
  for (int number = 0; number < count; ++number) {
    line = session.sendEvent(7, number, PropertyDictionary{{"number", number}}, 1);
  }
  EXPECT_FALSE(session.reply(line).empty()) << "the client was made to wait for a network";
}

TEST(Connectivity, EventsSentWithoutARouteHoldNobodyUpAndArriveWithTheRoute) {
  VELK_WITHOUT_NETWORK([] {
    Device device;
    ControlledSession session(*device.daemon);
    ASSERT_EQ(session.open(9, 1).size(), 3U);
    constexpr int kEvents = 100;
    sendEvents(session, kEvents);
    EXPECT_TRUE(device.posts().requests().empty());
    EXPECT_EQ(device.daemon->log().count("post error"), 0U);
    connectNetwork();
    ASSERT_TRUE(device.posts().waitForRequests(kEvents + 1, kPatience)) << "the start message and every event";
    EXPECT_EQ(device.daemon->log().count("post error"), 0U);
    EXPECT_EQ(session.finish(), 0);
    EXPECT_EQ(device.daemon->stop(), 0);
  });
}

TEST(Connectivity, ARouteThatIsLostAndComesBackCostsNoEvent) {
  VELK_WITHOUT_NETWORK([] {
    connectNetwork();
    Device device;
    ControlledSession session(*device.daemon);
    ASSERT_EQ(session.open(9, 1).size(), 3U);
    ASSERT_TRUE(device.posts().waitForRequests(1, kPatience));
    disconnectNetwork();
    sendEvents(session, 20);
    connectNetwork();
    ASSERT_TRUE(device.posts().waitForRequests(21, kPatience));
    EXPECT_EQ(device.daemon->log().count("post error"), 0U);
    EXPECT_EQ(session.finish(), 0);
    EXPECT_EQ(device.daemon->stop(), 0);
  });
}

TEST(Connectivity, ADaemonThatEndsWaitsForNoRoute) {
  VELK_WITHOUT_NETWORK([] {
    Device device;
    ControlledSession session(*device.daemon);
    ASSERT_EQ(session.open(9, 1).size(), 3U);
    sendEvents(session, 20);
    EXPECT_EQ(device.daemon->stop(), 0);
    EXPECT_GE(device.daemon->log().count("post error"), 20U) << "each event that is lost is told of";
  });
}

// Both sessions belong to one client and service, and so share a transport.
TEST(Connectivity, ADeadServerHoldsUpTheSessionThatReportsToItAlone) {
  ReportingServer server;
  // It takes connections, and never answers the handshake.
  const TlsTestServer dead(false);
  server.setStorebag("heather", storebagWith(server, {{"post_url", "https" + dead.url("/post").substr(4)}}));
  server.setStorebag("clover", storebagWith(server));
  Daemon daemon(server);
  ControlledSession unlucky(daemon);
  ASSERT_EQ(unlucky.open(9, 1).size(), 3U);
  std::size_t last = 0;
  for (int number = 0; number < 100; ++number) last = unlucky.sendEvent(7, number, PropertyDictionary{}, 1);
  ControlledSession other(daemon);
  ASSERT_EQ(other.open(6, 2).size(), 3U);
  sendEvents(other, 40);
  EXPECT_TRUE(server.waitForEvents(40, {7}));
  EXPECT_TRUE(unlucky.reply(last, std::chrono::milliseconds(0)).empty()) << "its events do not pile up";
  EXPECT_EQ(other.finish(), 0);
  unlucky.kill();
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace velk::test
