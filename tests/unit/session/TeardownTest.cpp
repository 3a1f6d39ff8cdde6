#include <algorithm>

#include "backends/MemoryEstimate.h"
#include "session/Health.h"
#include "tests/unit/session/SessionFixture.h"

namespace velk::test {
namespace {

using namespace session_texts;

class TeardownTest : public SessionTest {
 protected:
  /// The payload of the health message that "splunk" got last.
  [[nodiscard]] PropertyDictionary health() {
    const auto& sent = backend("splunk").sent;
    if (sent.empty() || sent.back().respCode != 1) {
      ADD_FAILURE() << "no health message";
      return {};
    }
    return *sent.back().message->dictionary("ClientData");
  }
  [[nodiscard]] std::int64_t number(const PropertyDictionary& report, std::string_view key) const {
    return report.contains(key) ? integerValue(report.find(key)) : -1;
  }
  [[nodiscard]] std::string key(std::string_view name, std::int32_t clientType) const {
    return std::string(name) + "_" + std::string(healthShortCode(clientType));
  }
};

TEST_F(TeardownTest, GracefulFinishSendsAndFlushesNothing) {
  start({"splunk"});
  session->finishSessionGracefully();
  EXPECT_TRUE(journal.entries().empty());
  EXPECT_EQ(recordedLog.count("finishSessionGracefully: Session 7 has been finished gracefully"), 1);
}

TEST_F(TeardownTest, ReportsWhetherItEndedGracefully) {
  start({"splunk"});
  session->teardown();
  EXPECT_EQ(health().find("GracefulTermination")->boolean()[0], false);
  EXPECT_EQ(*health().string("StorebagVersion"), "5");

  session = makeSession(connection);
  start({"splunk"});
  session->finishSessionGracefully();
  session->teardown();
  EXPECT_EQ(health().find("GracefulTermination")->boolean()[0], true);
}

TEST_F(TeardownTest, WithoutAStorebagVersionBothKeysAreMissing) {
  delegate.version = std::nullopt;
  start({"splunk"});
  session->finishSessionGracefully();
  session->teardown();
  EXPECT_FALSE(health().contains("StorebagVersion"));
  EXPECT_FALSE(health().contains("GracefulTermination"));
}

TEST_F(TeardownTest, CountsTheLiveSessionsAndTheEndingOneInAddition) {
  start({"splunk"}, {{kVelkReportingSessionInfoClientType, 9}});
  backend("splunk").batchedSize = 100;
  delegate.state.sessions.push_back(session);
  session = makeSession(connection);
  start({"splunk"}, {{kVelkReportingSessionInfoClientType, 8}});
  backend("splunk").batchedSize = 7;
  delegate.state.sessions.push_back(session);
  delegate.state.cachedStorebags = PropertyDictionary{{"bag", PropertyDictionary{{"a", "text"}}}};
  fakes.process.memory = 4096;

  session->teardown();
  const auto report = health();
  const std::int64_t storebags = memoryEstimate(delegate.state.cachedStorebags);
  EXPECT_EQ(number(report, key("SessionsCount", 9)), 1);
  EXPECT_EQ(number(report, key("BatchSize", 9)), 100);
  EXPECT_EQ(number(report, key("SessionsCount", 8)), 2);
  EXPECT_EQ(number(report, key("BatchSize", 8)), 14);
  EXPECT_EQ(number(report, "StorebagsCount"), 1);
  EXPECT_EQ(number(report, "StorebagsSize"), storebags);
  EXPECT_EQ(number(report, "CalculatedMemoryUsage"), 114 + storebags);
  EXPECT_EQ(number(report, "ProcessMemoryUsage"), 4096);
}

TEST_F(TeardownTest, LeavesOutConnectionsThatWereNeverDescribed) {
  start({"splunk"});
  delegate.state.sessions = {session, makeSession(std::make_shared<FakeConnection>())};
  session->teardown();
  const auto report = health();
  EXPECT_EQ(number(report, key("SessionsCount", 8)), 2);
  EXPECT_FALSE(report.contains("SessionsCount_Unknown"));
}

TEST_F(TeardownTest, MakesNoHealthMessageThatIsNotSent) {
  session->teardown();
  session = makeSession(connection);
  describe();
  session->teardown();
  EXPECT_EQ(delegate.stateCopies, 0);
}

TEST_F(TeardownTest, SumsTheBackendsOfASession) {
  start({"splunk", "korrin"});
  backend("splunk").batchedSize = 3;
  backend("korrin").batchedSize = 4;
  PropertyDictionary report;
  EXPECT_EQ(addSessionHealthInfo(*session, report), 7U);
  EXPECT_EQ(number(report, key("BatchSize", 8)), 7);
}

TEST_F(TeardownTest, ClientTypesOutsideTheTableCountAsUnknown) {
  PropertyDictionary report;
  for (const int clientType : {4, 31}) {
    describe({{kVelkReportingSessionInfoClientType, clientType}});
    addSessionHealthInfo(*session, report);
  }
  EXPECT_EQ(number(report, "SessionsCount_Unknown"), 2);
  EXPECT_EQ(number(report, "BatchSize_Unknown"), 0);
}

TEST_F(TeardownTest, KeepsItsOrder) {
  start({"splunk", "korrin"}, {}, userNamed("a", "b"));
  recordedLog.clear();
  session->teardown();
  EXPECT_EQ(journal.entries(),
            (std::vector<std::string>{"send splunk 0/1", "send korrin 0/1", "flush splunk", "flush korrin",
                                      "releaseHelper a:b", "cleanup splunk", "cleanup korrin"}));
  std::vector<std::string> lines;
  for (const auto& line : recordedLog.lines()) lines.push_back(line.text);
  const std::vector<std::string> expected{"dealloc: ReportingdSession dealloc: 7",
                                          "internalSendMessage: Sent internal message (method:0 respCode:1)",
                                          "flushMessagesWithCompletion: Flushing messages for session 7",
                                          "shutdownSessionAggregation: Disable aggregation module for session 7",
                                          "ReportingdSession dealloc: incrementing total sessions count for session 7"};
  ASSERT_GE(lines.size(), expected.size());
  lines.resize(expected.size());  // the helper has its own to say
  EXPECT_EQ(lines, expected);
}

TEST_F(TeardownTest, SessionWithAHelperLeavesItsReferenceToIt) {
  start({"splunk"}, {}, userNamed("a", "b"));
  session->teardown();
  EXPECT_EQ(journal.count("releaseIPCTransactions 1"), 0);
  EXPECT_EQ(integerValue(delegate.helper("a:b")->status().find("totalSessionsServedCount")), 1);
}

TEST_F(TeardownTest, SessionWithoutAHelperGivesOneReferenceBack) {
  start({"splunk"});
  session->teardown();
  EXPECT_EQ(journal.count("releaseIPCTransactions 1"), 1);
  EXPECT_EQ(recordedLog.count("ReportingdSession dealloc: release IPC transaction for session without connectivity "
                              "helper for session 7"),
            1);
}

TEST_F(TeardownTest, SessionThatWasNeverDescribedGivesOneReferenceBackAndSendsNothing) {
  session->teardown();
  EXPECT_EQ(journal.entries(), std::vector<std::string>{"releaseIPCTransactions 1"});
  EXPECT_EQ(recordedLog.count("dealloc: ReportingdSession dealloc: 0"), 1);
}

TEST_F(TeardownTest, RunsOnce) {
  start({"splunk"});
  session->teardown();
  session->teardown();
  session.reset();
  EXPECT_EQ(journal.count("releaseIPCTransactions 1"), 1);
  EXPECT_EQ(journal.count("cleanup splunk"), 1);
  EXPECT_EQ(journal.count("send splunk 0/1"), 1);
}

TEST_F(TeardownTest, LetsGoOfEverything) {
  start({"splunk"}, {}, userNamed("a", "b"), true);
  const std::weak_ptr<FakeConnection> weakConnection = connection;
  session->teardown();
  connection.reset();
  EXPECT_TRUE(weakConnection.expired());
  EXPECT_EQ(session->backends(), nullptr);
  EXPECT_FALSE(session->userInfo().has_value());
  EXPECT_FALSE(session->hierarchyToken().has_value());
}

TEST_F(TeardownTest, AggregatingSessionTellsItsClientThatItEnds) {
  start({"splunk"}, {}, std::nullopt, true);
  session->teardown();
  EXPECT_TRUE(connection->calls().back().isEndMarker());
}

TEST_F(TeardownTest, InvalidateEndsTheConnectionOnce) {
  session->invalidate();
  session->invalidate();
  EXPECT_EQ(connection->invalidations, 1);
  session->teardown();
}

TEST_F(TeardownTest, LastReferenceInAHealthSnapshotTearsNothingDown) {
  start({"splunk"});
  delegate.state.sessions.push_back(session);
  session = makeSession(connection);
  describe();
  journal.clear();
  delegate.state.sessions.clear();  // the last reference of the first session
  EXPECT_TRUE(journal.entries().empty());
}

}  // namespace
}  // namespace velk::test
