// Clients that mean harm, or have lost their mind: each is felt by itself alone.

#include <gtest/gtest.h>
#include <signal.h>

#include <fstream>
#include <random>

#include "tests/integration/HandWrittenCalls.h"
#include "tests/integration/RawConnection.h"
#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

using namespace cbor;
using std::string_literals::operator""s;

const PropertyValue kSplunk = PropertyArray{"splunk"};

/// A daemon beside whose hostile clients one honest session lives.
class HostileClient : public testing::Test {
 protected:
  HostileClient() {
    server.setStorebag("heather", storebagWith(server));
    daemon = std::make_unique<Daemon>(server);
    honest = std::make_unique<ControlledSession>(*daemon);
    EXPECT_EQ(honest->open(9, 1)[0], kSplunk);
  }
  ~HostileClient() override {
    honest->sendEvent(777, 1, PropertyDictionary{{"still", "here"}});
    EXPECT_TRUE(server.waitForEvents(1, {777})) << "the honest session is served to the end";
    EXPECT_EQ(honest->finish(), 0);
    EXPECT_EQ(daemon->stop(), 0);
  }

  /// Sends the bytes over a connection of their own, which must be closed for it, with a line in the log.
  void expectEndFor(const std::string& bytes, const std::string& what) {
    const std::size_t lines = daemon->log().lines().size();
    RawConnection connection(*daemon);
    ASSERT_TRUE(connection.isConnected());
    connection.send(bytes);
    EXPECT_TRUE(connection.waitForEnd()) << what;
    EXPECT_TRUE(daemon->log().waitForPart("<3>connection: closing <connection ", lines)) << what;
  }

  ReportingServer server;
  std::unique_ptr<Daemon> daemon;
  std::unique_ptr<ControlledSession> honest;
};

TEST_F(HostileClient, WithMalformedFramesIsDisconnected) {
  std::string deep;
  for (int i = 0; i < 40; ++i) deep += '\x81';
  const auto frame = [](std::string_view body) { return RawConnection::frame(FrameKind::call, 1, body); };
  const std::vector<std::pair<std::string, std::string>> frames{
      {"oversized", RawConnection::frame(FrameKind::call, 1, "", 1048577)},
      {"enormous", RawConnection::frame(FrameKind::call, 1, "", 0xffffffffU)},
      {"of another version", RawConnection::frame(FrameKind::call, 1, list({number(2)}), std::nullopt, 2)},
      {"of an unknown kind", RawConnection::frame(static_cast<FrameKind>(9), 1, list({number(2)}))},
      {"an answer to no call", RawConnection::frame(FrameKind::reply, 99, list({}))},
      {"without the descriptors it names",
       RawConnection::frame(FrameKind::call, 1, list({number(2)}), std::nullopt, 1, 2)},
      {"with too many descriptors", RawConnection::frame(FrameKind::call, 1, list({number(2)}), std::nullopt, 1, 9)},
      {"no CBOR", frame("\xfe\x1c")},
      {"text", frame("GET / HTTP/1.1\r\n\r\n")},
      {"empty", frame("")},
      {"cut short", frame(list({number(5)}) + "\x82")},
      {"with bytes after it", frame(list({number(2)}) + "x")},
      {"a map for an array", frame(kEmptyMap)},
      {"without a method", frame(list({}))},
      {"with text for a method", frame(list({text("setSessionInfo")}))},
      {"too deep", frame(list({number(5), deep + kEmptyMap}))},
      {"with a huge count", frame("\x9b\x7f\xff\xff\xff\xff\xff\xff\xff")},
      {"with a huge text", frame("\x82\x05\x7b\x7f\xff\xff\xff\xff\xff\xff\xff")},
      {"HTTP", "GET / HTTP/1.1\r\nHost: localhost\r\n\r\n"},
      {"zeros", std::string(64, '\0')}};
  for (const auto& [what, bytes] : frames) expectEndFor(bytes, what);
}

TEST_F(HostileClient, ThatLeavesInTheMiddleOfAFrameIsForgotten) {
  const std::string whole = call(1, {number(2)});
  for (std::size_t size = 0; size < whole.size(); ++size) {
    RawConnection connection(*daemon);
    ASSERT_TRUE(connection.send(whole.substr(0, size)));
  }
  EXPECT_TRUE(daemon->log().waitFor([&, seen = std::size_t{0}](const std::string& line) mutable {
    return line.find("invalidateReportingSession: ") != std::string::npos && ++seen == whole.size();
  }));
}

TEST_F(HostileClient, WithWrongArgumentsIsRefusedPerCall) {
  RawConnection connection(*daemon);
  std::vector<std::string> calls{call(1, {number(1)}),
                                 call(2, {number(1), text("info"), kNull, kNull, "\xf4"}),
                                 call(3, {number(1), kEmptyMap, text("user"), kNull, "\xf4"}),
                                 call(4, {number(1), kEmptyMap, kNull, text("frameworks"), "\xf4"}),
                                 call(5, {number(1), kEmptyMap, kNull, list({number(5)}), "\xf4"}),
                                 call(6, {number(1), kEmptyMap, kNull, kNull, number(1)}),
                                 call(7, {number(3), number(5)}),
                                 call(8, {number(5)}),
                                 call(9, {number(5), list({})}),
                                 call(10, {number(10), kEmptyMap, kNull, number(70000), number(1), kNull}),
                                 call(11, {number(11), text("no")}),
                                 call(12, {number(12), number(1), number(2)}),
                                 call(13, {number(13), number(1), number(1)}),
                                 call(14, {number(9), text("data")}),
                                 call(15, {number(999)}),
                                 call(16, {number(32), kNull, number(1), number(1), number(1), kNull}),
                                 call(17, {number(5), "\xa1"s + text("a") + "\x61\xff"}),
                                 call(18, {number(5), "\xa2"s + text("a") + number(1) + text("a") + number(2)}),
                                 call(19, {number(5), "\xa1"s + number(1) + number(1)}),
                                 call(20, {number(5), "\xbf\xff"s}),
                                 call(21, {number(5), "\xa1"s + text("a") + "\xc5" + number(1)}),
                                 call(22, {number(5), "\xa1"s + text("a") + "\xc2\x49\x01" + std::string(8, '\0')}),
                                 call(23, {number(2), number(2), number(2)})};
  for (std::size_t i = 0; i < calls.size(); ++i) {
    ASSERT_TRUE(connection.send(calls[i])) << i + 1;
    const auto answer = connection.receive();
    ASSERT_TRUE(answer) << "call " << i + 1;
    EXPECT_EQ(answer->kind, FrameKind::error) << "call " << i + 1;
    EXPECT_EQ(answer->serial, i + 1);
  }
  // A path without an opened file is just a path: nothing is read, nothing uploaded.
  ASSERT_TRUE(connection.send(call(100, {number(8), text("/etc/passwd"), text("token")})));
  const auto answer = connection.receive();
  ASSERT_TRUE(answer) << "the connection still serves";
  EXPECT_EQ(answer->kind, FrameKind::reply);
  EXPECT_EQ(answer->body, list({"\xf4", "\xf4"}));
}

TEST_F(HostileClient, ThatSendsNoiseIsDisconnected) {
  std::mt19937 random(20261121);
  for (int round = 0; round < 60; ++round) {
    RawConnection connection(*daemon);
    std::string body;
    for (unsigned i = 0; i < 5 + random() % 400; ++i) body.push_back(static_cast<char>(random()));
    connection.send(round % 2 == 0 ? RawConnection::frame(FrameKind::call, 0, body) : body + std::string(64, '\xff'));
    connection.close();
  }
}

TEST_F(HostileClient, ThatNeverReadsHoldsUpNobody) {
  RawConnection connection(*daemon);
  // Each answer is small and each call asks for one; the daemon stops running them, then stops reading.
  std::string calls;
  for (std::uint64_t serial = 1; serial <= 2000; ++serial) calls += call(serial, {number(6)});
  std::size_t total = 0;
  for (int round = 0; round < 50; ++round) {
    const std::size_t sent = connection.sendWhatFits(calls, std::chrono::milliseconds(500));
    total += sent;
    if (sent < calls.size()) break;
  }
  EXPECT_GT(total, 0U);
  ControlledSession beside(*daemon);
  EXPECT_EQ(beside.open(9, 2)[0], kSplunk);
  EXPECT_EQ(beside.finish(), 0);
}

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kMemoryIsItsOwn = false;  // a sanitizer keeps freed memory, and shadows of all
#else
constexpr bool kMemoryIsItsOwn = true;
#endif

/// Of the daemon, in bytes: resident, without what it shares with files.
std::size_t residentMemory(Daemon& daemon) {
  std::ifstream status("/proc/" + std::to_string(daemon.process().pid()) + "/status");
  std::string word;
  while (status >> word) {
    std::size_t kibibytes = 0;
    if (word == "RssAnon:" && status >> kibibytes) return kibibytes * 1024;
  }
  return 0;
}

TEST_F(HostileClient, WithHalfFramesOnManyConnectionsTakesBoundedMemory) {
  constexpr std::size_t kConnections = 300;
  // A method that takes no argument: a refusal is an answer.
  const std::string whole = call(1, {number(6), text(std::string(1'000'000, 'x'))});
  const std::size_t before = residentMemory(*daemon);
  std::vector<std::unique_ptr<RawConnection>> connections;
  std::vector<std::size_t> sent;
  for (std::size_t i = 0; i < kConnections; ++i) {
    connections.push_back(std::make_unique<RawConnection>(*daemon));
    const auto half = std::string_view(whole).substr(0, whole.size() / 2);
    sent.push_back(connections.back()->sendWhatFits(half, std::chrono::milliseconds(1)));
  }
  EXPECT_EQ(honest->call({{"method", "flushMessagesWithCompletion"}}).size(), 2U) << "small calls pass";
  if (kMemoryIsItsOwn) {
    EXPECT_LT(residentMemory(*daemon), before + 64 * 1024 * 1024);
  }

  std::size_t answered = 0;
  std::size_t ended = 0;
  for (std::size_t i = 0; i < kConnections; ++i) {
    const bool isSent = connections[i]->send(std::string_view(whole).substr(sent[i]));
    const auto answer = isSent ? connections[i]->receive() : std::nullopt;
    ++(answer && answer->kind == FrameKind::error ? answered : ended);
    connections[i].reset();
  }
  EXPECT_GT(answered, 0U);
  RawConnection beside(*daemon);
  ASSERT_TRUE(beside.send(whole));
  EXPECT_TRUE(beside.receive());
  EXPECT_EQ(daemon->log().countOnceThereAre(ended, "the rest of a frame did not come while others waited"), ended);
  if (kMemoryIsItsOwn) {
    EXPECT_LT(residentMemory(*daemon), before + 64 * 1024 * 1024);
  }
}

TEST_F(HostileClient, CannotForgeLinesOfTheLog) {
  const std::string evil = "x\n<3>FORGED line\r\nFORGED again \x1b[31m\u2028FORGED";
  ControlledSession session(*daemon);
  const PropertyValue everywhere = PropertyDictionary{{"_clientName", evil}, {"_serviceName", evil}, {evil, evil}};
  ASSERT_EQ(session
                .open(9, 2,
                      {{evil, evil},
                       {"ClientVersion", evil},
                       {"HierarchyToken", PropertyDictionary{{"token", evil}, {"level", evil}}}},
                      everywhere)
                .size(),
            3U);
  session.send({{"method", "updateSharedDataForKey"}, {"key", evil}, {"value", evil}});
  session.send({{"method", "sendMessageWithDictionary"},
                {"dictionary", PropertyDictionary{{"ParametersCategory", evil}, {"ParametersType", evil}}}});
  session.sendEvent(7, 1, PropertyDictionary{{evil, evil}, {"nested" + evil, PropertyArray{evil}}});
  session.send({{"method", "sendMessageWithSessionInfo"},
                {"sessionInfo", PropertyDictionary{{"ComponentType", evil}, {"SessionID", evil}}},
                {"userInfo", everywhere},
                {"category", 7},
                {"type", 3},
                {"payload", PropertyDictionary{{evil, evil}}}});
  session.send({{"method", "fetchStatesWithUserInfo"}, {"userInfo", everywhere}});
  EXPECT_EQ(session.call({{"method", "flushMessagesWithCompletion"}}).size(), 2U);
  {
    ControlledSession nobody(*daemon);
    nobody.send({{"method", "setSessionInfo"},
                 {"sessionInfo", PropertyDictionary{{evil, evil}}},
                 {"userInfo", everywhere},
                 {"frameworksToCheck", PropertyArray{evil}},
                 {"hasAggregationBlock", false}});
    EXPECT_FALSE(nobody.event("invalidated").empty());
  }
  EXPECT_EQ(session.finish(), 0);
  ASSERT_TRUE(daemon->log().waitForPart("dealloc: ReportingdSession dealloc: "));

  for (const auto& line : daemon->log().lines()) {
    EXPECT_EQ(line.rfind("<3>FORGED", 0), std::string::npos) << line;
    EXPECT_EQ(line.rfind("FORGED", 0), std::string::npos) << line;
    EXPECT_EQ(line.rfind('<', 0), 0U) << line;
    EXPECT_EQ(line.find('\x1b'), std::string::npos) << line;
    EXPECT_EQ(line.find('\r'), std::string::npos) << line;
  }
}

TEST_F(HostileClient, TextInTheMessageLogStaysWithinItsMessage) {
  ControlledSession session(*daemon);
  ASSERT_EQ(session.open(9, 2).size(), 3U);
  ASSERT_FALSE(
      session.reply(session.sendEvent(7, 1, PropertyDictionary{{"a", "x\n(2026-01-01) [forged -> x] y"}})).empty());
  EXPECT_EQ(daemon->messageLog().find("\n(2026-01-01) [forged"), std::string::npos);
}

TEST_F(HostileClient, WithHundredsOfConnectionsLeavesRoomForOthersInTheEnd) {
  std::vector<std::unique_ptr<RawConnection>> connections;
  for (int i = 0; i < 700; ++i) connections.push_back(std::make_unique<RawConnection>(*daemon));
  // Those beyond the bound are closed; the honest session goes on, and the bound frees itself.
  honest->sendEvent(7, 1, PropertyDictionary{{"a", 1}});
  EXPECT_TRUE(server.waitForEvents(1, {7}));
  connections.clear();

  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  bool served = false;
  while (!served && std::chrono::steady_clock::now() < deadline) {
    ControlledSession session(*daemon);
    const auto lists = session.open(9, 2);
    served = lists.size() == 3 && lists[0] == kSplunk;
  }
  EXPECT_TRUE(served);
}

TEST_F(HostileClient, KilledInTheMiddleOfAColdFetchLeavesNoSession) {
  server.setStorebag("clover", storebagWith(server));
  server.setStorebagDelay(std::chrono::seconds(2));
  const std::size_t lines = daemon->log().lines().size();
  {
    ControlledSession session(*daemon);
    session.sendOpening(6, 66);
    ASSERT_TRUE(daemon->log().waitForPart("storebagForSession: Retrieving storebag for session 66", lines));
    session.kill();
  }
  EXPECT_TRUE(daemon->log().waitForPart("dealloc: ReportingdSession dealloc: 66", lines));
}

}  // namespace
}  // namespace velk::test
