// Events that no daemon could be sent: too large, too many values, too deep; and more of them than may wait. Whoever
// sends one is told at once.

#include <chrono>
#include <thread>

#include "client/LogTexts.h"
#include "tests/unit/client/CInterfaceFixture.h"

namespace velk::test {
namespace {

VelkReportingValue* messageWith(const VelkReportingValue* payload) {
  VelkReportingValue* message = json(R"({"ParametersCategory": 9, "ParametersType": 1})");
  EXPECT_TRUE(VelkReportingDictionarySet(message, "ParametersPayload", payload));
  return message;
}

/// Dictionaries within each other, so many.
VelkReportingValue* nested(int depth) {
  VelkReportingValue* value = VelkReportingDictionaryCreate();
  while (--depth > 0) {
    VelkReportingValue* outer = VelkReportingDictionaryCreate();
    EXPECT_TRUE(VelkReportingDictionarySet(outer, "within", value));
    VelkReportingValueRelease(value);
    value = outer;
  }
  return value;
}

VelkReportingValue* textOf(std::size_t size) {
  VelkReportingValue* value = VelkReportingDictionaryCreate();
  EXPECT_TRUE(VelkReportingDictionarySetString(value, "text", std::string(size, 'x').c_str()));
  return value;
}

VelkReportingValue* keys(int number) {
  VelkReportingValue* value = VelkReportingDictionaryCreate();
  for (int key = 0; key < number; ++key) VelkReportingDictionarySetBoolean(value, std::to_string(key).c_str(), true);
  return value;
}

VelkReportingValue* elements(int number) {
  VelkReportingValue* value = VelkReportingDictionaryCreate();
  VelkReportingValue* array = VelkReportingArrayCreate();
  VelkReportingValue* element = VelkReportingValueCreateNull();
  while (number-- > 0) VelkReportingArrayAppend(array, element);
  EXPECT_TRUE(VelkReportingDictionarySet(value, "array", array));
  VelkReportingValueRelease(element);
  VelkReportingValueRelease(array);
  return value;
}

class CInterfaceLimitsTest : public CInterfaceTest {
 protected:
  void expectTaken(VelkReportingClient* client, VelkReportingValue* payload) {
    const Value owned(payload);
    const Value message(messageWith(owned));
    const std::size_t before = _daemon.count("sendMessageWithDictionary");
    VelkReportingError* error = nullptr;
    EXPECT_TRUE(VelkReportingSendMessageWithDictionary(client, message, &error));
    EXPECT_EQ(error, nullptr);
    EXPECT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", before + 1)) << "what is taken arrives";
  }

  void expectRefusal(VelkReportingClient* client, VelkReportingValue* payload, const std::string& reason) {
    const Value owned(payload);
    expectRefusalOfMessage(client, owned, reason);
    VelkReportingError* error = nullptr;
    EXPECT_FALSE(sendOne(owned, &error));
    expectError(error, reason);
  }

  /// By the functions that put the payload into a message.
  void expectRefusalOfMessage(VelkReportingClient* client, const VelkReportingValue* payload,
                              const std::string& reason) {
    const Value message(messageWith(payload));
    const std::string line = "sendMessageWithDictionary: Event 9 cannot be sent: " + reason;
    const int before = _log.count(log::Level::error, line);
    VelkReportingError* error = nullptr;
    EXPECT_FALSE(VelkReportingSendMessageWithDictionary(client, message, &error));
    expectError(error, reason);
    EXPECT_TRUE(VelkReportingSendMessageWithError(client, 9, 1, payload, &error)) << "as when it is filtered";
    expectError(error, reason);
    EXPECT_EQ(_log.count(log::Level::error, line), before + 2);
  }

  [[nodiscard]] bool sendOne(const VelkReportingValue* payload, VelkReportingError** error) {
    return VelkReportingSendOneMessage(_session, _user, 9, 1, payload, error);
  }
  /// The end of earlier ones may still be on its way. False when none comes.
  [[nodiscard]] bool sendOneWhenThereIsRoom() {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (!sendOne(nullptr, nullptr)) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::yield();
    }
    return true;
  }

 private:
  static void expectError(VelkReportingError* error, const std::string& reason) {
    ASSERT_NE(error, nullptr);
    EXPECT_EQ(VelkReportingErrorGetCode(error), kVelkReportingErrorNotSendable);
    EXPECT_STREQ(VelkReportingErrorGetDomain(error), ::kVelkReportingErrorDomain);
    EXPECT_EQ(VelkReportingErrorGetDescription(error), "the event cannot be sent: " + reason);
    VelkReportingErrorRelease(error);
  }
};

TEST_F(CInterfaceLimitsTest, EventsNestThirtyOneDeep) {
  _daemon.start();
  const Client client(create());
  expectTaken(client, nested(30));  // the message itself is the first
  const Value thirtyOne(nested(31));
  expectRefusalOfMessage(client, thirtyOne, "values nested too deep");
  EXPECT_TRUE(sendOne(thirtyOne, nullptr)) << "no message stands around it";
  EXPECT_TRUE(_daemon.waitForCalls("sendMessageWithSessionInfo", 1));
  expectRefusal(client, nested(32), "values nested too deep");
  expectRefusal(client, nested(63), "values nested too deep");
}

TEST_F(CInterfaceLimitsTest, EventsFitIntoAFrame) {
  _daemon.start();
  const Client client(create());
  expectTaken(client, textOf(1024 * 1024 - 100));
  expectRefusal(client, textOf(1024 * 1024), "too large for a frame");
}

TEST_F(CInterfaceLimitsTest, EventsHoldSoManyValues) {
  _daemon.start();
  const Client client(create());
  expectTaken(client, keys(4096));
  expectRefusal(client, keys(4097), "too many values");
  expectTaken(client, elements(65'000));
  expectRefusal(client, elements(65'536), "too many values");
}

TEST_F(CInterfaceLimitsTest, SoManySingleMessagesMayWait) {
  constexpr std::size_t kMost = 256;
  _daemon.start();
  _daemon.holdCalls(true);
  for (std::size_t taken = 0; taken < kMost; ++taken) ASSERT_TRUE(sendOneWhenThereIsRoom()) << taken;
  VelkReportingError* error = nullptr;
  EXPECT_FALSE(sendOne(nullptr, &error));
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(VelkReportingErrorGetCode(error), kVelkReportingErrorOutboxFull);
  EXPECT_STREQ(VelkReportingErrorGetDomain(error), ::kVelkReportingErrorDomain);
  EXPECT_STREQ(VelkReportingErrorGetDescription(error), "too many single messages are under way");
  VelkReportingErrorRelease(error);
  _daemon.holdCalls(false);
  EXPECT_TRUE(_daemon.waitForCalls("sendMessageWithSessionInfo", kMost)) << "what is taken arrives";
  EXPECT_TRUE(sendOneWhenThereIsRoom()) << "each gives its place back";
}

TEST_F(CInterfaceLimitsTest, WhatIsRefusedTakesNoRoomInTheOutbox) {
  const Client client(create());  // nobody listens
  const Value deep(nested(40));
  for (int event = 0; event < 20'000; ++event) {
    VelkReportingError* error = nullptr;
    EXPECT_TRUE(VelkReportingSendMessageWithError(client, 9, 1, deep, &error));
    ASSERT_EQ(VelkReportingErrorGetCode(error), kVelkReportingErrorNotSendable);
    VelkReportingErrorRelease(error);
  }
  VelkReportingError* error = nullptr;
  EXPECT_TRUE(VelkReportingSendMessageWithError(client, 9, 1, nullptr, &error));
  EXPECT_EQ(error, nullptr);
}

TEST_F(CInterfaceLimitsTest, FilteredEventsStayFiltered) {
  _daemon.start();
  _daemon.setConfiguration(PropertyArray{}, PropertyArray{3}, std::nullopt);
  const Client client(create());
  configureAndWait(client);
  const Value deep(nested(40));
  const Value message(messageWith(deep));
  VelkReportingError* error = nullptr;
  EXPECT_FALSE(VelkReportingSendMessageWithDictionary(client, message, &error));
  EXPECT_EQ(error, nullptr);
}

TEST_F(CInterfaceLimitsTest, AReportTooLargeIsAnErrorInTheLog) {
  _daemon.start();
  const Client client(create());
  Context context;
  const auto serveTooMuch = [](VelkReportingValue* statistics, void* own) {
    const Value much(textOf(1024 * 1024));
    VelkReportingDictionarySet(statistics, "much", much);
    static_cast<Context*>(own)->called.signal();
  };
  EXPECT_TRUE(VelkReportingClientRegisterPeriodicTask(client, 1, false, true, serveTooMuch, &context, nullptr));
  VelkReportingClientStartLogTimer(client, 3600, 1, 9, 1);
  ASSERT_TRUE(context.called.waitFor(kPatience));
  EXPECT_TRUE(VelkReportingClientUnregisterPeriodicTask(client, 1));  // waits for the tick
  flushAndWait(client);
  EXPECT_EQ(_log.count(log::Level::error, "sendMessageWithDictionary: Event 9 cannot be sent: too large for a frame"),
            1);
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), 0U);
}

TEST_F(CInterfaceLimitsTest, OtherCallsThatCanNeverBeSentAreErrorsInTheLog) {
  _daemon.start();
  const Client client(create());
  const Value deep(nested(40));
  VelkReportingUpdateSharedDataWithDictionary(client, deep);
  VelkReportingUpdateSharedDataForKey(client, "key", deep);
  const Value logData(VelkReportingArrayCreate());
  EXPECT_TRUE(VelkReportingArrayAppend(logData, deep));
  EXPECT_TRUE(VelkReportingUploadLogWithArray(client, logData));
  const Value session(json(R"({"ComponentType": 9, "SessionID": 7})"));
  EXPECT_TRUE(VelkReportingDictionarySet(session, "deep", deep));
  const Client undescribed(VelkReportingClientCreate(session, _user, nullptr));
  flushAndWait(client);
  for (const char* method :
       {"initWithSessionInfo", "updateSharedDataWithDictionary", "updateSharedDataForKey", "uploadDataArray"}) {
    const std::string line = std::string(method) + ": Failed to get remote object proxy: values nested too deep";
    EXPECT_EQ(_log.count(log::Level::error, line), 1) << line;
  }
}

TEST_F(CInterfaceLimitsTest, LogDataAreDictionaries) {
  _daemon.start();
  const Client client(create());
  const Value mixed(VelkReportingValueCreateFromJSON(R"([{"LogData": "line"}, 1])", nullptr));
  EXPECT_FALSE(VelkReportingUploadLogWithArray(client, mixed)) << "the daemon would refuse it, and nobody would know";
  EXPECT_EQ(_log.count(log::Level::error, texts::kLogDataIsNoDictionary), 1);
  const Value empty(VelkReportingArrayCreate());
  EXPECT_FALSE(VelkReportingUploadLogWithArray(client, empty));
  EXPECT_EQ(_log.count(texts::kLogDataArrayIsEmpty), 1);
}

TEST_F(CInterfaceLimitsTest, OnlyTextsAreFrameworks) {
  _daemon.start();
  const Value frameworks(VelkReportingValueCreateFromJSON(R"(["one", 2, null, "three"])", nullptr));
  const Client client(VelkReportingClientCreate(_session, _user, frameworks));
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1)) << "a session is not lost for a name";
  EXPECT_EQ(_daemon.calls()[0].arguments[2], (PropertyArray{"one", "three"}));
}

}  // namespace
}  // namespace velk::test
