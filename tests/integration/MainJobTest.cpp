// A client's events reach the collector through the daemon: the real daemon, a real storebag, real TLS.

#include <gtest/gtest.h>

#include "tests/integration/Scenario.h"

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

  // Each is a post of its own, and either may arrive first.
  ASSERT_TRUE(server.waitForEvents(2));
  ASSERT_EQ(server.events().size(), 2U);
  const auto starts = eventsOf(server, 0);
  const auto events = eventsOf(server, 7);
  ASSERT_EQ(starts.size(), 1U);
  ASSERT_EQ(events.size(), 1U);
  EXPECT_LT(integerValue(starts[0].find("_eventNumber")), integerValue(events[0].find("_eventNumber")))
      << "the start message comes first";
  EXPECT_EQ(integerValue(events[0].find("answer")), 42);
  EXPECT_EQ(integerValue(events[0].find("_status")), 3);
  EXPECT_EQ(session.finish(), 0);
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace velk::test
