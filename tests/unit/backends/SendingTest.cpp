#include <algorithm>
#include <thread>

#include "foundation/Json.h"
#include "foundation/Text.h"
#include "platform/Cryptography.h"
#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {
namespace {

PropertyDictionary rule(const char* key, const char* action, PropertyValue value = nullptr) {
  return {{"key", key}, {"action", action}, {"value", std::move(value)}};
}

PropertyDictionary filtering(PropertyArray rules) {
  PropertyDictionary entry{{"locale_whitelist", PropertyArray{"US"}},
                           {"sampling_threshold", 1.0},
                           {"post_url", "https://collector.example/events"}};
  entry.set("filters", std::move(rules));
  return entry;
}

class SendingTest : public BackendTest {
 protected:
  PropertyDictionary waitingEntry() { return with(openEntry(), "sampling_threshold", 0.0); }
};

TEST_F(SendingTest, PostsAnEventAtOnce) {
  auto backend = makeConfigured(openEntry());
  fakes.clock().setWallTime({kNow + 5, 500'000});
  const auto text = send(*backend, {{"n", 1}});
  ASSERT_EQ(transport->count(), 1U);
  const auto request = lastRequest();
  EXPECT_EQ(request.url, "https://collector.example/events");
  EXPECT_EQ(headerOf(request, "X-Velk-Event-Map"), "7 3");
  EXPECT_EQ(headerOf(request, "X-Velk-Client-Name"), "Media");
  const auto body = bodyOf(request);
  EXPECT_EQ(body.begin()[0].key, "postTime");
  EXPECT_EQ(*body.find("postTime"), PropertyValue(static_cast<double>(kNow) + 5.5));
  EXPECT_EQ(body.begin()[1].key, "clientId");
  EXPECT_EQ(body.begin()[2].key, "events");
  const auto event = onlyEvent();
  EXPECT_EQ(*event.find("n"), PropertyValue(1));
  EXPECT_EQ(*event.find("_eventNumber"), PropertyValue(1));
  EXPECT_EQ(*event.string("_clientName"), "Media");
  EXPECT_EQ(log.count("HTTPSPostBackend(sendMessage): realtime is 0"), 1);
  EXPECT_EQ(log.count("HTTPSPostBackend(sendMessage): Sending 2, 0, 1"), 1);
  ASSERT_TRUE(text);
  EXPECT_EQ(*json::parse(*text)->dictionary(), body);
}

TEST_F(SendingTest, SendsNothingWhenDisabled) {
  auto backend = makeConfigured(openEntry());
  backend->setState(kBackendDisabled);
  EXPECT_EQ(send(*backend, {{"n", 1}}), std::nullopt);
  EXPECT_EQ(transport->count(), 0U);
  FlushOutcome outcome;
  backend->flushMessagesWithCompletion(outcome.completion());
  EXPECT_EQ(outcome.error, (Error{"VelkReportingErrorDomain", -1, "Nothing to flush"}));
}

TEST_F(SendingTest, TakesTheWholeMessageForItsPayload) {
  auto backend = makeConfigured(openEntry());
  backend->setAllowNestedData(true);
  backend->sendMessage(PropertyDictionary{{"SharedData", PropertyDictionary{{"s", 1}}}}, kStart, 7, 3, 0);
  const auto event = onlyEvent();
  EXPECT_EQ(*event.dictionary("SharedData"), (PropertyDictionary{{"s", 1}}));
  EXPECT_EQ(*event.find("s"), PropertyValue(1));
}

TEST_F(SendingTest, TakesAPayloadThatIsNoDictionaryForAbsent) {
  auto backend = makeConfigured(openEntry());
  backend->sendMessage(PropertyDictionary{{"ClientData", "text"}}, kStart, 7, 3, 0);
  EXPECT_EQ(*onlyEvent().string("ClientData"), "text");
}

TEST_F(SendingTest, UnwrapsClientDataOfAnyMessage) {
  auto backend = makeConfigured(openEntry());
  backend->sendMessage(PropertyDictionary{{"outer", 1}, {"ClientData", PropertyDictionary{{"inner", 2}}}}, kStart, 7, 3,
                       0);
  const auto event = onlyEvent();
  EXPECT_TRUE(event.contains("inner"));
  EXPECT_FALSE(event.contains("outer"));
}

TEST_F(SendingTest, SendsAnEventWithoutMessage) {
  auto backend = makeConfigured(openEntry());
  backend->sendMessage(std::nullopt, kStart, 7, 3, 0);
  EXPECT_EQ(log.count(log::Level::error, "HTTPSPostBackend(sendMessage): SESSION_TYPE_STOP message dictionary is nil"),
            1);
  EXPECT_EQ(*onlyEvent().find("_method"), PropertyValue(7));
}

TEST_F(SendingTest, LetsSharedDataWinOverUserInfoAndBothOverThePayload) {
  auto backend = makeConfigured(openEntry());
  backend->setUserInfoDict(PropertyDictionary{{"_clientName", "Media"}, {"a", "user"}, {"b", "user"}});
  backend->sendMessage(PropertyDictionary{{"ClientData", PropertyDictionary{{"a", "mine"}, {"b", "mine"}}},
                                          {"SharedData", PropertyDictionary{{"b", "shared"}}}},
                       kStart, 7, 3, 0);
  const auto event = onlyEvent();
  EXPECT_EQ(*event.string("a"), "user");
  EXPECT_EQ(*event.string("b"), "shared");
}

TEST_F(SendingTest, MergesUserInfoOverSharedDataAgainAtAFlush) {
  auto backend = makeBatching(openEntry());
  backend->setUserInfoDict(PropertyDictionary{{"_clientName", "Media"}, {"b", "user"}});
  backend->sendMessage(
      PropertyDictionary{{"SharedData", PropertyDictionary{{"b", "shared"}}}, {"ClientData", PropertyDictionary{}}},
      kStart, 7, 3, 0);
  backend->flushMessagesWithCompletion({});
  EXPECT_EQ(*onlyEvent().string("b"), "user");
}

TEST_F(SendingTest, HashesUserInfoOnceInAPostAndTwiceInAFlush) {
  const auto entry = filtering(PropertyArray{rule("user", "sha256")});
  const PropertyDictionary info{{"_clientName", "Media"}, {"user", "me"}};
  const auto once = VelkReportingBackend::convertIntoSHA256("me");
  auto direct = makeConfigured(entry);
  direct->setUserInfoDict(info);
  send(*direct, {{"n", 1}});
  EXPECT_EQ(*eventsOf(lastRequest()).front().string("user"), once);
  auto batching = makeBatching(entry);
  batching->setUserInfoDict(info);
  send(*batching, {{"n", 1}});
  batching->flushMessagesWithCompletion({});
  EXPECT_EQ(*eventsOf(lastRequest()).front().string("user"), VelkReportingBackend::convertIntoSHA256(once));
}

TEST_F(SendingTest, LetsUserInfoChangeTheMethodThatListsSee) {
  auto backend = makeBatching(with(openEntry(), "event_blacklist", PropertyArray{99}));
  backend->setUserInfoDict(PropertyDictionary{{"_clientName", "Media"}, {"_method", 99}});
  send(*backend, {{"n", 1}});
  FlushOutcome outcome;
  backend->flushMessagesWithCompletion(outcome.completion());
  EXPECT_EQ(outcome.error->description, "Nothing to flush: batched events were completely filtered out");
  EXPECT_EQ(
      log.count("flushMessagesWithCompletion: Dropping event with category 99 as it is blacklisted for backend korrin"),
      1);
}

TEST_F(SendingTest, LetsSharedDataChangeTheMethodThatFiltersSee) {
  auto restricted = rule("secret", "remove");
  restricted.set("method", 7);
  auto backend = makeConfigured(filtering(PropertyArray{restricted}));
  backend->sendMessage(PropertyDictionary{{"ClientData", PropertyDictionary{{"secret", "x"}}},
                                          {"SharedData", PropertyDictionary{{"_method", 8}}}},
                       kStart, 7, 3, 0);
  EXPECT_EQ(*onlyEvent().string("secret"), "x");
}

TEST_F(SendingTest, FiltersTheMessageAroundTheEventsToo) {
  fakes.defaults.put("uuidRespectDNU", "respect");
  auto restricted = rule("postTime", "remove");
  restricted.set("method", 0);
  auto unused = rule("events", "remove");
  unused.set("method", 7);
  auto backend = makeConfigured(filtering(PropertyArray{rule("clientid", "sha256"), restricted, unused}));
  send(*backend, {{"n", 1}});
  const auto body = bodyOf(lastRequest());
  EXPECT_EQ(*body.string("clientId"), VelkReportingBackend::convertIntoSHA256("respect"));
  EXPECT_FALSE(body.contains("postTime"));
  EXPECT_TRUE(body.contains("events"));
}

TEST_F(SendingTest, AddsItsSettingsToTheStopMessage) {
  auto backend = makeBatching(with(openEntry(), "override_dnu", 1));
  send(*backend, {{"n", 1}}, 7, 3, 1);
  const auto sent = lastRequest().body->size();
  send(*backend, {{"Opt", "mine"}}, 0, 1, 1);
  auto event = eventsOf(lastRequest()).front();
  EXPECT_EQ(*event.find("Opt"), PropertyValue(2));
  EXPECT_EQ(*event.find("SamplingThreshold"), PropertyValue(1.0));
  EXPECT_EQ(*event.find("OverrideSampling"), PropertyValue(-1));
  EXPECT_EQ(*event.find("Batch"), PropertyValue(1));
  EXPECT_EQ(*event.find("_totalBytesSent"), PropertyValue(sent));
  EXPECT_EQ(log.count("HTTPSPostBackend(sendMessage): Adding dnu type and sampling threshold to SESSION_TYPE_STOP "
                      "message dictionary"),
            1);
  const auto stop = lastRequest().body->size();
  send(*backend, {}, 0, 1, 1);
  EXPECT_EQ(*eventsOf(lastRequest()).front().find("_totalBytesSent"), PropertyValue(stop));
}

TEST_F(SendingTest, ReportsTheOverrideOfASampledOutDevice) {
  fakes.random.setRest(5000);
  auto backend = makeConfigured(with(with(openEntry(), "sampling_threshold", 0.25), "override_sampling", 0.75));
  backend->setSamplingThreshold(std::nullopt);
  backend->setState(kBackendEnabled);
  send(*backend, {}, 0, 1);
  const auto event = onlyEvent();
  EXPECT_EQ(*event.find("OverrideSampling"), PropertyValue(0.75));
  EXPECT_EQ(*event.find("SamplingThreshold"), PropertyValue(-1));
}

TEST_F(SendingTest, ReportsBytesPeriodicallyOnInternalBuilds) {
  isInternal = true;
  auto backend = makeConfigured(openEntry());
  send(*backend, {{"n", 1}});
  const auto sent = lastRequest().body->size();
  send(*backend, {}, 7, 3, 4);
  EXPECT_EQ(*eventsOf(lastRequest()).front().find("_bytesSentSinceLastReport"), PropertyValue(sent));
  const auto report = lastRequest().body->size();
  send(*backend, {}, 7, 3, 4);
  EXPECT_EQ(*eventsOf(lastRequest()).front().find("_bytesSentSinceLastReport"), PropertyValue(report));
  send(*backend, {}, 7, 3, 5);
  EXPECT_FALSE(eventsOf(lastRequest()).front().contains("_bytesSentSinceLastReport"));
  isInternal = false;
  send(*makeConfigured(openEntry()), {}, 7, 3, 4);
  EXPECT_FALSE(eventsOf(lastRequest()).front().contains("_bytesSentSinceLastReport"));
}

TEST_F(SendingTest, CompressesOnlyWhatBecomesShorter) {
  auto backend = makeConfigured(openEntry());
  send(*backend, {{"text", std::string(2000, 'x')}});
  auto request = lastRequest();
  EXPECT_EQ(headerOf(request, "Content-Encoding"), "gzip");
  EXPECT_EQ(headerOf(request, "Content-Length"), std::to_string(request.body->size()));
  EXPECT_LT(request.body->size(), 1000U);
  auto bare = makeConfigured(filtering(PropertyArray{rule("events", "remove"), rule("clientId", "remove")}));
  fakes.clock().setWallTime({kNow, 500'000});
  send(*bare, {{"n", 1}});
  request = lastRequest();
  EXPECT_EQ(headerOf(request, "Content-Encoding"), std::nullopt);
  EXPECT_EQ(*request.body, "{\"postTime\":1600000000.5}");
}

TEST_F(SendingTest, DigestsTheUncompressedBody) {
  const ByteData key{1, 2, 3};
  auto backend = makeConfigured(openEntry());
  backend->setDigestKey(key, 0);
  send(*backend, {{"text", std::string(2000, 'x')}});
  const std::string plain = jsonOf(lastRequest());
  ASSERT_NE(plain, *lastRequest().body);
  EXPECT_EQ(headerOf(lastRequest(), "X-Velk-DIGEST"),
            hexadecimal(hmacSha1(key, std::span(reinterpret_cast<const std::uint8_t*>(plain.data()), plain.size()))));
  backend->setDigestKey(key, 2);
  send(*backend, {{"n", 1}});
  EXPECT_EQ(headerOf(lastRequest(), "X-Velk-DIGEST"), std::nullopt);
  backend->setDigestKey(std::nullopt, 0);
  send(*backend, {{"n", 1}});
  EXPECT_EQ(headerOf(lastRequest(), "X-Velk-DIGEST"), std::nullopt);
}

TEST_F(SendingTest, SpeaksHttpsOnlyOutsideInternalBuilds) {
  const auto entry = with(openEntry(), "post_url", "http://collector.example/e?q=1");
  send(*makeConfigured(entry), {{"n", 1}});
  EXPECT_EQ(lastRequest().url, "https://collector.example/e?q=1");
  EXPECT_TRUE(lastRequest().requiresHttps);
  isInternal = true;
  send(*makeConfigured(entry), {{"n", 1}});
  EXPECT_EQ(lastRequest().url, "http://collector.example/e?q=1");
}

TEST_F(SendingTest, BatchesARealtimeEventWhileWaiting) {
  auto backend = makeConfigured(waitingEntry());
  ASSERT_EQ(backend->state(), kBackendWaiting);
  EXPECT_EQ(send(*backend, {{"n", 1}}, 7, 3, 1), std::nullopt);
  EXPECT_EQ(transport->count(), 0U);
  EXPECT_GT(backend->batchedEventsSize(), 0U);
  EXPECT_EQ(backend->batchedEventsCount(), 1U);
  EXPECT_EQ(backend->state(), kBackendWaiting);
  EXPECT_EQ(log.count("HTTPSPostBackend(sendMessage): Batching 3, 0, 1"), 1);
}

TEST_F(SendingTest, IsWokenByAFlagAndBatchesTheEventThatWokeIt) {
  for (const std::uint32_t flag : {2U, 3U}) {
    auto backend = makeConfigured(waitingEntry());
    const auto before = transport->count();
    send(*backend, {{"n", 1}}, 7, 3, flag);
    EXPECT_EQ(transport->count(), before);
    EXPECT_EQ(backend->state(), kBackendEnabled);
    send(*backend, {{"n", 2}});
    EXPECT_EQ(transport->count(), before + 1);
  }
}

TEST_F(SendingTest, ActivatesItsTransportWhenItIsWoken) {
  auto backend = makeConfigured(waitingEntry());
  EXPECT_EQ(transport->activations, 0);
  send(*backend, {{"n", 1}}, 7, 3, 2);
  EXPECT_EQ(transport->activations, 1);
}

TEST_F(SendingTest, ActivatesTheTransportThatItIsGivenOnlyWhenItIsEnabled) {
  auto enabled = makeConfigured(openEntry());
  auto waiting = makeConfigured(waitingEntry());
  const auto another = std::make_shared<FakeTransport>();
  waiting->setReportingSessionConnectivityDelegate(another);
  EXPECT_EQ(another->activations, 0);
  enabled->setReportingSessionConnectivityDelegate(another);
  EXPECT_EQ(another->activations, 1);
}

TEST_F(SendingTest, BatchesUntilUserInfoHasCome) {
  auto backend = makeConfigured(openEntry());
  backend->setUserInfoDict(std::nullopt);
  send(*backend, {{"n", 1}});
  EXPECT_EQ(transport->count(), 0U);
  FlushOutcome outcome;
  EXPECT_EQ(backend->flushMessagesWithCompletion(outcome.completion()), std::nullopt);
  EXPECT_EQ(outcome.error, (Error{"VelkReportingErrorDomain", -1, "Can not flush: userInfo is required"}));
  backend->setUserInfoDict(userInfo());
  backend->flushMessagesWithCompletion({});
  EXPECT_EQ(eventsOf(lastRequest()).size(), 1U);
}

TEST_F(SendingTest, FlushesBeforeARealtimeEvent) {
  auto backend = makeBatching(openEntry());
  sendMany(*backend, 3);
  const auto text = send(*backend, {{"n", 99}}, 7, 3, 1);
  ASSERT_EQ(transport->count(), 2U);
  EXPECT_EQ(eventsOf(transport->request(0)).size(), 3U);
  EXPECT_EQ(eventsOf(transport->request(1)).size(), 1U);
  EXPECT_EQ(headerOf(transport->request(0), "X-Velk-Event-Map"), std::nullopt);
  ASSERT_TRUE(text);
  EXPECT_TRUE(text->starts_with("Flushed events:\n{"));
  EXPECT_NE(text->find("\nStandalone event:\n{"), std::string::npos);
  EXPECT_EQ(log.count("HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been batched. "
                      "Forcing Flush here to keep events in order."),
            1);
}

TEST_F(SendingTest, FlushesTheFiftyThatWaitAndFromThenOnFiftyOne) {
  auto backend = makeBatching(openEntry());
  sendMany(*backend, 50);
  EXPECT_EQ(transport->count(), 0U);
  sendMany(*backend, 1);
  ASSERT_EQ(transport->count(), 1U);
  EXPECT_EQ(eventsOf(transport->request(0)).size(), 50U);
  EXPECT_EQ(log.count("HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for "
                      "method 7"),
            1);
  sendMany(*backend, 50);
  EXPECT_EQ(transport->count(), 1U);
  sendMany(*backend, 1);
  ASSERT_EQ(transport->count(), 2U);
  EXPECT_EQ(eventsOf(transport->request(1)).size(), 51U);
  sendMany(*backend, 51);
  EXPECT_EQ(eventsOf(transport->request(2)).size(), 51U);
}

TEST_F(SendingTest, ReturnsTheTextOfTheFlushThatAThresholdCaused) {
  auto backend = makeBatching(with(openEntry(), "event_threshold", 1));
  EXPECT_EQ(send(*backend, {{"n", 1}}), std::nullopt);
  EXPECT_EQ(send(*backend, {{"n", 2}}), std::nullopt);
  EXPECT_TRUE(send(*backend, {{"n", 3}}));
  EXPECT_EQ(eventsOf(transport->request(0)).size(), 2U);
}

TEST_F(SendingTest, CountsEachMethodByItself) {
  auto backend = makeBatching(openEntry());
  sendMany(*backend, 50, 1);
  sendMany(*backend, 50, 2);
  EXPECT_EQ(transport->count(), 0U);
  sendMany(*backend, 1, 2);
  EXPECT_EQ(eventsOf(transport->request(0)).size(), 100U);
}

TEST_F(SendingTest, DiscardsABatchThatMayNotBePostedButKeepsItsCounters) {
  auto backend = makeConfigured(waitingEntry());
  sendMany(*backend, 30);
  FlushOutcome outcome;
  backend->flushMessagesWithCompletion(outcome.completion());
  EXPECT_EQ(outcome.error->description, "Nothing to flush");
  EXPECT_EQ(backend->batchedEventsSize(), 0U);
  backend->setState(kBackendEnabled);
  backend->setBatchEvents(true);
  sendMany(*backend, 20);
  EXPECT_EQ(transport->count(), 0U);
  sendMany(*backend, 1);
  ASSERT_EQ(transport->count(), 1U);
  EXPECT_EQ(eventsOf(transport->request(0)).size(), 20U);
}

TEST_F(SendingTest, LosesOneKeyToNestedDataWithoutJsonForm) {
  auto backend = makeConfigured(openEntry());
  backend->setAllowNestedData(true);
  send(*backend, {{"box", PropertyDictionary{{"when", Date{1}}}}, {"n", 1}, {"list", PropertyArray{2}}});
  ASSERT_EQ(transport->count(), 1U);
  const auto event = onlyEvent();
  EXPECT_FALSE(event.contains("box"));
  EXPECT_EQ(*event.find("n"), PropertyValue(1));
  EXPECT_EQ(*event.find("list"), PropertyValue(PropertyArray{2}));
}

TEST_F(SendingTest, DropsABatchThatHasNoJsonForm) {
  auto backend = makeConfigured(openEntry());
  EXPECT_EQ(send(*backend, {{"text", "no UTF-8: \xff"}}), std::nullopt);
  EXPECT_EQ(transport->count(), 0U);
  EXPECT_EQ(log.count(log::Level::error,
                      "HTTPSPostBackend(createMessageForPostAndLogging): 1 events of backend korrin have no JSON form "
                      "and are lost"),
            1);
}

TEST_F(SendingTest, PostsNothingWithoutAddress) {
  auto entry = openEntry();
  entry.remove("post_url");
  auto backend = makeBatching(entry);
  sendMany(*backend, 1);
  FlushOutcome outcome;
  EXPECT_TRUE(backend->flushMessagesWithCompletion(outcome.completion()));
  EXPECT_EQ(outcome.error, (Error{"VelkReportingErrorDomain", -1, "postURL is nil"}));
  EXPECT_EQ(transport->count(), 0U);
}

TEST_F(SendingTest, PostsThatTheTransportWouldDropAreNeitherCountedNorCalledSent) {
  isInternal = true;
  auto single = makeConfigured(openEntry());
  auto batching = makeBatching(openEntry());
  transport->isActive = false;
  EXPECT_EQ(send(*single, {{"n", 1}}), std::nullopt);
  sendMany(*batching, 1);
  EXPECT_EQ(send(*batching, {{"n", 2}}, 7, 3, 1), std::nullopt) << "neither the batch nor the realtime event";
  EXPECT_EQ(batching->batchedEventsCount(), 0U);
  sendMany(*batching, 1);
  FlushOutcome outcome;
  EXPECT_EQ(batching->flushMessagesWithCompletion(outcome.completion()), std::nullopt);
  EXPECT_TRUE(outcome.abandoned);
  EXPECT_EQ(transport->count(), 0U);

  transport->isActive = true;
  for (const auto& backend : {single, batching}) {
    send(*backend, {{"n", 3}}, 7, 3, 4);
    backend->flushMessagesWithCompletion({});
    EXPECT_EQ(integerValue(eventsOf(lastRequest()).back().find("_bytesSentSinceLastReport")), 0);
  }
}

TEST_F(SendingTest, PostsCarryTheNumberOfTheirSessionAndNeverWait) {
  const auto sender = std::make_shared<PostSender>(PostSender{.number = 77});
  auto backend = makeBatching(openEntry());
  backend->setSender(sender);
  sendMany(*backend, 1);
  EXPECT_FALSE(sender->hasPosted);
  send(*backend, {{"n", 2}}, 7, 3, 1);
  EXPECT_TRUE(sender->hasPosted);
  ASSERT_EQ(transport->count(), 2U);
  EXPECT_EQ(transport->request(0).sender, 77U);
  EXPECT_EQ(transport->request(1).sender, 77U);
  EXPECT_EQ(transport->waits, 0);
}

TEST_F(SendingTest, DroppedFlushLeavesTheConfigurationOpen) {
  auto backend = makeBatching(openEntry());
  sendMany(*backend, 1);
  transport->isActive = false;
  backend->flushMessagesWithCompletion({});
  backend->setState(kBackendWaiting);
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
}

TEST_F(SendingTest, LogsPrettyTextOnlyWhereAllowed) {
  const auto textWith = [this](bool overridden) {
    auto backend = makeConfigured(overridden ? with(openEntry(), "override_dnu", 1) : openEntry());
    return send(*backend, {{"n", 1}});
  };
  EXPECT_TRUE(textWith(false));
  EXPECT_EQ(textWith(true), std::nullopt);
  fakes.defaults.put("forceEventLogging", true);
  for (const int environmentType : {0, 1, 2, 3, 4}) {
    fakes.defaults.put("environmentType", environmentType);
    EXPECT_EQ(textWith(true).has_value(), environmentType == 1 || environmentType == 2) << environmentType;
  }
}

TEST_F(SendingTest, KeepsItsStateOnceEventsHaveLeftInAFlush) {
  auto backend = makeBatching(openEntry());
  send(*backend, {{"n", 1}});
  backend->flushMessagesWithCompletion({});
  backend->setUserInfoDict(userInfo("Other"));
  backend->setState(kBackendWaiting);
  EXPECT_EQ(backend->updateState(), kBackendWaiting);
  transport->answer(0, 503);
  EXPECT_EQ(backend->updateState(), kBackendDisabled);
}

TEST_F(SendingTest, WritesNoStateBackOnceItIsFrozen) {
  auto backend = makeBatching(openEntry());
  send(*backend, {{"n", 1}});
  backend->flushMessagesWithCompletion({});
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
  EXPECT_EQ(fakes.scheduler.runUntilIdle(), 0U) << "a refusal meanwhile would be undone";
}

TEST_F(SendingTest, StaysConfigurableAfterAStandaloneEvent) {
  auto backend = makeConfigured(openEntry());
  send(*backend, {{"n", 1}});
  backend->setState(kBackendWaiting);
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
}

TEST_F(SendingTest, WritesANewSessionIDIntoTheBatch) {
  auto backend = makeBatching(openEntry());
  sendMany(*backend, 2);
  backend->setCorrelatedSessionID("parent.child");
  sendMany(*backend, 1);
  backend->flushMessagesWithCompletion({});
  for (const auto& event : eventsOf(lastRequest())) EXPECT_EQ(*event.string("_sessionID"), "parent.child");
}

}  // namespace
}  // namespace velk::test
