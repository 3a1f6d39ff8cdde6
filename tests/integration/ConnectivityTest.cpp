// Servers that do not answer, and the sessions that do not report to them.

#include <gtest/gtest.h>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

/// Sends realtime events and waits until the daemon has taken the last of them.
void sendEvents(ControlledSession& session, int count) {
  std::size_t line = 0;
  for (int number = 0; number < count; ++number) {
    line = session.sendEvent(7, number, PropertyDictionary{{"number", number}}, 1);
  }
  EXPECT_FALSE(session.reply(line).empty()) << "the client was made to wait";
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
