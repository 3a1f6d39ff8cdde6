// A client's events reach the collector through the daemon: the real daemon, a real storebag, real TLS.

#include <gtest/gtest.h>

#include "tests/integration/Daemon.h"

namespace velk::test {
namespace {

TEST(MainJob, EventsOfASessionReachTheCollector) {
  ReportingServer server;
  server.setStorebag("heather", simpleStorebag(server.url("/post")));
  Daemon daemon(server);
  ControlledSession session(daemon);

  const PropertyArray states = session.open(9, 42);
  ASSERT_EQ(states.size(), 3U);
  EXPECT_EQ(states[0], PropertyValue(PropertyArray{"splunk"}));
  session.sendEvent(7, 3, PropertyDictionary{{"answer", 42}});

  ASSERT_TRUE(server.waitForEvents(1, {7}));
  const auto events = server.events();
  ASSERT_EQ(events.size(), 2U);
  EXPECT_EQ(integerValue(events[0].find("_method")), 0) << "the start message comes first";
  EXPECT_EQ(integerValue(events[1].find("answer")), 42);
  EXPECT_EQ(integerValue(events[1].find("_status")), 3);
  EXPECT_EQ(session.finish(), 0);
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace velk::test
