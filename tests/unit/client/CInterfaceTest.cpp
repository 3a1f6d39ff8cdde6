// Clients as a C program uses them, against a daemon that remembers.

#include <stdexcept>

#include "client/LogTexts.h"
#include "client/UnexportedFunctions.h"
#include "tests/unit/client/CInterfaceFixture.h"

namespace velk::test {
namespace {

TEST_F(CInterfaceTest, CreatesDescribesAndConfigures) {
  _daemon.start();
  const Value frameworks(VelkReportingValueCreateFromJSON(R"(["framework"])", nullptr));
  const Client client(VelkReportingClientCreate(_session, _user, frameworks));
  ASSERT_NE(client.handle, nullptr);
  Context context;
  VelkReportingClientStartConfiguration(client, noteStates, &context, Context::destroy);
  ASSERT_TRUE(context.destroyed.waitFor(kPatience));
  EXPECT_EQ(context.texts, (std::vector<std::string>{R"(["splunk"])"}));
  EXPECT_EQ(_daemon.calls()[0].arguments,
            (PropertyArray{sessionInfo(), userInfo(), PropertyArray{"framework"}, false}));
}

TEST_F(CInterfaceTest, CreationFailsAsInTheOtherInterface) {
  EXPECT_EQ(VelkReportingClientCreate(nullptr, nullptr, nullptr), nullptr);
  const Value invalid(json(R"({"ComponentType": 4})"));
  EXPECT_EQ(VelkReportingClientCreate(invalid, nullptr, nullptr), nullptr);
  const Value disabled(json(R"({"ComponentType": 9, "EnableFlag": 0})"));
  Context context;
  EXPECT_EQ(VelkReportingClientCreateWithAggregation(disabled, nullptr, nullptr, noEvent, &context, Context::destroy),
            nullptr);
  EXPECT_EQ(context.ended.load(), 1);
  EXPECT_EQ(_log.count(texts::kSessionInfoIsNil), 1);
  EXPECT_EQ(_log.count(texts::kClientTypeIsInvalid), 1);
  EXPECT_EQ(_log.count(texts::kSessionDisabled), 1);
}

TEST_F(CInterfaceTest, UnexportedFunctionsDoTheSame) {
  _daemon.start();
  const Client plain(VelkReportingCreate(_session, _user, nullptr));
  Context context;
  const Client aggregating(VelkReportingCreateWithAggregation(_session, _user, nullptr, noEvent, nullptr, nullptr));
  ASSERT_NE(plain.handle, nullptr);
  ASSERT_NE(aggregating.handle, nullptr);
  VelkReportingBeginConfiguration(plain, noteStates, &context, Context::destroy);
  ASSERT_TRUE(context.destroyed.waitFor(kPatience));
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 2));
  int withBlock = 0;
  for (const auto& call : _daemon.calls()) {
    if (call.method == "setSessionInfo" && booleanValue(&call.arguments[3])) ++withBlock;
  }
  EXPECT_EQ(withBlock, 1);
}

TEST_F(CInterfaceTest, NullClientDoesNothingAndEndsEveryContext) {
  Context context;
  VelkReportingError* error = reinterpret_cast<VelkReportingError*>(this);
  VelkReportingClientStartConfiguration(nullptr, noteStates, &context, Context::destroy);
  VelkReportingBeginConfiguration(nullptr, noteStates, &context, Context::destroy);
  VelkReportingFetchStatesWithUserInfo(nullptr, _user, noteStates, &context, Context::destroy);
  VelkReportingSetMessageBlock(nullptr, noteText, &context, Context::destroy);
  VelkReportingFlushMessagesWithCompletion(nullptr, noteError, &context, Context::destroy);
  EXPECT_FALSE(VelkReportingClientUploadFile(
      nullptr, "/", [](bool, void*) {}, &context, Context::destroy));
  EXPECT_EQ(context.ended.load(), 6);
  EXPECT_TRUE(context.texts.empty());
  VelkReportingUpdateSharedDataWithDictionary(nullptr, _user);
  VelkReportingUpdateSharedDataForKey(nullptr, "key", _user);
  EXPECT_FALSE(VelkReportingSendMessageWithError(nullptr, 0, 1, nullptr, &error));
  EXPECT_FALSE(VelkReportingSendMessageWithDictionary(nullptr, _user, &error));
  EXPECT_EQ(error, reinterpret_cast<VelkReportingError*>(this)) << "left as it was";
  VelkReportingFlushMessages(nullptr);
  VelkReportingClientFinishSession(nullptr);
  EXPECT_FALSE(VelkReportingUploadLogWithArray(nullptr, nullptr));
  EXPECT_FALSE(VelkReportingClientServerSupportsFileUpload(nullptr));
  EXPECT_FALSE(VelkReportingClientSetDigestKey(nullptr, "key", 3, 0));
  EXPECT_EQ(VelkReportingClientRetain(nullptr), nullptr);
  VelkReportingClientRelease(nullptr);
  EXPECT_TRUE(_log.lines().empty());
}

TEST_F(CInterfaceTest, CategoryZeroIsAnError) {
  const Client client(create());
  VelkReportingError* error = nullptr;
  EXPECT_FALSE(VelkReportingSendMessageWithError(client, 0, 1, nullptr, &error));
  EXPECT_EQ(VelkReportingErrorGetCode(error), 4);
  EXPECT_STREQ(VelkReportingErrorGetDomain(error), "VelkReportingErrorDomain");
  VelkReportingErrorRelease(error);
  EXPECT_FALSE(VelkReportingSendMessageWithError(client, 0, 1, nullptr, nullptr));
}

TEST_F(CInterfaceTest, MissingParametersLoseTheirText) {
  const Client client(create());
  for (const char* text : {R"({"ParametersCategory": 1})", R"({"ParametersType": 1})"}) {
    const Value message(json(text));
    VelkReportingError* error = nullptr;
    EXPECT_FALSE(VelkReportingSendMessageWithDictionary(client, message, &error));
    ASSERT_NE(error, nullptr);
    EXPECT_EQ(VelkReportingErrorGetCode(error), 7);
    EXPECT_STREQ(VelkReportingErrorGetDomain(error), "VelkReportingErrorDomain");
    EXPECT_STREQ(VelkReportingErrorGetDescription(error), "");
    const Value userInfo(VelkReportingErrorCopyUserInfo(error));
    EXPECT_EQ(VelkReportingDictionaryGetCount(userInfo), 0U);
    VelkReportingErrorRelease(error);
  }
}

TEST_F(CInterfaceTest, FilteredEventIsTrueByCategoryAndFalseByDictionaryAndNoError) {
  _daemon.start();
  _daemon.setConfiguration(PropertyArray{}, PropertyArray{3}, std::nullopt);
  const Client client(create());
  configureAndWait(client);
  VelkReportingError* error = reinterpret_cast<VelkReportingError*>(this);
  EXPECT_TRUE(VelkReportingSendMessageWithError(client, 9, 1, nullptr, &error));
  EXPECT_EQ(error, nullptr);
  const Value message(json(R"({"ParametersCategory": 9, "ParametersType": 1})"));
  error = reinterpret_cast<VelkReportingError*>(this);
  EXPECT_FALSE(VelkReportingSendMessageWithDictionary(client, message, &error));
  EXPECT_EQ(error, nullptr);
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), 0U);
}

TEST_F(CInterfaceTest, FullOutboxIsTrueByCategoryAndFalseByDictionaryAndAnError) {
  const Client client(create());  // nobody listens
  const Value message(json(R"({"ParametersCategory": 9, "ParametersType": 1})"));
  VelkReportingError* error = nullptr;
  for (int event = 0; event < 20'000 && error == nullptr; ++event) {
    const bool sent = VelkReportingSendMessageWithDictionary(client, message, &error);
    ASSERT_EQ(sent, error == nullptr);
  }
  EXPECT_EQ(VelkReportingErrorGetCode(error), 8);
  VelkReportingErrorRelease(error);
  EXPECT_TRUE(VelkReportingSendMessageWithError(client, 9, 1, nullptr, &error));
  EXPECT_EQ(VelkReportingErrorGetCode(error), 8) << "what was not taken is told all the same";
  VelkReportingErrorRelease(error);
}

TEST_F(CInterfaceTest, RefusesWhatIsNoDictionary) {
  const Client client(create());
  const Value array(VelkReportingArrayCreate());
  VelkReportingError* error = nullptr;
  EXPECT_FALSE(VelkReportingSendMessageWithError(client, 1, 1, array, &error));
  EXPECT_EQ(VelkReportingErrorGetCode(error), 10);
  VelkReportingErrorRelease(error);
  EXPECT_FALSE(VelkReportingSendMessageWithDictionary(client, nullptr, &error));
  EXPECT_EQ(VelkReportingErrorGetCode(error), 10);
  VelkReportingErrorRelease(error);
  EXPECT_FALSE(VelkReportingSendOneMessage(_session, array, 1, 1, nullptr, &error));
  EXPECT_EQ(VelkReportingErrorGetCode(error), 10);
  VelkReportingErrorRelease(error);
}

TEST_F(CInterfaceTest, FinishSessionReachesTheDaemon) {
  _daemon.start();
  const Client client(create());
  VelkReportingClientFinishSession(client);
  EXPECT_TRUE(_daemon.waitForCalls("finishSessionGracefully", 1));
}

TEST_F(CInterfaceTest, HierarchyTokensAreEqualShapedAndDistinct) {
  const Value root(VelkReportingNewHierarchyTokenFromParentToken(nullptr));
  const Value other(VelkReportingCreateHierarchyTokenFromParentToken(nullptr));
  EXPECT_EQ(VelkReportingDictionaryGetInteger(root, "level"), 0);
  EXPECT_FALSE(VelkReportingValueIsEqual(root, other));
  const Value one(VelkReportingNewHierarchyTokenFromParentToken(root));
  const Value two(VelkReportingCreateHierarchyTokenFromParentToken(root));
  EXPECT_NE(one.handle, two.handle);
  EXPECT_TRUE(VelkReportingValueIsEqual(one, two));
  EXPECT_EQ(VelkReportingDictionaryGetInteger(one, "level"), 1);
  EXPECT_STREQ(VelkReportingDictionaryGetString(one, "token"), VelkReportingDictionaryGetString(root, "token"));
  const Value array(VelkReportingArrayCreate());
  EXPECT_EQ(VelkReportingNewHierarchyTokenFromParentToken(array), nullptr);
  const Value withoutToken(VelkReportingDictionaryCreate());
  EXPECT_EQ(VelkReportingNewHierarchyTokenFromParentToken(withoutToken), nullptr);
}

TEST_F(CInterfaceTest, NullCompletionIsAcceptedAndItsContextEnds) {
  _daemon.start();
  const Client client(create());
  Context context;
  VelkReportingFlushMessagesWithCompletion(client, nullptr, &context, Context::destroy);
  EXPECT_EQ(context.ended.load(), 1);
  const Client aggregatingNothing(
      VelkReportingClientCreateWithAggregation(_session, _user, nullptr, nullptr, &context, Context::destroy));
  EXPECT_NE(aggregatingNothing.handle, nullptr);
  EXPECT_EQ(context.ended.load(), 2);
  VelkReportingFlushMessagesWithCompletion(client, nullptr, nullptr, nullptr);
  VelkReportingFlushMessages(client);
  VelkReportingClientStartConfiguration(client, nullptr, nullptr, nullptr);
  EXPECT_TRUE(_daemon.waitForCalls("flushMessagesWithCompletion", 3));
}

TEST_F(CInterfaceTest, FlushHandsTheErrorOn) {
  _daemon.start();
  const Client client(create());
  EXPECT_EQ(flushAndWait(client), "none");
  _daemon.setFlushError(Error{"VelkReportingErrorDomain", -1, "Nothing to flush"});
  EXPECT_EQ(flushAndWait(client), "Nothing to flush");
}

TEST_F(CInterfaceTest, CallbacksHearOfADaemonThatIsNotThere) {
  const Client client(create());
  Context context;
  VelkReportingFetchStatesWithUserInfo(client, _user, noteStates, &context, Context::destroy);
  ASSERT_TRUE(context.destroyed.waitFor(kPatience));
  EXPECT_EQ(context.texts, (std::vector<std::string>{"none"}));
  EXPECT_NE(flushAndWait(client), "none");
  struct Heard {
    std::string domain;
    int code = 0;
    Semaphore over;
  } heard;
  VelkReportingFlushMessagesWithCompletion(
      client,
      [](const VelkReportingError* error, void* context) {
        auto& told = *static_cast<Heard*>(context);
        told.domain = VelkReportingErrorGetDomain(error);
        told.code = VelkReportingErrorGetCode(error);
      },
      &heard, [](void* context) { static_cast<Heard*>(context)->over.signal(); });
  ASSERT_TRUE(heard.over.waitFor(kPatience));
  EXPECT_EQ(heard.domain, "VelkConnectionErrorDomain");
  EXPECT_EQ(heard.code, 9) << "as the headers say";
}

TEST_F(CInterfaceTest, MessageBlockIsReplacedAndEndsWithTheClient) {
  _daemon.start();
  _daemon.setMessageReply("sent text");
  Context first;
  Context second;
  VelkReportingClient* client = create();
  VelkReportingSetMessageBlock(client, noteText, &first, Context::destroy);
  EXPECT_TRUE(VelkReportingSendMessageWithError(client, 1, 1, nullptr, nullptr));
  ASSERT_TRUE(first.called.waitFor(kPatience));
  VelkReportingSetMessageBlock(client, noteText, &second, Context::destroy);
  ASSERT_TRUE(first.destroyed.waitFor(kPatience));
  EXPECT_TRUE(VelkReportingSendMessageWithError(client, 1, 1, nullptr, nullptr));
  ASSERT_TRUE(second.called.waitFor(kPatience));
  EXPECT_EQ(VelkReportingClientRetain(client), client);
  VelkReportingClientRelease(client);
  EXPECT_EQ(second.ended.load(), 0) << "it has an owner still";
  VelkReportingClientRelease(client);
  ASSERT_TRUE(second.destroyed.waitFor(kPatience));
  EXPECT_EQ(first.texts, (std::vector<std::string>{"sent text"}));
  EXPECT_EQ(first.ended.load() + second.ended.load(), 2);
}

TEST_F(CInterfaceTest, DestroyMayWaitForTheLibrary) {
  _daemon.start();
  const Client other(create());
  std::function<void()> wait = [&] { flushAndWait(other); };
  Semaphore waited;
  struct Waiting {
    std::function<void()>& wait;
    Semaphore& waited;
  } waiting{wait, waited};
  const auto destroy = [](void* context) {
    static_cast<Waiting*>(context)->wait();
    static_cast<Waiting*>(context)->waited.signal();
  };
  const Client client(create());
  VelkReportingSetMessageBlock(client, noteText, &waiting, destroy);
  VelkReportingSetMessageBlock(client, nullptr, nullptr, nullptr);
  ASSERT_TRUE(waited.waitFor(kPatience));
  // The reply and the handler of its failure both hold it; whichever goes last.
  VelkReportingClientStartConfiguration(
      client, [](const VelkReportingValue*, void*) {}, &waiting, destroy);
  ASSERT_TRUE(waited.waitFor(kPatience));
}

TEST_F(CInterfaceTest, LastReleaseFromACallbackEndsTheSessionOnce) {
  _daemon.start();
  VelkReportingClient* client = create();
  Context context;
  VelkReportingFlushMessagesWithCompletion(
      client,
      [](const VelkReportingError*, void* own) { VelkReportingClientRelease(static_cast<VelkReportingClient*>(own)); },
      client, nullptr);
  ASSERT_TRUE(_daemon.waitForCalls("finishSessionGracefully", 1));
  ASSERT_TRUE(_daemon.waitForEnds(1));
  EXPECT_EQ(_daemon.count("finishSessionGracefully"), 1U);
}

TEST_F(CInterfaceTest, AggregationHandsAllFiveValuesOn) {
  _daemon.start();
  Context context;
  const Client client(VelkReportingClientCreateWithAggregation(
      _session, _user, nullptr,
      [](const VelkReportingValue* from, double timestamp, uint16_t category, uint16_t type,
         const VelkReportingValue* payload, void* own) {
        static_cast<Context*>(own)->note(jsonOf(from) + " " + std::to_string(timestamp) + " " +
                                         std::to_string(category) + " " + std::to_string(type) + " " + jsonOf(payload));
      },
      &context, nullptr));
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
  _daemon.sendToClient(PropertyDictionary{{"SessionID", 8}}, 12.5, 2, 3, PropertyDictionary{{"a", 1}});
  _daemon.sendToClient(std::nullopt, 0, 0, 0, std::nullopt);
  ASSERT_TRUE(context.called.waitFor(kPatience));
  ASSERT_TRUE(context.called.waitFor(kPatience));
  EXPECT_EQ(context.texts,
            (std::vector<std::string>{R"({"SessionID":8} 12.500000 2 3 {"a":1})", "none 0.000000 0 0 none"}));
}

TEST_F(CInterfaceTest, AggregationCallbackThatThrowsIsCalledOnceAndItsContextEnds) {
  _daemon.start();
  Context context;
  const Client client(VelkReportingClientCreateWithAggregation(
      _session, _user, nullptr,
      [](const VelkReportingValue*, double, uint16_t, uint16_t, const VelkReportingValue*, void* own) {
        static_cast<Context*>(own)->note("called");
        throw std::runtime_error("no");
      },
      &context, Context::destroy));
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
  _daemon.sendToClient(PropertyDictionary{{"SessionID", 8}}, 1, 2, 3, std::nullopt);
  ASSERT_TRUE(context.destroyed.waitFor(kPatience));
  _daemon.sendToClient(PropertyDictionary{{"SessionID", 8}}, 1, 2, 3, std::nullopt);
  flushAndWait(client);
  EXPECT_EQ(context.texts.size(), 1U);
  EXPECT_EQ(_log.count(texts::kAggregationBlockThrew), 1);
}

TEST_F(CInterfaceTest, SharedDataUploadsAndKeysReachTheDaemon) {
  _daemon.start();
  _daemon.setConfiguration(PropertyArray{"upload_server"}, std::nullopt, std::nullopt);
  const Client client(create());
  EXPECT_FALSE(VelkReportingClientServerSupportsFileUpload(client));
  configureAndWait(client);
  EXPECT_TRUE(VelkReportingClientServerSupportsFileUpload(client));
  VelkReportingUpdateSharedDataWithDictionary(client, _user);
  VelkReportingUpdateSharedDataWithDictionary(client, nullptr);
  VelkReportingUpdateSharedDataForKey(client, "key", _user);
  VelkReportingUpdateSharedDataForKey(client, "key", nullptr);
  VelkReportingUpdateSharedDataForKey(client, nullptr, nullptr);
  const Value logData(VelkReportingValueCreateFromJSON(R"([{"LogData": "line"}])", nullptr));
  EXPECT_TRUE(VelkReportingUploadLogWithArray(client, logData));
  EXPECT_FALSE(VelkReportingUploadLogWithArray(client, nullptr));
  EXPECT_FALSE(VelkReportingUploadLogWithArray(client, _user));
  EXPECT_TRUE(VelkReportingClientSetDigestKey(client, "\1\2", 2, 1));
  EXPECT_FALSE(VelkReportingClientSetDigestKey(client, nullptr, 0, 1));
  Context context;
  EXPECT_FALSE(VelkReportingClientUploadFile(
      client, "/nowhere/at all", [](bool, void*) {}, &context, Context::destroy));
  EXPECT_EQ(context.ended.load(), 1);
  flushAndWait(client);
  EXPECT_EQ(_daemon.count("updateSharedDataWithDictionary"), 1U);
  EXPECT_EQ(_daemon.count("updateSharedDataForKey"), 2U);
  EXPECT_EQ(_daemon.count("uploadLogData"), 1U);
  EXPECT_EQ(_daemon.count("setDigestKey"), 1U);
}

void serve(VelkReportingValue* statistics, void* context) {
  if (!VelkReportingDictionarySetInteger(statistics, "served", 1)) return;  // nothing to fill in: an update
  static_cast<Context*>(context)->note("report");
}

TEST_F(CInterfaceTest, ModulesReportWhatTheyFillIn) {
  _daemon.start();
  const Client client(create());
  Context context;
  EXPECT_TRUE(VelkReportingClientRegisterPeriodicTask(client, 7, true, true, serve, &context, Context::destroy));
  VelkReportingClientStartLogTimer(client, 3600, 1, 9, 2);
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 1));
  VelkReportingClientStopLogTimer(client);
  EXPECT_EQ(context.ended.load(), 0);
  EXPECT_TRUE(VelkReportingClientUnregisterPeriodicTask(client, 7));
  ASSERT_TRUE(context.destroyed.waitFor(kPatience));
  EXPECT_EQ(context.texts.size(), 1U);
  const PropertyDictionary expected{{"ParametersFlag", 1},
                                    {"ParametersCategory", 9},
                                    {"ParametersType", 2},
                                    {"ParametersPayload", PropertyDictionary{{"served", 1}}}};
  EXPECT_EQ(_daemon.calls().back().arguments, PropertyArray{expected});
}

TEST_F(CInterfaceTest, UnregisteringAnswersTrueAlways) {
  const Client client(create());
  EXPECT_TRUE(VelkReportingClientUnregisterPeriodicTask(client, 7));
  EXPECT_FALSE(VelkReportingClientUnregisterPeriodicTask(nullptr, 7));
}

TEST_F(CInterfaceTest, ModulesContextEndsOnEveryRoad) {
  Context none;
  Context replaced;
  Context last;
  VelkReportingClient* client = create();
  EXPECT_FALSE(VelkReportingClientRegisterPeriodicTask(nullptr, 7, true, true, serve, &none, Context::destroy));
  EXPECT_FALSE(VelkReportingClientRegisterPeriodicTask(client, 7, true, true, nullptr, &none, Context::destroy));
  EXPECT_EQ(none.ended.load(), 2);
  EXPECT_TRUE(VelkReportingClientRegisterPeriodicTask(client, 7, true, true, serve, &replaced, Context::destroy));
  EXPECT_TRUE(VelkReportingClientRegisterPeriodicTask(client, 7, true, true, serve, &last, Context::destroy));
  ASSERT_TRUE(replaced.destroyed.waitFor(kPatience));
  VelkReportingClientRelease(client);
  ASSERT_TRUE(last.destroyed.waitFor(kPatience));
  EXPECT_EQ(replaced.ended.load() + last.ended.load(), 2);
  VelkReportingClientStartLogTimer(nullptr, 1, 1, 1, 1);
  VelkReportingClientStopLogTimer(nullptr);
}

TEST_F(CInterfaceTest, OneMessageNeedsNoClient) {
  _daemon.start();
  EXPECT_TRUE(VelkReportingSendOneMessage(_session, _user, 3, 1, nullptr, nullptr));
  EXPECT_TRUE(_daemon.waitForCalls("sendMessageWithSessionInfo", 1));
  VelkReportingError* error = nullptr;
  EXPECT_FALSE(VelkReportingSendOneMessage(nullptr, _user, 3, 1, nullptr, &error));
  EXPECT_EQ(VelkReportingErrorGetCode(error), 2);
  VelkReportingErrorRelease(error);
  const Value invalid(json(R"({"ComponentType": 31})"));
  EXPECT_FALSE(VelkReportingSendOneMessage(invalid, _user, 3, 1, nullptr, &error));
  EXPECT_EQ(VelkReportingErrorGetCode(error), 3);
  VelkReportingErrorRelease(error);
  EXPECT_FALSE(VelkReportingSendOneMessage(_session, _user, 0, 1, nullptr, &error));
  EXPECT_EQ(VelkReportingErrorGetCode(error), 4);
  VelkReportingErrorRelease(error);
}

}  // namespace
}  // namespace velk::test
