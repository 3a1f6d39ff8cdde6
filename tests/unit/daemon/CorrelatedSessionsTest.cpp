#include "daemon/CorrelatedSessions.h"

#include <algorithm>

#include "tests/unit/daemon/AgentFixture.h"

namespace velk {
namespace {

using test::FakeReportingdSession;

class CorrelatedSessionsTest : public test::AgentFixture {
 protected:
  std::shared_ptr<FakeReportingdSession> add(std::uint32_t level, std::string idString, bool aggregates = false) {
    auto session = FakeReportingdSession::relative("tree", level, std::move(idString), aggregates);
    session->number = 100 + static_cast<std::uint32_t>(relatives.size());
    relatives.push_back(session);
    agent->updateCorrelatedSessions(*session);
    return session;
  }

  std::vector<std::shared_ptr<FakeReportingdSession>> relatives;
};

TEST_F(CorrelatedSessionsTest, NeverListsAStandaloneSession) {
  const auto session = create();
  session->level = 2;
  agent->updateCorrelatedSessions(*session);
  EXPECT_EQ(logged(daemontexts::kStandaloneSession, session->number), 1);
  EXPECT_EQ(agent->parentSessionForChild(*session), nullptr);
  EXPECT_EQ(agent->parentSessionIDStringForSession(*session), std::nullopt);
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*session), nullptr);
  agent->updateDownstreamSessions(*session);
  EXPECT_TRUE(session->calls.empty());
}

TEST_F(CorrelatedSessionsTest, ARootHasNeitherParentNorChain) {
  const auto root = add(0, "A");
  EXPECT_EQ(agent->parentSessionForChild(*root), nullptr);
  EXPECT_EQ(agent->parentSessionIDStringForSession(*root), std::nullopt);
  EXPECT_EQ(logged(daemontexts::kAddingCorrelatedSession, root->number, "tree", 0), 1);
}

TEST_F(CorrelatedSessionsTest, ChainsAncestorsFromTheRootDownToTheParent) {
  add(0, "A");
  const auto child = add(1, "B");
  const auto grandchild = add(2, "C");
  EXPECT_EQ(agent->parentSessionIDStringForSession(*grandchild), "A.B");
  EXPECT_EQ(agent->parentSessionForChild(*grandchild), child);
  EXPECT_EQ(agent->parentSessionIDStringForSession(*child), "A");
  EXPECT_EQ(logged(daemontexts::kCheckingChain, "tree", grandchild->number), 1);
  EXPECT_EQ(logged(daemontexts::kCheckingParent, "tree", grandchild->number), 1);
}

TEST_F(CorrelatedSessionsTest, AMissingParentEndsTheChainBeforeItBegins) {
  add(0, "A");
  const auto session = add(2, "C");
  EXPECT_EQ(agent->parentSessionForChild(*session), nullptr);
  EXPECT_EQ(agent->parentSessionIDStringForSession(*session), std::nullopt);
  EXPECT_EQ(logged(daemontexts::kGapInChain, nullptr), 1);
  EXPECT_EQ(logged(daemontexts::kNoParentAtLevel, 1, "tree"), 1);
}

TEST_F(CorrelatedSessionsTest, AGapCutsOffWhatLiesAboveIt) {
  add(0, "A");
  add(1, "B");
  const auto deep = add(3, "D");
  EXPECT_EQ(agent->parentSessionIDStringForSession(*deep), std::nullopt);
  const auto middle = add(2, "C");
  EXPECT_EQ(agent->parentSessionIDStringForSession(*middle), "A.B");
  const auto deepest = add(5, "F");
  add(4, "E");
  agent->invalidateReportingSession(middle);
  EXPECT_EQ(agent->parentSessionIDStringForSession(*deepest), "D.E");
  EXPECT_EQ(logged(daemontexts::kGapInChain, "D.E"), 1);
}

TEST_F(CorrelatedSessionsTest, ReportsATokenWithoutSessionsAndASessionThatNeverRegistered) {
  const auto unknown = FakeReportingdSession::relative("other", 1, "X");
  EXPECT_EQ(agent->parentSessionForChild(*unknown), nullptr);
  EXPECT_EQ(agent->parentSessionIDStringForSession(*unknown), std::nullopt);
  EXPECT_EQ(loggedAsError(daemontexts::kNoSessionsForParent, "other"), 1);
  EXPECT_EQ(loggedAsError(daemontexts::kNoSessionsForChain, "other"), 1);
  add(0, "A");
  const auto stranger = FakeReportingdSession::relative("tree", 1, "Y");
  EXPECT_EQ(agent->parentSessionForChild(*stranger), nullptr);
  EXPECT_EQ(agent->parentSessionIDStringForSession(*stranger), std::nullopt);
  EXPECT_EQ(loggedAsError(daemontexts::kNotFoundForParent, stranger->number, "tree"), 1);
  EXPECT_EQ(logged(daemontexts::kNotFoundForChain, stranger->number, "tree"), 1);
  EXPECT_EQ(loggedAsError(daemontexts::kNotFoundForChain, stranger->number, "tree"), 0);
}

TEST_F(CorrelatedSessionsTest, TheAggregatorNearestTheRootWins) {
  const auto root = add(0, "A", true);
  add(1, "B", true);
  const auto grandchild = add(2, "C");
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*grandchild), root);
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*root), nullptr);
}

TEST_F(CorrelatedSessionsTest, OnlyTheFirstSessionOfALevelCountsAsAggregator) {
  add(0, "A");
  add(0, "A2", true);
  const auto child = add(1, "B");
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*child), nullptr);
}

TEST_F(CorrelatedSessionsTest, TheFirstSessionOfALevelIsTheParentOfAll) {
  add(0, "A");
  const auto first = add(1, "B1");
  const auto second = add(1, "B2");
  const auto child = add(2, "C");
  EXPECT_EQ(agent->parentSessionForChild(*child), first);
  EXPECT_EQ(agent->parentSessionIDStringForSession(*child), "A.B1");
  // Registering again moves it behind its sibling.
  agent->updateCorrelatedSessions(*first);
  EXPECT_EQ(agent->parentSessionForChild(*child), second);
}

TEST_F(CorrelatedSessionsTest, ASessionThatChangesItsTokenLeavesItsOldRelatives) {
  const auto root = add(0, "A");
  const auto child = add(1, "B");
  root->token = "elsewhere";
  agent->updateCorrelatedSessions(*root);
  EXPECT_EQ(agent->parentSessionForChild(*child), nullptr);
}

TEST_F(CorrelatedSessionsTest, ALevelThatAClientMadeUpCostsNoMoreThanTheSessionsThereAre) {
  add(0, "A", true);
  const auto deep = add(UINT32_MAX, "Z");
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*deep), relatives.front());
  EXPECT_EQ(agent->parentSessionIDStringForSession(*deep), std::nullopt);
}

TEST_F(CorrelatedSessionsTest, MadeUpTokensAreBounded) {
  const auto wanderer = add(0, "A");
  agent->updateSharedDataForSession(*wanderer, {{"first", 1}});
  constexpr std::size_t kMoves = 10 * CorrelatedSessions::kMaximumDesertedLists;
  for (std::size_t move = 0; move < kMoves; ++move) {
    wanderer->token = "made up " + std::to_string(move);
    agent->updateCorrelatedSessions(*wanderer);
    agent->updateSharedDataForSession(*wanderer, {{"move", move}});
    ASSERT_LE(integerValue(agent->copyStatus().find("hierarchyCount")), CorrelatedSessions::kMaximumDesertedLists + 1);
  }
  EXPECT_EQ(agent->sharedDataForSession(*wanderer), (PropertyDictionary{{"move", kMoves - 1}}));
  wanderer->token = "tree";
  EXPECT_EQ(agent->sharedDataForSession(*wanderer), std::nullopt) << "dropped with its deserted hierarchy";
}

TEST_F(CorrelatedSessionsTest, ASessionThatComesBackFindsItsSharedData) {
  const auto wanderer = add(0, "A");
  agent->updateSharedDataForSession(*wanderer, {{"first", 1}});
  wanderer->token = "elsewhere";
  agent->updateCorrelatedSessions(*wanderer);
  wanderer->token = "tree";
  agent->updateCorrelatedSessions(*wanderer);
  EXPECT_EQ(agent->sharedDataForSession(*wanderer), (PropertyDictionary{{"first", 1}}));
}

TEST_F(CorrelatedSessionsTest, AParentThatClosesUpdatesNoChild) {
  const auto root = add(0, "A", true);
  const auto child = add(1, "B");
  const auto grandchild = add(2, "C");
  agent->invalidateReportingSession(root);
  EXPECT_TRUE(child->calls.empty());
  EXPECT_TRUE(grandchild->calls.empty());
  EXPECT_EQ(agent->getAncestorWithAggregatorForSession(*grandchild), nullptr);
}

TEST_F(CorrelatedSessionsTest, UpdatesEveryDeeperSessionDownstream) {
  const auto root = add(0, "A");
  const auto sibling = add(0, "A2");
  const auto child = add(1, "B", true);
  const auto grandchild = add(2, "C");
  agent->updateDownstreamSessions(*root);
  const std::vector<std::string> updated{"updateCombinedSessionID", "syncReportingStates"};
  EXPECT_EQ(root->calls, updated);
  EXPECT_EQ(child->calls, updated);
  EXPECT_EQ(grandchild->calls, updated);
  EXPECT_TRUE(sibling->calls.empty());
  EXPECT_EQ(logged(daemontexts::kUpdatingDownstream, child->number), 1);
  EXPECT_EQ(logged(daemontexts::kUpdatingDownstream, root->number), 0);
}

/// A session that asks the agent what real ones ask, and counts how often anybody asks for its level.
class AskingSession : public FakeReportingdSession {
 public:
  std::uint32_t hierarchyLevel() const override {
    ++questions;
    return level;
  }
  void updateCombinedSessionID() override { chain = agent->parentSessionIDStringForSession(*this); }
  void syncReportingStates() override { parent = agent->parentSessionForChild(*this); }

  ReportingdAgent* agent = nullptr;
  std::optional<std::string> chain;
  std::shared_ptr<ReportingdSession> parent;
  static inline std::size_t questions = 0;
};

TEST_F(CorrelatedSessionsTest, UpdatingATreeDoesNotWalkItForEverySession) {
  constexpr std::size_t kSessions = 512;
  std::vector<std::shared_ptr<AskingSession>> tree;
  for (std::size_t number = 0; number < kSessions; ++number) {
    auto session = std::make_shared<AskingSession>();
    session->agent = agent.get();
    session->token = "tree";
    // The deepest first: no order that happens to be the right one already.
    session->level = static_cast<std::uint32_t>((kSessions - number) * 4 / kSessions);
    session->idString = std::to_string(number);
    agent->updateCorrelatedSessions(*session);
    tree.push_back(std::move(session));
  }
  AskingSession::questions = 0;
  agent->updateDownstreamSessions(*tree.back());
  EXPECT_LT(AskingSession::questions, 10 * kSessions);
  const auto& deepest = *tree.front();
  ASSERT_EQ(deepest.level, 4U);
  std::string expected;
  for (std::uint32_t level = 0; level < deepest.level; ++level) {
    const auto first =
        std::find_if(tree.begin(), tree.end(), [level](const auto& session) { return session->level == level; });
    expected += (expected.empty() ? "" : ".") + (*first)->idString;
    if (level + 1 == deepest.level) {
      EXPECT_EQ(deepest.parent, *first);
    }
  }
  EXPECT_EQ(deepest.chain, expected);
  for (const auto& session : tree) session->parent = nullptr;
}

TEST_F(CorrelatedSessionsTest, AnswersAsBeforeAfterAnUpdate) {
  const auto root = add(0, "A");
  const auto child = add(1, "B");
  agent->updateDownstreamSessions(*root);
  agent->invalidateReportingSession(root);
  EXPECT_EQ(agent->parentSessionForChild(*child), nullptr);
  const auto other = add(0, "A2");
  EXPECT_EQ(agent->parentSessionForChild(*child), other);
}

TEST_F(CorrelatedSessionsTest, LeavesTheTopmostAggregatorAlone) {
  const auto root = add(0, "A", true);
  const auto child = add(1, "B", true);
  const auto grandchild = add(2, "C");
  agent->updateDownstreamSessions(*root);
  EXPECT_EQ(root->calls.size(), 2U);
  EXPECT_EQ(child->calls.back(), "shutdownSessionAggregation");
  EXPECT_EQ(grandchild->calls.back(), "syncReportingStates");
}

TEST_F(CorrelatedSessionsTest, ASessionThatDoesNotAggregateLeavesDeeperAggregatorsAlone) {
  const auto root = add(0, "A");
  const auto child = add(1, "B", true);
  agent->updateDownstreamSessions(*root);
  EXPECT_EQ(child->calls, (std::vector<std::string>{"updateCombinedSessionID", "syncReportingStates"}));
}

TEST_F(CorrelatedSessionsTest, ARootIsNotShutDownForAnotherRoot) {
  add(0, "A", true);
  const auto second = add(0, "A2", true);
  agent->updateDownstreamSessions(*second);
  EXPECT_EQ(second->calls, (std::vector<std::string>{"updateCombinedSessionID", "syncReportingStates"}));
}

TEST_F(CorrelatedSessionsTest, AnAggregatingAncestorShutsTheWholeBranchDown) {
  add(0, "A", true);
  const auto child = add(1, "B");
  const auto grandchild = add(2, "C", true);
  agent->updateDownstreamSessions(*child);
  EXPECT_EQ(child->calls.back(), "shutdownSessionAggregation");
  EXPECT_EQ(grandchild->calls.back(), "shutdownSessionAggregation");
}

TEST_F(CorrelatedSessionsTest, FindsTheFirstSessionWithALevelInAnyList) {
  const CorrelatedSessions::SessionList list{FakeReportingdSession::relative("t", 1, "B"),
                                             FakeReportingdSession::relative("t", 0, "A"),
                                             FakeReportingdSession::relative("t", 1, "C")};
  EXPECT_EQ(CorrelatedSessions::getFirstSessionWithHierarchy(1, list), list[0]);
  EXPECT_EQ(CorrelatedSessions::getFirstSessionWithHierarchy(2, list), nullptr);
}

}  // namespace
}  // namespace velk
