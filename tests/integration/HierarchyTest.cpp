// Sessions of one tree: whose names events carry, whose states count, and what relatives share. The real daemon, each
// session a process of its own.

#include <gtest/gtest.h>

#include "tests/integration/Relatives.h"

namespace velk::test {
namespace {

const PropertyValue kSplunk = PropertyArray{"splunk"};

class Hierarchy : public testing::Test {
 protected:
  Hierarchy() {
    for (const char* name : {"heather", "juniper", "fennel"}) server.setStorebag(name, storebagWith(server));
  }
  ~Hierarchy() override {
    if (daemon) {
      EXPECT_EQ(daemon->stop(), 0);
    }
  }
  void start() { daemon = std::make_unique<Daemon>(server); }
  ControlledSession& newSession() { return *sessions.emplace_back(std::make_unique<ControlledSession>(*daemon)); }
  /// A session of client type 9 that has been opened; its service is its name.
  ControlledSession& relative(const std::string& service, int level, const PropertyDictionary& more = {}) {
    auto& session = newSession();
    EXPECT_EQ(openRelative(session, 9, static_cast<int>(sessions.size()), service, inTree(level, more))[0], kSplunk);
    return session;
  }
  /// The first event of that service to arrive with that number under `key`, empty when none does. Events are posts of
  /// their own, which may overtake each other.
  PropertyDictionary arrived(const std::string& service, const char* key, std::int64_t number) {
    for (std::size_t seen = 0; waitForEventsOfService(server, service, seen + 1);) {
      const auto events = eventsOfService(server, service);
      for (; seen < events.size(); ++seen) {
        if (events[seen].contains(key) && integerValue(events[seen].find(key)) == number) return events[seen];
      }
    }
    ADD_FAILURE() << "no event of " << service << " with " << key << " " << number;
    return {};
  }
  /// "_sessionID" of one more event of that service.
  std::string identifierOf(ControlledSession& session, const std::string& service) {
    const auto number = ++lastNumber;
    EXPECT_TRUE(sendNumber(session, 7, number));
    return sessionIDOf(arrived(service, "n", number));
  }
  /// The identifier that the session's start message carries.
  std::string firstIdentifierOf(const std::string& service) { return sessionIDOf(arrived(service, "_method", 0)); }
  /// Closes it and waits until the agent has let it go.
  void close(ControlledSession& session) {
    const std::size_t lines = daemon->log().lines().size();
    EXPECT_EQ(session.finish(), 0);
    EXPECT_TRUE(daemon->log().waitForPart("invalidateReportingSession: ReportingdSession", lines));
  }

  ReportingServer server;
  std::int64_t lastNumber = 100;  ///< above those that tests choose
  std::unique_ptr<Daemon> daemon;
  std::vector<std::unique_ptr<ControlledSession>> sessions;
};

TEST_F(Hierarchy, EventsCarryTheIdentifiersOfAllAncestors) {
  start();
  auto& root = relative("root", 0);
  auto& child = relative("child", 1);
  auto& grandchild = relative("grandchild", 2);

  const auto a = identifierOf(root, "root");
  const auto ab = identifierOf(child, "child");
  const auto abc = identifierOf(grandchild, "grandchild");
  EXPECT_EQ(a.size(), 24U);
  EXPECT_EQ(ab, a + "." + ownPart(ab));
  EXPECT_EQ(abc, ab + "." + ownPart(abc));
  EXPECT_EQ(ownPart(abc).size(), 24U);
  EXPECT_EQ(firstIdentifierOf("child"), ab) << "the start message is sent with the ancestors known";
  child.finish();
  ASSERT_TRUE(waitForEventsOfService(server, "child", 3));
  for (const auto& event : eventsOfService(server, "child")) {
    EXPECT_EQ(sessionIDOf(event), ab) << "so is the health message";
  }
}

TEST_F(Hierarchy, ARootThatComesLateRenamesWhatIsBatchedAlready) {
  start();
  auto& child = relative("child", 1, {{"BatchEvents", true}});
  auto& grandchild = relative("grandchild", 2, {{"BatchEvents", true}});
  for (int n = 1; n <= 3; ++n) {
    ASSERT_TRUE(sendNumber(child, 7, n));
    ASSERT_TRUE(sendNumber(grandchild, 7, n));
  }
  EXPECT_TRUE(daemon->log().waitForPart(
      "syncReportingStates: child session 1 (backend splunk) with hierarchy 1 is missing its parent"));
  const std::size_t lines = daemon->log().lines().size();

  auto& root = relative("root", 0);
  for (const char* number : {"1", "2"}) {
    EXPECT_TRUE(daemon->log().waitForPart(std::string("updateDownstreamSessions: Updating combined session ID and "
                                                      "syncing reporting states for session ") +
                                              number,
                                          lines));
  }
  const auto a = identifierOf(root, "root");
  EXPECT_TRUE(flush(child)[1].isNull());
  EXPECT_TRUE(flush(grandchild)[1].isNull());
  ASSERT_TRUE(waitForEventsOfService(server, "child", 4));
  ASSERT_TRUE(waitForEventsOfService(server, "grandchild", 4));
  const auto ab = sessionIDOf(eventsOfService(server, "child")[0]);
  EXPECT_EQ(ab, a + "." + ownPart(ab));
  for (const auto& event : eventsOfService(server, "child")) EXPECT_EQ(sessionIDOf(event), ab);
  for (const auto& event : eventsOfService(server, "grandchild")) {
    EXPECT_EQ(sessionIDOf(event), ab + "." + ownPart(sessionIDOf(event)));
  }
}

TEST_F(Hierarchy, AGapLeavesTheSessionItsOwnIdentifierUntilItIsFilled) {
  start();
  auto& root = relative("root", 0);
  auto& grandchild = relative("grandchild", 2);
  const auto alone = identifierOf(grandchild, "grandchild");
  EXPECT_EQ(alone.size(), 24U);
  EXPECT_TRUE(daemon->log().waitForPart("Found a gap in hierarchy (one of parents missing): incomplete"));
  EXPECT_TRUE(
      daemon->log().waitForPart("parentSessionForChild: Unable to find session with hierarchy of 1 for hierarchyToken "
                                "'tree'"));

  auto& child = relative("child", 1);
  EXPECT_EQ(identifierOf(grandchild, "grandchild"), identifierOf(child, "child") + "." + alone);
  EXPECT_EQ(identifierOf(root, "root").size(), 24U);
}

TEST_F(Hierarchy, OtherTreesAndStandaloneSessionsAreNoRelatives) {
  start();
  relative("root", 0);
  auto& stranger = newSession();
  EXPECT_EQ(openRelative(stranger, 9, 2, "stranger", inTree(1, {}, "another tree"))[0], kSplunk);
  auto& standalone = newSession();
  EXPECT_EQ(openRelative(standalone, 9, 3, "standalone", {{"HierarchyToken", "tree"}})[0], kSplunk);
  EXPECT_EQ(identifierOf(stranger, "stranger").size(), 24U);
  EXPECT_EQ(identifierOf(standalone, "standalone").size(), 24U);
  EXPECT_TRUE(daemon->log().waitForPart(
      "updateCorrelatedSessions: Session 3 has no correlated sessions as it is a standalone session"));
}

// A parent's end is told to nobody, and a chain that is gone takes no name away: what was reported under a parent stays
// recognisable as that parent's.
TEST_F(Hierarchy, AParentThatClosesLeavesItsChildrensIdentifiersAlone) {
  start();
  auto& root = relative("root", 0);
  auto& child = relative("child", 1);
  const auto ab = identifierOf(child, "child");
  ASSERT_GT(ab.size(), 24U);

  close(root);
  EXPECT_EQ(identifierOf(child, "child"), ab);
  renameUser(child, "child", "Renamed");
  EXPECT_EQ(identifierOf(child, "child"), ab) << "even when it looks and finds no parent";
}

TEST_F(Hierarchy, RegisteringAgainMovesASessionBehindItsSiblings) {
  start();
  relative("root", 0);
  auto& first = relative("first", 1);
  auto& second = relative("second", 1);
  auto& grandchild = relative("grandchild", 2);
  const auto ofFirst = identifierOf(first, "first");
  const auto ofSecond = identifierOf(second, "second");
  EXPECT_EQ(identifierOf(grandchild, "grandchild").substr(0, ofFirst.size()), ofFirst);

  first.send({{"method", "setSessionInfo"},
              {"sessionInfo", inTree(1, {{"ComponentType", 9}, {"SessionID", 2}})},
              {"userInfo", userOf("first")},
              {"hasAggregationBlock", false}});
  ASSERT_TRUE(sendNumber(first, 7, 2));
  renameUser(grandchild, "grandchild", "Renamed");
  EXPECT_EQ(identifierOf(grandchild, "grandchild").substr(0, ofSecond.size()), ofSecond);
}

TEST_F(Hierarchy, ChildrenFollowTheStatesOfTheirParent) {
  server.setStorebag("juniper", storebagWith(server, {{"locale_whitelist", PropertyArray{"NO"}}}));
  start();
  auto& root = newSession();
  EXPECT_EQ(openRelative(root, 10, 1, "root", inTree(0))[0], PropertyArray());
  auto& child = newSession();
  EXPECT_EQ(openRelative(child, 9, 2, "child", inTree(1))[0], PropertyArray()) << "enabled, but for its parent";
  EXPECT_TRUE(daemon->log().waitForPart(
      "HTTPSPostBackend(syncReportingStates): splunk: state and sampling rate updated to 1, "));
}

TEST_F(Hierarchy, ARootThatComesLateChangesTheStatesOfItsChildren) {
  server.setStorebag("juniper", storebagWith(server, {{"locale_whitelist", PropertyArray{"NO"}}}));
  start();
  auto& child = relative("child", 1);
  EXPECT_EQ(identifierOf(child, "child").size(), 24U) << "it posts";
  auto& root = newSession();
  EXPECT_EQ(openRelative(root, 10, 2, "root", inTree(0))[0], PropertyArray());
  const auto states = child.call({{"method", "fetchStatesWithUserInfo"}, {"userInfo", userOf("child")}});
  ASSERT_EQ(states.size(), 3U);
  EXPECT_EQ(states[0], PropertyArray());
}

TEST_F(Hierarchy, BackendsThatTheParentLacksKeepTheirStates) {
  server.setStorebag("juniper", storebagOf({{"korrin", postBackend(server)}}));
  start();
  auto& root = newSession();
  EXPECT_EQ(openRelative(root, 10, 1, "root", inTree(0))[0], PropertyArray{"korrin"});
  auto& child = newSession();
  EXPECT_EQ(openRelative(child, 9, 2, "child", inTree(1))[0], kSplunk);
  EXPECT_TRUE(daemon->log().waitForPart(
      "HTTPSPostBackend(syncReportingStates): Parent session  does not have backend splunk. Current state '2' kept for "
      "child session"));
}

TEST_F(Hierarchy, SharedDataGoWithTheEventsOfAllAndEndWithTheLast) {
  start();
  auto& root = relative("root", 0);
  auto& child = relative("child", 1);
  auto& stranger = newSession();
  EXPECT_EQ(openRelative(stranger, 9, 3, "stranger", inTree(0, {}, "another tree"))[0], kSplunk);
  child.send({{"method", "updateSharedDataWithDictionary"}, {"dictionary", PropertyDictionary{{"trip", "abc"}}}});
  ASSERT_TRUE(sendNumber(child, 7, 1));
  ASSERT_TRUE(sendNumber(root, 7, 1));
  ASSERT_TRUE(sendNumber(stranger, 7, 1));
  const auto tripOf = [this](const std::string& service) {
    const auto event = arrived(service, "n", 1);
    const auto* const trip = event.find("trip");
    return trip != nullptr ? std::optional(*trip) : std::nullopt;
  };
  EXPECT_EQ(tripOf("root"), PropertyValue("abc"));
  EXPECT_EQ(tripOf("child"), PropertyValue("abc"));
  EXPECT_EQ(tripOf("stranger"), std::nullopt);

  close(child);
  auto& another = relative("another", 1);
  ASSERT_TRUE(sendNumber(another, 7, 1));
  EXPECT_EQ(tripOf("another"), PropertyValue("abc")) << "the root is still there";

  close(another);
  close(root);
  auto& later = relative("later", 0);
  ASSERT_TRUE(sendNumber(later, 7, 1));
  EXPECT_EQ(tripOf("later"), std::nullopt);
}

}  // namespace
}  // namespace velk::test
