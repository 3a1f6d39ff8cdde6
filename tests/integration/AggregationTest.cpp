// Events on their way to the process that aggregates them: through real processes, some of which throw, hang or die.

#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <fstream>

#include "foundation/Json.h"
#include "tests/integration/Relatives.h"

namespace velk::test {
namespace {

using Block = AggregatingClient::Block;

const PropertyValue kSplunk = PropertyArray{"splunk"};
constexpr char kProxyFailure[] = "sendMessageWithDictionary: Failed to get remote object proxy: ";

class Aggregation : public testing::Test {
 protected:
  ~Aggregation() override {
    if (daemon) {
      EXPECT_EQ(daemon->stop(), 0);
    }
  }
  void start(const PropertyDictionary& clientEntry = {}) {
    server.setStorebag("heather", storebagWith(server, clientEntry));
    daemon = std::make_unique<Daemon>(server);
  }
  ControlledSession& relative(int number, const std::string& service, int level, bool hasAggregationBlock = false,
                              const PropertyDictionary& more = {}) {
    auto& session = *sessions.emplace_back(std::make_unique<ControlledSession>(*daemon));
    EXPECT_EQ(openRelative(session, 9, number, service, inTree(level, more), hasAggregationBlock).size(), 3U);
    return session;
  }
  AggregatingClient& library(int number, const std::string& service, int level, Block block) {
    auto& client =
        *clients.emplace_back(std::make_unique<AggregatingClient>(*daemon, 9, number, level, service, block));
    EXPECT_TRUE(client.waitUntilReady());
    return client;
  }

  ReportingServer server;
  std::unique_ptr<Daemon> daemon;
  std::vector<std::unique_ptr<ControlledSession>> sessions;
  std::vector<std::unique_ptr<AggregatingClient>> clients;
};

/// What a session that is driven over the wire was called with by the daemon, so far.
struct Heard {
  std::vector<PropertyDictionary> calls;

  explicit Heard(ControlledSession& session) {
    for (const auto& line : session.process().output().lines()) {
      const auto value = json::parse(line, json::Extensions::tagged);
      const auto* object = value ? value->dictionary() : nullptr;
      const auto* event = object != nullptr ? object->string("event") : nullptr;
      if (event != nullptr && *event == "sendMessageToClient") calls.push_back(*object);
    }
  }
  /// Those with a payload that has an "n".
  [[nodiscard]] std::vector<std::int64_t> numbers() const {
    std::vector<std::int64_t> found;
    for (const auto& call : calls) {
      const auto* payload = call.dictionary("payload");
      if (payload != nullptr && payload->contains("n")) found.push_back(integerValue(payload->find("n")));
    }
    return found;
  }
  [[nodiscard]] static bool isEnd(const PropertyDictionary& call) {
    return call.dictionary("sessionInfo") == nullptr && call.dictionary("payload") == nullptr &&
           integerValue(call.find("category")) == 0 && integerValue(call.find("type")) == 0;
  }
  [[nodiscard]] std::size_t ends() const {
    return static_cast<std::size_t>(std::count_if(calls.begin(), calls.end(), isEnd));
  }
};

TEST_F(Aggregation, AParentHearsOfItsChildsEventsFromStartToEnd) {
  start();
  auto& parent = library(1, "parent", 0, Block::print);
  auto& child = library(2, "child", 1, Block::none);
  auto& grandchild = relative(3, "grandchild", 2);
  child.sendNumber(7, 41);
  ASSERT_TRUE(child.flush());
  ASSERT_TRUE(sendNumber(grandchild, 8, 42));
  ASSERT_EQ(grandchild.finish(), 0);
  ASSERT_TRUE(parent.lines().waitForPart("event 3 0 1 - Wire grandchild")) << "the health message";

  EXPECT_EQ(parent.heard(),
            (std::vector<std::string>{"event 1 0 0 - Library parent", "event 2 0 0 - Library child",
                                      "event 3 0 0 - Wire grandchild", "event 2 7 1 41 Library child",
                                      "event 3 8 1 42 Wire grandchild", "event 3 0 1 - Wire grandchild"}));
  EXPECT_TRUE(child.heard().empty());
  ASSERT_TRUE(server.waitForEvents(2, {7, 8})) << "the backends have them all the same";
  EXPECT_EQ(*eventsOf(server, 8)[0].string("_serviceName"), "grandchild");
}

TEST_F(Aggregation, TheSendersUserInfoWinsOverItsPayload) {
  start();
  auto& parent = relative(1, "parent", 0, true);
  auto& child = relative(2, "child", 1);
  child.sendEvent(7, 3, PropertyDictionary{{"n", 1}, {"_clientName", "forged"}});
  child.sendEvent(7, 4);
  const auto withPayload = parent.event("sendMessageToClient", 2);
  EXPECT_EQ(*withPayload.find("payload"),
            PropertyValue(PropertyDictionary{{"n", 1}, {"_clientName", "Wire"}, {"_serviceName", "child"}}));
  EXPECT_EQ(integerValue(withPayload.dictionary("sessionInfo")->find("SessionID")), 2);
  EXPECT_EQ(integerValue(withPayload.find("category")), 7);
  EXPECT_EQ(integerValue(withPayload.find("type")), 3);
  EXPECT_GT(doubleValue(withPayload.find("timestamp")), 1.7e9);
  const auto without = parent.event("sendMessageToClient", 3);
  EXPECT_EQ(integerValue(without.find("type")), 4);
  EXPECT_EQ(without.dictionary("payload"), nullptr) << "the user info is not sent on its own";
}

TEST_F(Aggregation, EventsThatBackendsDropAreAggregated) {
  start({{"event_whitelist", PropertyArray{7}}});
  auto& parent = library(1, "parent", 0, Block::print);
  auto& child = relative(2, "child", 1);
  ASSERT_TRUE(sendNumber(child, 8, 1));
  ASSERT_TRUE(sendNumber(child, 7, 2));
  ASSERT_EQ(child.finish(), 0);
  ASSERT_TRUE(parent.lines().waitForPart("event 2 0 1 "));

  EXPECT_EQ(parent.heard(), (std::vector<std::string>{"event 1 0 0 - Library parent", "event 2 0 0 - Wire child",
                                                      "event 2 8 1 1 Wire child", "event 2 7 1 2 Wire child",
                                                      "event 2 0 1 - Wire child"}));
  EXPECT_TRUE(daemon->log().waitForPart(
      "sendMessageWithDictionary: Dropping event with category 8 as it is not whitelisted for backend splunk"));
  ASSERT_TRUE(server.waitForEvents(1));
  EXPECT_EQ(integerValue(server.events()[0].find("n")), 2) << "start and health messages obey lists as category 0";
}

TEST_F(Aggregation, ABlockThatThrowsIsDisabledInItsClientAlone) {
  start();
  auto& parent = library(1, "parent", 0, Block::throws);
  ASSERT_TRUE(parent.lines().waitForPart("throwing"));
  auto& child = relative(2, "child", 1);
  ASSERT_TRUE(sendNumber(child, 7, 1));
  ASSERT_TRUE(parent.process().errors().waitForPart("sendMessageToClient: 7, 1")) << "it gets there";
  parent.sendNumber(9, 2);
  ASSERT_TRUE(parent.flush());

  EXPECT_EQ(parent.lines().count("throwing"), 1U);
  EXPECT_EQ(parent.process().errors().count("Exception during invocation of aggregation block. Disabling aggregation"),
            1U);
  ASSERT_TRUE(server.waitForEvents(2, {7, 9})) << "both go on reporting";
  EXPECT_EQ(parent.finish(), 0);
}

TEST_F(Aggregation, OneShotsAreNotAggregated) {
  start();
  auto& parent = relative(1, "parent", 0, true);
  auto& child = relative(2, "child", 1);
  ControlledSession single(*daemon);
  EXPECT_EQ(single.call({{"method", "sendMessageWithSessionInfo"},
                         {"sessionInfo", inTree(1, {{"ComponentType", 9}, {"SessionID", 3}})},
                         {"userInfo", userOf("single")},
                         {"category", 9},
                         {"type", 1},
                         {"payload", PropertyDictionary{{"n", 77}}}}),
            PropertyArray{"finished"});
  ASSERT_TRUE(server.waitForEvents(1, {9}));
  ASSERT_TRUE(sendNumber(child, 7, 1));
  ASSERT_TRUE(sendNumber(parent, 7, 2)) << "its reply comes behind what it was called with";
  EXPECT_EQ(Heard(parent).numbers(), (std::vector<std::int64_t>{1, 2}));
}

TEST_F(Aggregation, OnlyTheTopmostAggregatorHearsAndTheOthersNeverRevive) {
  start();
  auto& child = library(2, "child", 1, Block::print);
  auto& grandchild = relative(3, "grandchild", 2);
  ASSERT_TRUE(sendNumber(grandchild, 7, 1));
  ASSERT_TRUE(child.lines().waitForPart("event 3 7 1 1 "));

  auto& root = relative(1, "root", 0, true);
  ASSERT_TRUE(child.lines().waitForPart("end"));
  ASSERT_TRUE(sendNumber(grandchild, 7, 2));
  child.sendNumber(7, 3);
  ASSERT_TRUE(child.flush());
  ASSERT_TRUE(sendNumber(root, 7, 4));
  EXPECT_EQ(Heard(root).numbers(), (std::vector<std::int64_t>{2, 3, 4}));

  const std::size_t lines = daemon->log().lines().size();
  ASSERT_EQ(root.finish(), 0);
  ASSERT_TRUE(daemon->log().waitForPart("invalidateReportingSession: ReportingdSession", lines));
  ASSERT_TRUE(sendNumber(grandchild, 7, 5));
  renameUser(grandchild, "grandchild", "Renamed");
  ASSERT_TRUE(sendNumber(grandchild, 7, 6));
  ASSERT_TRUE(child.flush());
  EXPECT_EQ(child.heard(), (std::vector<std::string>{"event 2 0 0 - Library child", "event 3 0 0 - Wire grandchild",
                                                     "event 3 7 1 1 Wire grandchild", "end"}));
  ASSERT_TRUE(server.waitForEvents(6, {7}));
}

TEST_F(Aggregation, NothingFollowsTheEndOfAStoppedAggregator) {
  start();
  auto& child = relative(2, "child", 1, true);
  auto& grandchild = relative(3, "grandchild", 2);
  ASSERT_TRUE(sendNumber(child, 7, 0));
  child.process().signal(SIGSTOP);
  for (std::int64_t n = 1; n <= 20; ++n) ASSERT_TRUE(sendNumber(grandchild, 7, n));
  auto& root = relative(1, "root", 0, true);
  for (std::int64_t n = 21; n <= 40; ++n) ASSERT_TRUE(sendNumber(grandchild, 7, n));
  ASSERT_TRUE(sendNumber(root, 7, 41));
  child.process().signal(SIGCONT);

  ASSERT_TRUE(sendNumber(child, 7, 42)) << "behind everything that waited for it";
  const Heard heard(child);
  std::vector<std::int64_t> expected(21);
  for (std::size_t n = 0; n < expected.size(); ++n) expected[n] = static_cast<std::int64_t>(n);
  EXPECT_EQ(heard.numbers(), expected);
  EXPECT_EQ(heard.ends(), 1U);
  EXPECT_TRUE(Heard::isEnd(heard.calls.back()));
  const auto numbers = Heard(root).numbers();
  ASSERT_GE(numbers.size(), 21U);
  EXPECT_EQ(numbers[0], 21);
  EXPECT_EQ(numbers[20], 41);
}

TEST_F(Aggregation, AnAggregatorThatIsKilledHoldsNobodyUp) {
  start();
  auto& parent = library(1, "parent", 0, Block::print);
  auto& child = relative(2, "child", 1, false, {{"BatchEvents", true}});
  constexpr std::int64_t kEvents = 2000;
  std::vector<std::size_t> lines;
  for (std::int64_t n = 0; n < kEvents; ++n) {
    lines.push_back(child.sendEvent(7, 1, PropertyDictionary{{"n", n}}));
    if (n == kEvents / 2) {
      ASSERT_TRUE(parent.lines().waitForPart("event 2 7 1 "));
      parent.process().signal(SIGKILL);
    }
  }
  EXPECT_FALSE(child.reply(lines.back()).empty());
  EXPECT_TRUE(flush(child)[1].isNull());
  ASSERT_TRUE(server.waitForEvents(kEvents, {7}));
  EXPECT_TRUE(parent.process().wait());
  EXPECT_EQ(child.finish(), 0);
}

TEST_F(Aggregation, AStoppedAggregatorThatIsKilledLeavesNothingBehind) {
  start();
  auto& parent = relative(1, "parent", 0, true);
  auto& child = relative(2, "child", 1);
  parent.process().signal(SIGSTOP);
  const std::string padding(60'000, 'x');
  for (std::int64_t n = 0; n < 60; ++n) child.sendEvent(7, 1, PropertyDictionary{{"n", n}, {"padding", padding}});
  ASSERT_TRUE(daemon->log().waitForPart(kProxyFailure)) << "nothing more fits";
  const std::size_t lines = daemon->log().lines().size();
  parent.process().signal(SIGKILL);
  ASSERT_TRUE(daemon->log().waitForPart("invalidateReportingSession: ReportingdSession", lines));
  ASSERT_TRUE(daemon->log().waitForPart("dealloc: ReportingdSession dealloc: 1", lines));

  ASSERT_TRUE(sendNumber(child, 7, 60));  // what was sent to the parent in vain lies behind it
  const std::size_t failures = daemon->log().count(kProxyFailure);
  ASSERT_TRUE(sendNumber(child, 7, 61));
  EXPECT_EQ(daemon->log().count(kProxyFailure), failures) << "nobody is called any more";
  ASSERT_TRUE(server.waitForEvents(62, {7}));
}

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kIsSanitized = true;  // slow, and with memory of their own in every process
#else
constexpr bool kIsSanitized = false;
#endif

std::size_t residentBytes(pid_t process) {
  std::ifstream file("/proc/" + std::to_string(process) + "/statm");
  std::size_t total = 0;
  std::size_t resident = 0;
  file >> total >> resident;
  return resident * 4096;
}

// The parent is called with the lock held that all sessions take: it must cost its child nothing but a log line.
TEST_F(Aggregation, AStoppedAggregatorDelaysNobodyAndLosesOnlyWhatDoesNotFit) {
  start();
  auto& parent = relative(1, "parent", 0, true);
  auto& child = relative(2, "child", 1, false, {{"BatchEvents", true}});
  auto& stranger = relative(3, "stranger", 0, true, {{"HierarchyToken", PropertyValue()}});
  ASSERT_TRUE(sendNumber(parent, 8, 0));
  parent.process().signal(SIGSTOP);

  constexpr std::int64_t kEvents = 10'000;
  const std::string padding(kIsSanitized ? 600 : 4000, 'x');
  const auto sendEvent = [&](std::int64_t n) {
    return child.sendEvent(7, 1, PropertyDictionary{{"n", n}, {"padding", padding}});
  };
  const std::size_t before = residentBytes(daemon->process().pid());
  std::int64_t n = 0;
  while (n < kEvents - 1) sendEvent(n++);
  EXPECT_FALSE(child.reply(sendEvent(n++)).empty()) << "all are answered while the parent stands still";
  const std::size_t after = residentBytes(daemon->process().pid());
  if (!kIsSanitized) {
    // The parent's share alone would be 40 MiB; batches and posts under way take some.
    EXPECT_LT(after, before + std::size_t{24} * 1024 * 1024);
  }
  EXPECT_TRUE(sendNumber(stranger, 7, -1)) << "nor does anybody else wait";
  EXPECT_TRUE(daemon->log().waitForPart(kProxyFailure));
  EXPECT_TRUE(flush(child)[1].isNull());
  ASSERT_TRUE(server.waitForEvents(kEvents + 1, {7})) << "the backends got every one";

  parent.process().signal(SIGCONT);
  ASSERT_TRUE(sendNumber(parent, 8, 1)) << "behind everything that waited for it";
  ASSERT_TRUE(sendNumber(child, 7, n));
  ASSERT_TRUE(sendNumber(parent, 8, n + 1));
  const auto numbers = Heard(parent).numbers();
  EXPECT_TRUE(std::is_sorted(numbers.begin() + 1, numbers.end() - 3)) << "the order is kept";
  EXPECT_GT(numbers.size(), 400U);
  EXPECT_LT(numbers.size() * padding.size(), 3 * 1024 * 1024) << "an outbox and what the socket holds";
  EXPECT_EQ(numbers[numbers.size() - 2], n) << "there is room again";
}

}  // namespace
}  // namespace velk::test
