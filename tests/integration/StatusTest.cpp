// What the daemon tells of itself, as people and scripts read it through velkreportingctl.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include "foundation/Json.h"
#include "foundation/Text.h"
#include "ipc/CborWriter.h"
#include "ipc/Limits.h"
#include "tests/integration/RawConnection.h"
#include "tests/integration/Relatives.h"

namespace velk::test {
namespace {

constexpr uid_t kNobody = 65534;
const PropertyValue kSplunk = PropertyArray{"splunk"};

class Status : public testing::Test {
 protected:
  Status() {
    // What is sent stays in the batch.
    server.setStorebag("heather", storebagWith(server, {{"event_threshold", 1000}}));
  }

  void start() { daemon = std::make_unique<Daemon>(server); }
  ControlledSession& newSession() { return *sessions.emplace_back(std::make_unique<ControlledSession>(*daemon)); }

  [[nodiscard]] PropertyDictionary status() const {
    const auto told = runControl(*daemon, {"--json", "status"});
    EXPECT_EQ(told.status, 0) << told.errors;
    const auto value = json::parse(told.output, json::Extensions::tagged);
    return value && value->dictionary() != nullptr ? *value->dictionary() : PropertyDictionary();
  }
  /// The status once `holds` is true of it: sessions that end, timers and former readers take a moment.
  template <class Holds>
  [[nodiscard]] PropertyDictionary statusWhen(Holds holds) const {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    PropertyDictionary last = status();
    while (!holds(last) && std::chrono::steady_clock::now() < deadline) last = status();
    return last;
  }
  [[nodiscard]] PropertyDictionary statusWithSessions(std::int64_t count) const {
    return statusWhen([count](const auto& told) { return integerValue(told.find("sessionCount")) == count; });
  }
  [[nodiscard]] std::string words(std::vector<std::string> arguments = {}) const {
    arguments.insert(arguments.begin(), "status");
    const auto told = runControl(*daemon, arguments);
    EXPECT_EQ(told.status, 0) << told.errors;
    return told.output;
  }
  static const PropertyDictionary& row(const PropertyDictionary& told, std::string_view list, std::size_t number = 0) {
    static const PropertyDictionary none;
    const PropertyArray* rows = told.array(list);
    return rows != nullptr && number < rows->size() ? *(*rows)[number].dictionary() : none;
  }

  ReportingServer server;
  std::unique_ptr<Daemon> daemon;
  std::vector<std::unique_ptr<ControlledSession>> sessions;
};

TEST_F(Status, OfAnEmptyDaemonIsEmpty) {
  start();
  const auto told = status();
  EXPECT_EQ(integerValue(told.find("keepAliveCount")), 0) << "the reader does not count itself";
  for (const char* count : {"sessionCount", "hierarchyCount", "helperCount"}) {
    ASSERT_NE(told.find(count), nullptr) << count;
    EXPECT_EQ(integerValue(told.find(count)), 0) << count;
  }
  for (const char* list : {"sessions", "hierarchies", "helpers", "storebags"}) {
    ASSERT_NE(told.array(list), nullptr) << list;
    EXPECT_TRUE(told.array(list)->empty()) << list;
  }
  EXPECT_TRUE(told.dictionary("activeClients")->empty());
  EXPECT_GT(integerValue(told.find("processMemory")), 0);
  EXPECT_TRUE(statusWithSessions(0).array("sessions")->empty());
  EXPECT_NE(words().find("Sessions: 0\n"), std::string::npos);
}

TEST_F(Status, IsNoMatterOfAStartForAUserWhoMayNotUseTheSocket) {
  if (geteuid() != 0) GTEST_SKIP() << "only root may be somebody else";
  start();
  ASSERT_EQ(chmod(daemon->directory().c_str(), 0755), 0);
  ASSERT_EQ(chmod(daemon->socketPath().c_str(), 0600), 0);
  const auto told = runControl(*daemon, {"status"}, kNobody);
  EXPECT_EQ(told.status, 77);
  EXPECT_NE(told.errors.find("this user may not use the daemon's socket (" + daemon->socketPath()), std::string::npos)
      << told.errors;
  EXPECT_EQ(told.errors.find("systemctl start"), std::string::npos) << told.errors;
}

TEST_F(Status, TellsSessionsTransportsAndStorebags) {
  start();
  auto& session = newSession();
  ASSERT_EQ(session.open(9, 7, {{"BatchEvents", true}}, userOf("calls"))[0], kSplunk);
  ASSERT_TRUE(sendNumber(session, 7, 1));
  const auto told = statusWithSessions(1);

  const auto& described = row(told, "sessions");
  EXPECT_EQ(integerValue(described.find("sessionID")), 7);
  EXPECT_EQ(integerValue(described.find("clientType")), 9);
  EXPECT_EQ(integerValue(described.find("clientVersion")), 3);
  EXPECT_EQ(*described.string("serviceName"), "calls");
  EXPECT_EQ(described.string("token"), nullptr);
  const auto& backend = row(described, "backends");
  EXPECT_EQ(*backend.string("name"), "splunk");
  EXPECT_EQ(integerValue(backend.find("state")), 2);
  EXPECT_GE(integerValue(backend.find("batchedEvents")), 1);
  EXPECT_GT(integerValue(backend.find("batchedBytes")), 0);
  EXPECT_EQ(integerValue(told.find("keepAliveCount")), 1);
  EXPECT_EQ(*told.dictionary("activeClients"), (PropertyDictionary{{"9", 1}}));

  const auto& helper = row(told, "helpers");
  EXPECT_EQ(integerValue(helper.find("usageCount")), 1);
  EXPECT_TRUE(helper.find("releaseInSeconds")->isNull());
  const auto& storebag = row(told, "storebags");
  EXPECT_EQ(*storebag.string("name"), "heather");
  EXPECT_EQ(*storebag.string("version"), *storebagWith(server).string("version"));
  EXPECT_EQ(*storebag.string("state"), "Fetch Successful");
  EXPECT_GE(doubleValue(storebag.find("ageSeconds")), 0.0);
  EXPECT_EQ(integerValue(storebag.find("maxAgeSeconds")), 600);

  const auto table = words();
  for (const char* part : {"Sessions: 1\n", "calls", "splunk enabled (", "Transports: 1\n", "Storebags: 1\n", "heather",
                           "Fetch Successful", "Active client types: 1\n"}) {
    EXPECT_NE(table.find(part), std::string::npos) << part << " in\n" << table;
  }
}

TEST_F(Status, ForgetsWhatHasEnded) {
  start();
  ASSERT_EQ(newSession().open(9, 7)[0], kSplunk);
  ASSERT_EQ(statusWithSessions(1).array("sessions")->size(), 1U);
  EXPECT_EQ(sessions.back()->finish(), 0);
  const auto told = statusWhen([](const auto& last) {
    const auto* helpers = last.array("helpers");
    return integerValue(last.find("sessionCount")) == 0 && integerValue(last.find("keepAliveCount")) == 1 &&
           helpers != nullptr && helpers->size() == 1 &&
           !(*helpers)[0].dictionary()->find("releaseInSeconds")->isNull();
  });
  EXPECT_EQ(integerValue(told.find("sessionCount")), 0);
  EXPECT_TRUE(told.dictionary("activeClients")->empty());
  const auto& helper = row(told, "helpers");
  EXPECT_EQ(integerValue(helper.find("usageCount")), 0);
  EXPECT_EQ(integerValue(helper.find("totalSessionsServedCount")), 1);
  EXPECT_EQ(integerValue(told.find("keepAliveCount")), 1) << "the transport keeps the session's";
  EXPECT_LE(doubleValue(helper.find("releaseInSeconds")), doubleValue(helper.find("releaseTimeout")));
}

TEST_F(Status, DrawsAHierarchyOfThreeLevels) {
  start();
  for (int level = 0; level < 3; ++level) {
    ASSERT_EQ(openRelative(newSession(), 9, 10 + level, "level" + std::to_string(level), inTree(level))[0], kSplunk);
  }
  ASSERT_EQ(newSession().open(9, 20)[0], kSplunk);
  const auto told = statusWithSessions(4);
  EXPECT_EQ(integerValue(told.find("hierarchyCount")), 1);
  const auto& hierarchy = row(told, "hierarchies");
  EXPECT_EQ(*hierarchy.string("token"), "tree");
  ASSERT_EQ(hierarchy.array("sessions")->size(), 3U);
  for (std::size_t level = 0; level < 3; ++level) {
    EXPECT_EQ((*hierarchy.array("sessions"))[level], *row(told, "sessions", level).find("sessionIDString"));
    EXPECT_EQ(integerValue(row(told, "sessions", level).find("level")), static_cast<std::int64_t>(level));
  }

  const auto tree = words({"--tree"});
  std::size_t position = 0;
  for (const char* line :
       {"token tree (3 sessions)\n", "  level 0: session 10, type 9, ", "\n    level 1: session 11, type 9, ",
        "\n      level 2: session 12, type 9, ", "without a hierarchy\n  session 20, type 9, "}) {
    position = tree.find(line, position);
    ASSERT_NE(position, std::string::npos) << line << " in\n" << tree;
  }
  EXPECT_EQ(runControl(*daemon, {"--json", "status", "--tree"}).output.substr(0, 1), "{");
}

TEST_F(Status, TakesAnEntitlementOfItsOwn) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root, to read as another user";
  Daemon::Options options;
  options.starts = false;
  daemon = std::make_unique<Daemon>(server, options);
  const std::string directory = daemon->directory() + "/config/entitlements.d";
  ASSERT_EQ(mkdir(directory.c_str(), 0755), 0);
  writeContents(directory + "/a.conf", "[com.tavrin.private.velkreportingd]\nusers = 65534\n");
  daemon->start();
  const auto refused = runControl(*daemon, {"status"}, kNobody);
  EXPECT_EQ(refused.status, 77);
  EXPECT_TRUE(refused.output.empty());
  for (const char* part : {"com.tavrin.private.velkreportingd.status", "entitlements.d", "reload"}) {
    EXPECT_NE(refused.errors.find(part), std::string::npos) << refused.errors;
  }
  const auto asJson = json::parse(runControl(*daemon, {"--json", "status"}, kNobody).errors, json::Extensions::tagged);
  ASSERT_TRUE(asJson && asJson->dictionary() != nullptr);
  EXPECT_EQ(integerValue(asJson->dictionary()->find("status")), 77);

  writeContents(directory + "/b.conf", "[com.tavrin.private.velkreportingd.status]\nusers = 65534\n");
  const std::size_t before = daemon->log().lines().size();
  daemon->process().signal(SIGHUP);
  ASSERT_TRUE(daemon->log().waitForPart("reload: ", before));
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  int allowed = -1;
  while (allowed != 0 && std::chrono::steady_clock::now() < deadline) {
    allowed = runControl(*daemon, {"status"}, kNobody).status;
  }
  EXPECT_EQ(allowed, 0);
}

TEST_F(Status, SaysWhatAUserMissesWhomTheDaemonDoesNotTake) {
  if (geteuid() != 0) GTEST_SKIP() << "needs root, to read as another user";
  start();
  const auto refused = runControl(*daemon, {"status"}, kNobody);
  EXPECT_EQ(refused.status, 69);
  for (const char* part : {"com.tavrin.private.velkreportingd ", "entitlements.d"}) {
    EXPECT_NE(refused.errors.find(part), std::string::npos) << refused.errors;
  }
}

TEST_F(Status, SaysWhatToDoWhenNoDaemonRuns) {
  start();
  EXPECT_EQ(daemon->stop(), 0);
  const auto told = runControl(*daemon, {"status"});
  EXPECT_EQ(told.status, 69);
  for (const std::string& part : {daemon->socketPath(), std::string("Start velkreportingd")}) {
    EXPECT_NE(told.errors.find(part), std::string::npos) << told.errors;
  }
}

/// Describes a session whose names and token try everything, and waits until the daemon is done with it.
[[nodiscard]] bool describe(RawConnection& connection, int number, const std::string& name) {
  std::vector<std::uint8_t> body;
  CborWriter writer(body, ipc::kMaximumFrameBytes);
  writer.beginArray(5);
  writer.integer(1);
  writer.value(PropertyDictionary{{"ComponentType", 40},
                                  {"ClientVersion", name},
                                  {"SessionID", number},
                                  {"HierarchyToken", PropertyDictionary{{"token", name}, {"level", number}}}});
  writer.value(PropertyDictionary{{"_clientName", name}, {"_serviceName", PropertyDictionary{{"no", "text"}}}});
  writer.null();
  writer.boolean(false);
  return connection.send(RawConnection::frame(FrameKind::call, 1, std::string(body.begin(), body.end()))) &&
         connection.receive().has_value();
}

TEST_F(Status, ListsTwoHundredSessions) {
  constexpr int kSessions = 200;
  start();
  std::vector<std::unique_ptr<RawConnection>> connections;
  for (int number = 1; number <= kSessions; ++number) {
    connections.push_back(std::make_unique<RawConnection>(*daemon));
    ASSERT_TRUE(describe(*connections.back(), number, "client" + std::to_string(number)));
  }
  const auto told = statusWithSessions(kSessions);
  ASSERT_EQ(told.array("sessions")->size(), static_cast<std::size_t>(kSessions));
  EXPECT_EQ(integerValue(told.find("keepAliveCount")), kSessions);
  for (int number = 1; number <= kSessions; ++number) {
    const auto& session = row(told, "sessions", static_cast<std::size_t>(number - 1));
    EXPECT_EQ(*session.string("clientName"), "client" + std::to_string(number));
  }
  EXPECT_EQ(told.array("hierarchies")->size(), static_cast<std::size_t>(kSessions));
  const auto table = words();
  EXPECT_NE(table.find("Sessions: 200\n"), std::string::npos);
  EXPECT_NE(table.find("client200"), std::string::npos);
  EXPECT_EQ(table.find("not shown"), std::string::npos);
  for (auto& connection : connections) connection->close();
  EXPECT_EQ(integerValue(statusWithSessions(0).find("sessionCount")), 0);
}

TEST_F(Status, StaysReadableWhateverClientsCallThemselves) {
  start();
  std::vector<std::unique_ptr<RawConnection>> connections;
  const std::string name = "\x1b[2J\nSessions: 0\u009b31m\u202e\u2028\x7f" + std::string(100'000, 'x');
  for (int number = 1; number <= 10; ++number) {
    connections.push_back(std::make_unique<RawConnection>(*daemon));
    ASSERT_TRUE(describe(*connections.back(), number, name));
  }
  ASSERT_EQ(statusWithSessions(10).array("sessions")->size(), 10U);
  const auto asJson = runControl(*daemon, {"--json", "status"}).output;
  for (const auto& text : {words(), words({"--tree"}), asJson}) {
    EXPECT_LT(text.size(), 20'000U);
    EXPECT_EQ(text.find("\nSessions: 0"), std::string::npos);
    for (const char* sign : {"\x1b", "\x7f", "\u009b", "\u2028"}) EXPECT_EQ(text.find(sign), std::string::npos) << text;
  }
  for (const auto line : split(words(), '\n')) EXPECT_LT(line.size(), 200U);
}

TEST_F(Status, IsThereWhileManyComeAndGo) {
  start();
  for (int round = 0; round < 20; ++round) {
    std::vector<std::unique_ptr<RawConnection>> connections;
    for (int number = 1; number <= 10; ++number) {
      connections.push_back(std::make_unique<RawConnection>(*daemon));
      ASSERT_TRUE(describe(*connections.back(), number, "coming and going"));
    }
    connections.resize(5);
    const auto told = status();
    const auto count = integerValue(told.find("sessionCount"));
    EXPECT_GE(count, 5);
    EXPECT_EQ(told.array("sessions")->size(), static_cast<std::size_t>(count));
  }
  // Their transport keeps what they held until nobody has used it for a while.
  const auto told = statusWhen([](const auto& last) {
    const auto* helpers = last.array("helpers");
    return integerValue(last.find("sessionCount")) == 0 && integerValue(last.find("keepAliveCount")) == 200 &&
           helpers != nullptr && helpers->size() == 1 &&
           integerValue((*helpers)[0].dictionary()->find("totalSessionsServedCount")) == 200;
  });
  EXPECT_EQ(integerValue(told.find("sessionCount")), 0);
  EXPECT_EQ(integerValue(row(told, "helpers").find("totalSessionsServedCount")), 200);
  EXPECT_EQ(integerValue(told.find("keepAliveCount")), 200);
  EXPECT_EQ(daemon->stop(), 0);
}

}  // namespace
}  // namespace velk::test
