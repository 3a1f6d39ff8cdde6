#include "tests/unit/session/SessionFixture.h"

namespace velk::test {
namespace {

class EventListsTest : public SessionTest {
 protected:
  /// Starts with backends prepared by name.
  ConfigurationAnswer startWith(const std::vector<std::string>& names, std::function<void(FakeBackend&)> prepare) {
    prepareBackend = std::move(prepare);
    serveBackends(names);
    describe();
    return configure();
  }
};

TEST_F(EventListsTest, StatesNameTheEnabledBackends) {
  const auto answer = startWith({"splunk", "korrin", "qrs", "quill"}, [](FakeBackend& each) {
    if (each.name() == "korrin") each.nextState = kBackendDisabled;
    if (each.name() == "qrs") each.nextState = kBackendWaiting;
  });
  EXPECT_EQ(answer.states, (PropertyArray{"splunk", "quill"}));
}

TEST_F(EventListsTest, NoBackendsInTheStorebagGiveAnEmptyListOfStatesAndNoLists) {
  const auto answer = startWith({}, nullptr);
  EXPECT_EQ(answer.states, PropertyArray());
  EXPECT_FALSE(answer.whitelist.has_value());
  EXPECT_FALSE(answer.blacklist.has_value());
}

TEST_F(EventListsTest, WhitelistIsTheUnionWithoutDuplicates) {
  const auto answer = startWith({"splunk", "korrin"}, [](FakeBackend& each) {
    each.isPost = true;
    each.setWhitelist(each.name() == "splunk" ? numbers({3, 1}) : numbers({1, 2}));
  });
  EXPECT_EQ(answer.whitelist, numbers({3, 1, 2}));
}

TEST_F(EventListsTest, EnabledPostBackendWithoutWhitelistLiftsTheRestriction) {
  const auto answer = startWith({"splunk", "korrin"}, [](FakeBackend& each) {
    each.isPost = true;
    if (each.name() == "splunk") each.setWhitelist(numbers({1}));
  });
  EXPECT_FALSE(answer.whitelist.has_value());
}

TEST_F(EventListsTest, OtherBackendsWithoutWhitelistDoNot) {
  const auto answer = startWith({"splunk", "korrin", "dashboard"}, [](FakeBackend& each) {
    each.isPost = each.name() != "dashboard";
    if (each.name() == "korrin") each.nextState = kBackendDisabled;
    if (each.name() == "splunk") each.setWhitelist(numbers({1}));
  });
  EXPECT_EQ(answer.whitelist, numbers({1}));
}

TEST_F(EventListsTest, WhitelistOfADisabledPostBackendCounts) {
  const auto answer = startWith({"splunk"}, [](FakeBackend& each) {
    each.isPost = true;
    each.nextState = kBackendDisabled;
    each.setWhitelist(numbers({4}));
  });
  EXPECT_EQ(answer.whitelist, numbers({4}));
}

TEST_F(EventListsTest, BlacklistIsWhatEveryPostBackendWithAListRefuses) {
  const auto answer = startWith({"splunk", "korrin", "qrs", "quill"}, [](FakeBackend& each) {
    each.isPost = each.name() != "quill";
    if (each.name() == "splunk") each.setBlacklist(numbers({1, 2, 3}));
    if (each.name() == "korrin") {
      each.setBlacklist(numbers({3, 2}));
      each.nextState = kBackendDisabled;
    }
    if (each.name() == "quill") each.setBlacklist(numbers({9}));
  });
  EXPECT_EQ(answer.blacklist, numbers({2, 3}));
}

TEST_F(EventListsTest, BlacklistIsAbsentWithoutAPostBackendThatHasOne) {
  const auto answer = startWith({"splunk", "quill"}, [](FakeBackend& each) {
    each.isPost = each.name() == "splunk";
    if (!each.isPost) each.setBlacklist(numbers({9}));
  });
  EXPECT_FALSE(answer.blacklist.has_value());
}

class RelativesTest : public SessionTest {
 protected:
  PropertyDictionary childOf(int level) {
    return PropertyDictionary{
        {kVelkReportingSessionInfoHierarchyToken,
         PropertyDictionary{{kVelkReportingHierarchyTokenTokenID, "T"}, {kVelkReportingHierarchyTokenLevel, level}}}};
  }
  /// Makes the agent's parent session, with these backends; `made` holds them first.
  void startParent(const std::vector<std::string>& names) {
    start(names, childOf(0));
    delegate.parent = session;
    session = makeSession(connection);
  }
};

TEST_F(RelativesTest, ChildWithoutParentSaysSoForEachBackend) {
  start({"splunk", "korrin"}, childOf(2));
  session->syncReportingStates();
  EXPECT_EQ(recordedLog.count("syncReportingStates: child session 7 (backend splunk) with hierarchy 2 is missing its "
                              "parent"),
            1);
  EXPECT_EQ(recordedLog.count("syncReportingStates: child session 7 (backend korrin) with hierarchy 2 is missing its "
                              "parent"),
            1);
  EXPECT_EQ(backend("splunk").state(), kBackendEnabled);
}

TEST_F(RelativesTest, RootWithoutParentIsNoMatter) {
  start({"splunk"}, childOf(0));
  session->syncReportingStates();
  EXPECT_FALSE(recordedLog.contains("is missing its parent"));
}

TEST_F(RelativesTest, ChildTakesStateAndThresholdOfItsParent) {
  startParent({"splunk"});
  backend("splunk").setState(kBackendDisabled);
  backend("splunk").setSamplingThreshold(0.25);
  start({"splunk"}, childOf(1));
  session->syncReportingStates();
  EXPECT_EQ(backend("splunk").state(), kBackendDisabled);
  EXPECT_EQ(backend("splunk").samplingThreshold(), 0.25);
  EXPECT_EQ(
      recordedLog.count("HTTPSPostBackend(syncReportingStates): splunk: state and sampling rate updated to 1, 25.00%"),
      1);
}

TEST_F(RelativesTest, BackendThatTheParentEnablesActivatesTheTransport) {
  startParent({"splunk"});
  prepareBackend = [](FakeBackend& each) { each.nextState = kBackendDisabled; };
  start({"splunk"}, childOf(1), userNamed("child", "of"));
  fakes.scheduler.runUntilIdle();
  ASSERT_FALSE(booleanValue(delegate.helper("child:of")->status().find("active")));
  session->syncReportingStates();
  fakes.scheduler.runUntilIdle();
  EXPECT_TRUE(booleanValue(delegate.helper("child:of")->status().find("active")));
}

TEST_F(RelativesTest, AbsentThresholdOfTheParentIsTakenToo) {
  startParent({"splunk"});
  start({"splunk"}, childOf(1));
  backend("splunk").setSamplingThreshold(0.5);
  session->syncReportingStates();
  EXPECT_FALSE(backend("splunk").samplingThreshold().has_value());
}

TEST_F(RelativesTest, WaitingBackendKeepsItsState) {
  startParent({"splunk"});
  start({"splunk"}, childOf(1));
  backend("splunk").setState(kBackendWaiting);
  session->syncReportingStates();
  EXPECT_EQ(backend("splunk").state(), kBackendWaiting);
}

TEST_F(RelativesTest, BackendThatTheParentLacksKeepsItsState) {
  startParent({"splunk"});
  start({"korrin"}, childOf(1));
  session->syncReportingStates();
  EXPECT_EQ(backend("korrin").state(), kBackendEnabled);
  EXPECT_EQ(recordedLog.count("HTTPSPostBackend(syncReportingStates): Parent session  does not have backend korrin. "
                              "Current state '2' kept for child session"),
            1);
}

TEST_F(RelativesTest, ParentWithoutBackendsLacksThemAll) {
  delegate.parent = makeSession(connection);
  start({"korrin"}, childOf(1));
  session->syncReportingStates();
  EXPECT_TRUE(recordedLog.contains("Parent session  does not have backend korrin."));
}

TEST_F(RelativesTest, CombinedIdentifierPutsTheAncestorsInFront) {
  start({"splunk", "korrin"}, childOf(1));
  delegate.parentID = "A.B";
  session->updateCombinedSessionID();
  const std::string combined = "A.B." + session->sessionIDString();
  EXPECT_EQ(backend("splunk").combinedID(), combined);
  EXPECT_EQ(backend("korrin").combinedID(), combined);
  EXPECT_EQ(recordedLog.count("updateCombinedSessionID: Updating combined session ID '" + combined +
                              "' for session 7 backends"),
            1);
}

TEST_F(RelativesTest, ChainThatIsGoneLeavesTheOldCombinedIdentifier) {
  start({"splunk"}, childOf(1));
  delegate.parentID = "A";
  session->updateCombinedSessionID();
  delegate.parentID = std::nullopt;
  session->updateCombinedSessionID();
  EXPECT_EQ(backend("splunk").combinedID(), "A." + session->sessionIDString());
}

}  // namespace
}  // namespace velk::test
