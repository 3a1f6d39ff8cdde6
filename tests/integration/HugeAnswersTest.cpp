// Servers that answer posts with far more than anybody wants to know.

#include <gtest/gtest.h>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

/// A line of the process's status, in KiB.
long memory(Daemon& daemon, const std::string& key) {
  const auto status = contentsOf("/proc/" + std::to_string(daemon.process().pid()) + "/status");
  const auto at = status.find(key + ":");
  return at == std::string::npos ? -1 : std::atol(status.c_str() + at + key.size() + 1);
}

TEST(HugeAnswers, ToPostsCostLittleMemoryAndNoEvent) {
  constexpr int kEvents = 40;
  constexpr std::size_t kAnswerBytes = 15U << 20U;
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1)[0], PropertyValue(PropertyArray{"splunk"}));
  // One for the usual, before it is measured.
  session.sendEvent(7, 1, PropertyDictionary{{"n", 0}});
  ASSERT_TRUE(server.waitForEvents(1, {7}));
  const long before = memory(daemon, "VmRSS");
  ASSERT_GT(before, 0);

  TlsTestServer::Response huge;
  huge.body = std::string(kAnswerBytes, 'x');
  server.setPostResponse(huge);
  for (int number = 1; number <= kEvents; ++number) session.sendEvent(7, 1, PropertyDictionary{{"n", number}});
  EXPECT_TRUE(server.waitForEvents(1 + kEvents, {7}));
  EXPECT_EQ(session.finish(), 0);
  EXPECT_LT(memory(daemon, "VmHWM") - before, 64 * 1024) << "KiB, at the highest";
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace velk::test
