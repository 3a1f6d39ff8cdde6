// How sessions end: flushes, the graceful mark, the health message, and what is left of a client that dies.

#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

const PropertyValue kSplunk = PropertyArray{"splunk"};

PropertyArray flush(ControlledSession& session) { return session.call({{"method", "flushMessagesWithCompletion"}}); }

std::string errorOf(const PropertyArray& flushed) {
  if (flushed.size() != 2 || flushed[1].dictionary() == nullptr) return "no error";
  const auto* text = flushed[1].dictionary()->string("description");
  return text != nullptr ? *text : "no description";
}

PropertyArray failed(const char* text) {
  return {PropertyValue(),
          PropertyDictionary{{"domain", "VelkReportingErrorDomain"}, {"code", -1}, {"description", text}}};
}

/// The arrived health messages.
std::vector<PropertyDictionary> healthMessages(const ReportingServer& server) {
  std::vector<PropertyDictionary> found;
  for (const auto& event : eventsOf(server, 0)) {
    if (integerValue(event.find("_status")) == 1) found.push_back(event);
  }
  return found;
}

bool waitForHealth(const ReportingServer& server, std::size_t count) {
  for (std::size_t posts = 0;; posts = server.posts().size()) {
    if (healthMessages(server).size() >= count) return true;
    if (!server.waitForPosts(posts + 1)) return healthMessages(server).size() >= count;
  }
}

struct Flusher {
  explicit Flusher(const PropertyDictionary& more = {}, const PropertyDictionary& sessionInfo = {{"BatchEvents", true}})
      : daemon(prepared(server, more)), session(daemon) {
    EXPECT_EQ(session.open(9, 42, sessionInfo).size(), 3U);
  }
  static ReportingServer& prepared(ReportingServer& server, const PropertyDictionary& more) {
    server.setStorebag("heather", storebagWith(server, more));
    return server;
  }
  ReportingServer server;
  Daemon daemon;
  ControlledSession session;
};

TEST(Flush, OfASessionWithoutBackendsFails) {
  ReportingServer server;
  Daemon daemon(server);
  ControlledSession session(daemon);

  EXPECT_EQ(flush(session), failed("No backends available to send message"));
  ASSERT_EQ(session.open(3, 1), noLists());
  EXPECT_EQ(flush(session), failed("No backends available to send message"));
  EXPECT_EQ(session.call({{"method", "fetchDisplayURL"}}), PropertyArray{"URL not available"});
  EXPECT_EQ(session.reply(session.sendEvent(7, 1)).array("reply")->size(), 1U);
  EXPECT_TRUE(daemon.log().waitForPart("sendMessageWithDictionary: No backends available to send message"));
}

TEST(Flush, OfAStorebagWithoutBackendsFailsToo) {
  ReportingServer server;
  server.setStorebag("heather", storebagOf({{"release_timeout", 1}}));
  Daemon daemon(server);
  ControlledSession session(daemon);

  ASSERT_EQ(session.open(9, 1).size(), 3U);
  EXPECT_EQ(flush(session), failed("No backends available to send message"));
}

TEST(Flush, AnswersWithWhatItPosted) {
  Flusher flusher;
  flusher.session.sendEvent(7, 1, PropertyDictionary{{"answer", 42}});

  const auto reply = flush(flusher.session);

  ASSERT_EQ(reply.size(), 2U);
  EXPECT_TRUE(reply[1].isNull());
  ASSERT_NE(reply[0].string(), nullptr);
  EXPECT_NE(reply[0].string()->find("\"answer\""), std::string::npos);
  EXPECT_NE(flusher.daemon.messageLog().find("[splunk -> flushMessages] "), std::string::npos);
  EXPECT_EQ(flusher.server.posts().size(), 1U) << "it has arrived when the answer comes";
  EXPECT_EQ(flush(flusher.session), failed("Nothing to flush"));
}

TEST(Flush, OfNothingSaysSo) {
  Flusher flusher({}, {});
  EXPECT_EQ(flush(flusher.session), failed("Nothing to flush")) << "the start message was posted at once";
}

TEST(Flush, OfEventsThatNobodyMaySeeSaysSo) {
  // The user info changes the method of the batched event, so that it passes the list on its way in only.
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server, {{"event_whitelist", PropertyArray{7}}}));
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(
      session.open(9, 1, {{"BatchEvents", true}}, PropertyDictionary{{"_clientName", "T"}, {"_method", 9}}).size(), 3U);
  session.sendEvent(7, 1, PropertyDictionary{{"a", 1}});

  EXPECT_EQ(flush(session), failed("Nothing to flush: batched events were completely filtered out"));
  EXPECT_EQ(flush(session), failed("Nothing to flush"));
  EXPECT_TRUE(daemon.log().waitForPart(
      "flushMessagesWithCompletion: Dropping event with category 9 as it is not whitelisted for backend splunk"));
}

TEST(Flush, WithoutAddressSaysSo) {
  Flusher flusher({{"post_url", nullptr}});
  EXPECT_EQ(errorOf(flush(flusher.session)), "postURL is nil");
}

TEST(Flush, ReportsTheFirstErrorAtOnce) {
  ReportingServer server;
  TlsTestServer::Response never;
  never.silent = true;
  server.setPostResponse(never);
  server.setStorebag("heather", storebagOf({{"splunk", postBackend(server)},
                                            {"korrin", postBackend(server, {{"post_url", nullptr}})}}));
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1, {{"BatchEvents", true}}).size(), 3U);

  EXPECT_EQ(errorOf(flush(session)), "postURL is nil");
}

TEST(Flush, OfABackendThatHoldsNothingAnswersBeforeTheOthersHavePosted) {
  ReportingServer server;
  TlsTestServer::Response late;
  late.delay = std::chrono::seconds(1);
  server.setPostResponse(late);
  server.setStorebag("heather", storebagOf({{"splunk", postBackend(server)},
                                            {"korrin", postBackend(server, {{"event_whitelist", PropertyArray{9}}})}}));
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1, {{"BatchEvents", true}}).size(), 3U);
  session.sendEvent(7, 1, PropertyDictionary{{"answer", 42}});

  EXPECT_EQ(flush(session), failed("Nothing to flush")) << "although the other one has something to say";
  EXPECT_TRUE(server.waitForEvents(1, {7}));
  EXPECT_TRUE(daemon.log().waitForPart("internalFlushMessagesWithCompletion: splunk"));
  // Its line in the message log follows; by its end the daemon has written it.
  EXPECT_EQ(daemon.stop(), 0);
  EXPECT_NE(daemon.messageLog().find("[splunk -> flushMessages] "), std::string::npos) << "its result is only logged";
}

TEST(Health, MessageTellsOfTheDaemon) {
  Flusher flusher({}, {});
  ControlledSession other(flusher.daemon);
  ASSERT_EQ(other.open(9, 43).size(), 3U);
  flusher.session.send({{"method", "finishSessionGracefully"}});
  EXPECT_EQ(flusher.session.finish(), 0);

  ASSERT_TRUE(waitForHealth(flusher.server, 1));
  const auto health = healthMessages(flusher.server)[0];
  auto keys = keysOf(health);
  ASSERT_GT(keys.size(), 8U);
  EXPECT_EQ(keys[0], "StorebagVersion");
  EXPECT_EQ(keys[1], "GracefulTermination");
  EXPECT_EQ(keys[2].rfind("SessionsCount_", 0), 0U);
  EXPECT_EQ(keys[3], "BatchSize_" + keys[2].substr(14));
  EXPECT_EQ(keys[4], "StorebagsCount");
  EXPECT_EQ(keys[5], "StorebagsSize");
  EXPECT_EQ(keys[6], "CalculatedMemoryUsage");
  EXPECT_EQ(keys[7], "ProcessMemoryUsage");
  for (const char* key : {"Opt", "SamplingThreshold", "OverrideSampling", "Batch", "_totalBytesSent"}) {
    EXPECT_TRUE(health.contains(key)) << key;
  }
  EXPECT_EQ(*health.string("StorebagVersion"), "1.0.0-test");
  EXPECT_EQ(*health.find("GracefulTermination"), PropertyValue(true));
  EXPECT_EQ(integerValue(health.find(keys[2])), 2) << "the other session, and itself once more";
  EXPECT_EQ(integerValue(health.find("StorebagsCount")), 1);
  EXPECT_GT(integerValue(health.find("StorebagsSize")), 0);
  EXPECT_GT(integerValue(health.find("ProcessMemoryUsage")), 100000);
  EXPECT_EQ(doubleValue(health.find("OverrideSampling")), -1);
  EXPECT_EQ(doubleValue(health.find("SamplingThreshold")), 1);
  EXPECT_EQ(integerValue(health.find("Batch")), 0);
  EXPECT_GT(integerValue(health.find("_totalBytesSent")), 0);
}

TEST(Health, FollowsTheBatchOfADyingClient) {
  Flusher flusher;
  const auto sent = flusher.session.sendEvent(7, 1, PropertyDictionary{{"answer", 42}});
  ASSERT_FALSE(flusher.session.reply(sent).empty());
  flusher.session.kill();

  ASSERT_TRUE(waitForHealth(flusher.server, 1));
  const auto events = flusher.server.events();
  ASSERT_EQ(events.size(), 3U);
  EXPECT_EQ(integerValue(events[1].find("answer")), 42);
  EXPECT_EQ(*events[2].find("GracefulTermination"), PropertyValue(false));
  EXPECT_TRUE(flusher.daemon.log().waitForPart("was interrupted"));
  EXPECT_TRUE(flusher.daemon.log().waitForPart("dealloc: ReportingdSession dealloc: 42"));
}

TEST(Health, IsNotSentWithoutBackends) {
  ReportingServer server;
  Daemon daemon(server);
  {
    ControlledSession session(daemon);
    ASSERT_EQ(session.open(3, 42, {}, PropertyValue()), noLists());
    EXPECT_EQ(session.finish(), 0);
  }
  EXPECT_TRUE(daemon.log().waitForPart("dealloc: ReportingdSession dealloc: 42"));
  EXPECT_TRUE(daemon.log().waitForPart("releaseIPCTransactions: IPC transaction ref count is "));
  EXPECT_EQ(daemon.stop(), 0);
  EXPECT_TRUE(server.posts().empty());
}

TEST(Health, OfAOneShotSessionIsSentToo) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  ControlledSession session(daemon);
  EXPECT_EQ(session.call({{"method", "sendMessageWithSessionInfo"},
                          {"sessionInfo", PropertyDictionary{{"ComponentType", 9}, {"SessionID", 42}}},
                          {"userInfo", PropertyDictionary{{"_clientName", "Test"}}},
                          {"category", 7},
                          {"type", 1},
                          {"payload", PropertyDictionary{{"answer", 42}}}}),
            PropertyArray{"finished"});
  EXPECT_EQ(session.finish(), 0);

  ASSERT_TRUE(waitForHealth(server, 1));
  EXPECT_FALSE(healthMessages(server)[0].contains("StorebagVersion")) << "only a configuration takes note of it";
}

TEST(Health, SendAndExitLosesNothing) {
  Flusher flusher({}, {});
  for (int i = 0; i < 40; ++i) flusher.session.sendEvent(7, 1, PropertyDictionary{{"number", i}});
  EXPECT_EQ(flusher.session.finish(), 0);
  EXPECT_TRUE(flusher.server.waitForEvents(40, {7}));
  EXPECT_TRUE(waitForHealth(flusher.server, 1));
}

TEST(Health, ThirtyClientsKilledTogetherAllLeaveOne) {
  ReportingServer server;
  const std::vector<std::pair<int, const char*>> types{{5, "bramble"}, {6, "clover"},   {8, "fennel"},
                                                       {9, "heather"}, {10, "juniper"}, {12, "lavender"}};
  for (const auto& type : types) server.setStorebag(type.second, storebagWith(server));
  Daemon daemon(server);
  std::vector<std::unique_ptr<ControlledSession>> sessions;
  std::vector<std::size_t> lines;
  for (const auto& type : types) {
    for (int i = 0; i < 5; ++i) {
      sessions.push_back(std::make_unique<ControlledSession>(daemon));
      lines.push_back(sessions.back()->sendOpening(type.first, static_cast<int>(sessions.size())));
    }
  }
  for (std::size_t i = 0; i < sessions.size(); ++i) ASSERT_FALSE(sessions[i]->reply(lines[i]).empty());
  for (auto& session : sessions) session->process().signal(SIGKILL);

  EXPECT_TRUE(waitForHealth(server, 30));
  EXPECT_EQ(healthMessages(server).size(), 30U);
  ControlledSession after(daemon);
  EXPECT_EQ(after.open(9, 99)[0], kSplunk) << "their places are free again";
}

}  // namespace
}  // namespace velk::test
