#include "daemon/StatusReport.h"

#include <gtest/gtest.h>

#include <future>

#include "foundation/Text.h"
#include "ipc/CborWriter.h"
#include "ipc/Limits.h"
#include "tests/unit/daemon/AgentFixture.h"

namespace velk::test {
namespace {

class StatusReportTest : public AgentFixture {
 protected:
  static const PropertyDictionary& row(const PropertyDictionary& status, std::string_view list, std::size_t number) {
    return *(*status.array(list))[number].dictionary();
  }
  static CborWriter::Fault faultOf(const PropertyDictionary& status) {
    std::vector<std::uint8_t> bytes;
    CborWriter writer(bytes, ipc::kMaximumFrameBytes);
    writer.beginArray(1);
    writer.value(status);
    return writer.fault();
  }
};

TEST_F(StatusReportTest, TellsSessionsInTheOrderOfTheirCreation) {
  create()->number = 5;
  create()->number = 3;
  const auto status = agent->copyStatus();
  EXPECT_EQ(integerValue(status.find("sessionCount")), 2);
  EXPECT_EQ(integerValue(row(status, "sessions", 0).find("sessionID")), 5);
  EXPECT_EQ(integerValue(row(status, "sessions", 1).find("sessionID")), 3);
  EXPECT_FALSE(status.string("version")->empty());
}

TEST_F(StatusReportTest, TellsHierarchiesInTheOrderOfTheirRegistration) {
  for (const char* identifier : {"A", "B", "C"}) {
    const auto session = create();
    session->token = "tree";
    session->idString = identifier;
    agent->updateCorrelatedSessions(*session);
  }
  agent->updateCorrelatedSessions(*made.front());
  const auto status = agent->copyStatus();
  EXPECT_EQ(integerValue(status.find("hierarchyCount")), 1);
  EXPECT_EQ(*status.array("hierarchies"),
            (PropertyArray{PropertyDictionary{
                {"token", "tree"}, {"sessionCount", 3}, {"sessions", PropertyArray{"B", "C", "A"}}}}));
}

TEST_F(StatusReportTest, TellsNothingOfAReaderThatDescribedNoSession) {
  create();
  const auto reader = create();
  auto status = agent->copyStatus(reader.get());
  EXPECT_EQ(integerValue(status.find("sessionCount")), 1);
  EXPECT_EQ(status.array("sessions")->size(), 1U);
  EXPECT_EQ(integerValue(status.find("keepAliveCount")), 1);
  reader->info = PropertyDictionary{{kVelkReportingSessionInfoClientType, 9}};
  status = agent->copyStatus(reader.get());
  EXPECT_EQ(integerValue(status.find("sessionCount")), 2);
  EXPECT_EQ(status.array("sessions")->size(), 2U);
  EXPECT_EQ(integerValue(status.find("keepAliveCount")), 2);
}

TEST_F(StatusReportTest, TellsTransportsWithTheirUsersAndTimers) {
  const auto helpers = std::make_shared<SharedConnectivityHelpers>(fakes.platform());
  const auto told = [&] {
    fakes.scheduler.runUntilIdle();
    return statusReport({}, nullptr, *helpers, 0);
  };
  const PropertyDictionary user{{kVelkReportingUserInfoClientName, "Media"}};
  EXPECT_NE(helpers->request(user, 4, {}), nullptr);
  auto status = told();
  EXPECT_EQ(integerValue(status.find("helperCount")), 1);
  EXPECT_EQ(*row(status, "helpers", 0).string("key"), "media:");
  EXPECT_EQ(integerValue(row(status, "helpers", 0).find("usageCount")), 1);
  EXPECT_TRUE(row(status, "helpers", 0).find("releaseInSeconds")->isNull());
  helpers->release(user);
  status = told();
  EXPECT_EQ(integerValue(row(status, "helpers", 0).find("usageCount")), 0);
  EXPECT_EQ(doubleValue(row(status, "helpers", 0).find("releaseInSeconds")), 30.0);
  fakes.scheduler.advance(std::chrono::seconds(31));
  EXPECT_EQ(integerValue(told().find("helperCount")), 0);
}

TEST_F(StatusReportTest, AsksNobodyWithTheAgentsLockHeld) {
  const auto session = create();
  int asked = 0;
  session->whenAskedForStatus = [&] {
    ++asked;
    auto elsewhere = std::async(std::launch::async, [&] { Guard guard(agent->monitor()); });
    ASSERT_EQ(elsewhere.wait_for(std::chrono::seconds(60)), std::future_status::ready);
  };
  static_cast<void>(agent->copyStatus());
  EXPECT_EQ(asked, 1);
}

TEST_F(StatusReportTest, LetsGoOfASessionThatEndsMeanwhileWithoutEndingItAndWithoutTheLock) {
  auto session = create();
  std::weak_ptr<FakeReportingdSession> observed = session;
  bool wasLocked = true;
  std::shared_ptr<void> lastWords(nullptr, [&](void*) {
    auto elsewhere = std::async(std::launch::async, [&] {
      Guard guard(agent->monitor());
      wasLocked = false;
    });
    elsewhere.wait();
  });
  int teardowns = -1;
  session->whenAskedForStatus = [&, lastWords = std::move(lastWords)] {
    const auto ending = observed.lock();
    agent->invalidateReportingSession(ending);
    made.clear();
    teardowns = ending->teardowns;
  };
  session.reset();
  static_cast<void>(agent->copyStatus());
  EXPECT_TRUE(observed.expired());
  EXPECT_FALSE(wasLocked);
  EXPECT_EQ(teardowns, 0);
}

TEST_F(StatusReportTest, CutsTextsBetweenCharacters) {
  const auto session = create();
  const std::string text(kMaximumStatusTextBytes - 1, 'x');
  session->status = {{"fits", text + "y"}, {"long", text + "\u00e4" + text}, {"list", PropertyArray{text + text}}};
  const auto status = agent->copyStatus();
  EXPECT_EQ(*row(status, "sessions", 0).string("fits"), text + "y");
  EXPECT_EQ(*row(status, "sessions", 0).string("long"), text + "\u2026");
  EXPECT_EQ((*row(status, "sessions", 0).array("list"))[0], PropertyValue(text + "x\u2026"));
}

TEST_F(StatusReportTest, SaysSoWhereAConfigurationHoldsNoText) {
  create()->status = {{"clientName", "\xff\xfe"}};
  const auto status = agent->copyStatus();
  EXPECT_EQ(*row(status, "sessions", 0).string("clientName"), "(not text)");
  EXPECT_EQ(faultOf(status), CborWriter::Fault::none);
}

TEST_F(StatusReportTest, FitsIntoAFrameWhateverClientsDo) {
  const std::string longText(10'000, 'x');
  PropertyArray backends;
  for (int number = 0; number < 8; ++number) {
    backends.append(PropertyDictionary{{"name", longText}, {"state", 2}, {"batchedEvents", 1}, {"batchedBytes", 1}});
  }
  for (int number = 0; number < 3000; ++number) {
    const auto session = create();
    session->status = {{"sessionID", number}, {"clientName", longText}, {"backends", backends}};
    session->token = longText + std::to_string(number);
    agent->updateCorrelatedSessions(*session);
    session->user = PropertyDictionary{{kVelkReportingUserInfoClientName, longText + std::to_string(number)}};
    EXPECT_NE(agent->copySharedConnectivityHelperForReportingSession(*session, 4), nullptr);
  }
  const auto status = agent->copyStatus();
  EXPECT_EQ(faultOf(status), CborWriter::Fault::none);
  EXPECT_EQ(integerValue(status.find("sessionCount")), 3000);
  EXPECT_EQ(integerValue(status.find("hierarchyCount")), 3000);
  EXPECT_EQ(integerValue(status.find("helperCount")), 3000);
  for (const char* list : {"sessions", "hierarchies", "helpers"}) {
    EXPECT_GT(status.array(list)->size(), 100U) << list;
    EXPECT_LT(status.array(list)->size(), 3000U) << list;
  }
}

TEST_F(StatusReportTest, FitsIntoAFrameWithManySmallValues) {
  PropertyArray backends;
  for (int number = 0; number < 60; ++number) backends.append(PropertyDictionary{{"s", 2}, {"b", 1}});
  for (int number = 0; number < 1000; ++number) create()->status = {{"n", number}, {"backends", backends}};
  const auto status = agent->copyStatus();
  EXPECT_EQ(faultOf(status), CborWriter::Fault::none);
  EXPECT_LT(status.array("sessions")->size(), 1000U);
}

TEST_F(StatusReportTest, HasRoomForAThousandOrdinarySessions) {
  for (int number = 0; number < 1000; ++number) {
    create()->status = {
        {"sessionID", number},
        {"sessionIDString", std::string(24, 'x')},
        {"described", true},
        {"clientType", 9},
        {"clientVersion", 3},
        {"clientName", "Media Services"},
        {"serviceName", "Conferencing"},
        {"level", 1},
        {"token", std::string(36, 'x')},
        {"counted", true},
        {"finished", false},
        {"hasAggregator", false},
        {"backends", PropertyArray{PropertyDictionary{
                         {"name", "splunk"}, {"state", 2}, {"batchedEvents", 1}, {"batchedBytes", 9}}}}};
  }
  EXPECT_EQ(agent->copyStatus().array("sessions")->size(), 1000U);
}

}  // namespace
}  // namespace velk::test
