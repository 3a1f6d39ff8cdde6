#include "ipc/SessionProxies.h"

#include <fcntl.h>

#include "ipc/MethodTable.h"
#include "tests/support/RecordingLog.h"
#include "tests/unit/ipc/WireHarness.h"

namespace velk {
namespace {

using namespace test;

/// Writes down what it was asked, and answers when told to.
class RecordingSession final : public ClientSessionInterface {
 public:
  void setSessionInfo(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                      PropertyArray frameworks, bool hasBlock) override {
    asked.append(PropertyArray{"setSessionInfo", std::move(sessionInfo), optional(userInfo), frameworks, hasBlock});
  }
  void startConfigWithCompletionHandler(ConfigurationReply reply) override {
    asked.append("startConfig");
    reply(PropertyArray{"splunk"}, std::nullopt, PropertyArray{3});
  }
  void fetchStatesWithUserInfo(std::optional<PropertyDictionary> userInfo, ConfigurationReply reply) override {
    asked.append(PropertyArray{"fetchStates", optional(userInfo)});
    reply(std::nullopt, std::nullopt, std::nullopt);
  }
  void fetchDisplayURL(TextReply) override { asked.append("fetchDisplayURL"); }
  void sendMessageWithDictionary(PropertyDictionary dictionary, TextReply reply) override {
    hadReply = static_cast<bool>(reply);
    asked.append(PropertyArray{"sendMessage", std::move(dictionary)});
    reply(text.value_or("sent"));
  }
  void flushMessagesWithCompletion(FlushReply reply) override {
    asked.append("flush");
    if (text) return reply(text, std::nullopt);
    reply(std::nullopt, Error{"domain", -1, "none"});
  }
  void finishSessionGracefully() override { asked.append("finish"); }
  void uploadFileAtPath(std::string url, std::string token, FileDescriptor file, UploadReply reply) override {
    asked.append(PropertyArray{"uploadFile", url, token, static_cast<bool>(file)});
    reply(true, false);
  }
  void uploadLogData(PropertyArray logData, LogDataReply reply) override {
    asked.append(PropertyArray{"uploadLogData", std::move(logData)});
    reply(false, Error{"domain", 5, "why"});
  }
  void sendMessageWithSessionInfo(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                                  std::uint16_t category, std::uint16_t type, std::optional<PropertyDictionary> payload,
                                  TextReply reply) override {
    asked.append(PropertyArray{"one", std::move(sessionInfo), optional(userInfo), category, type, optional(payload)});
    reply("finished");
  }
  void updateSharedDataWithDictionary(PropertyDictionary dictionary) override {
    asked.append(PropertyArray{"shared", std::move(dictionary)});
  }
  void updateSharedDataForKey(std::string key, std::optional<PropertyValue> value) override {
    asked.append(PropertyArray{"sharedKey", key, value ? *value : PropertyValue("removed")});
  }
  void setDigestKey(ByteData key, std::int32_t algorithm) override {
    asked.append(PropertyArray{"digest", std::move(key), algorithm});
  }

  static PropertyValue optional(const std::optional<PropertyDictionary>& value) {
    return value ? PropertyValue(*value) : PropertyValue();
  }

  PropertyArray asked;
  bool hadReply = false;
  /// The answer to messages and flushes.
  std::optional<std::string> text;
};

class SessionProxiesTest : public testing::Test {
 protected:
  SessionProxiesTest() {
    auto ends = makeLocalSocketPair();
    client = Connection::adopt(std::move(ends->first), self(), false, loop, queue);
    daemon = Connection::adopt(std::move(ends->second), self(), true, loop, queue);
    daemon->setExportedDispatcher(std::make_shared<SessionInterfaceDispatcher>(session, [this](StatusReply reply) {
      if (statusAllowed) reply(PropertyDictionary{{"sessions", 1}});
    }));
  }
  ~SessionProxiesTest() override {
    client.reset();
    daemon.reset();
    loop.stop();
    queue->dropTasks();
  }
  void resume() {
    client->resume();
    daemon->resume();
  }
  SessionInterfaceProxy proxy() {
    return SessionInterfaceProxy(client, [this](const Error& error) { errors.push_back(error.code); });
  }
  [[nodiscard]] PropertyValue lastAsked(std::size_t count) {
    queue->runUntil([&] { return session->asked.size() >= count; });
    return session->asked[count - 1];
  }
  /// The code of the error that a call of the session interface is answered with; 0 when it is not refused.
  int refusal(std::uint32_t method, const PropertyArray& arguments) {
    std::optional<int> code;
    EXPECT_TRUE(client->callMethod(method, arguments,
                                   [&](Result<PropertyArray> result) { code = result ? 0 : result.error().code; }));
    queue->runUntil([&] { return code.has_value(); });
    return *code;
  }

  RecordingLog recorded;
  EventLoop loop{"test-io"};
  std::shared_ptr<HandQueue> queue = std::make_shared<HandQueue>();
  std::shared_ptr<RecordingSession> session = std::make_shared<RecordingSession>();
  std::shared_ptr<Connection> client;
  std::shared_ptr<Connection> daemon;
  std::vector<int> errors;
  bool statusAllowed = true;
};

TEST_F(SessionProxiesTest, CarriesEveryMethodWithItsArguments) {
  resume();
  const PropertyDictionary info{{"ComponentType", 7}};
  auto calls = proxy();
  calls.setSessionInfo(info, std::nullopt, {"a", "b"}, true);
  EXPECT_EQ(lastAsked(1),
            PropertyValue(PropertyArray({"setSessionInfo", info, nullptr, PropertyArray{"a", "b"}, true})));
  calls.updateSharedDataWithDictionary(info);
  EXPECT_EQ(lastAsked(2), PropertyValue(PropertyArray({"shared", info})));
  calls.updateSharedDataForKey("key", PropertyValue(5));
  EXPECT_EQ(lastAsked(3), PropertyValue(PropertyArray({"sharedKey", "key", 5})));
  calls.updateSharedDataForKey("key", std::nullopt);
  EXPECT_EQ(lastAsked(4), PropertyValue(PropertyArray({"sharedKey", "key", "removed"})));
  calls.setDigestKey({1, 2}, -3);
  EXPECT_EQ(lastAsked(5), PropertyValue(PropertyArray({"digest", ByteData{1, 2}, -3})));
  calls.finishSessionGracefully();
  EXPECT_EQ(lastAsked(6), PropertyValue("finish"));
  calls.sendMessageWithDictionary(info, nullptr);
  EXPECT_EQ(lastAsked(7), PropertyValue(PropertyArray({"sendMessage", info})));
  EXPECT_FALSE(session->hadReply);
  EXPECT_TRUE(errors.empty());
}

TEST_F(SessionProxiesTest, CarriesTheRepliesBack) {
  resume();
  int answers = 0;
  auto calls = proxy();
  calls.startConfigWithCompletionHandler([&](std::optional<PropertyArray> backends, std::optional<PropertyArray> white,
                                             std::optional<PropertyArray> black) {
    EXPECT_EQ(backends, PropertyArray{"splunk"});
    EXPECT_FALSE(white);
    EXPECT_EQ(black, PropertyArray{3});
    ++answers;
  });
  calls.sendMessageWithDictionary({}, [&](std::optional<std::string> text) {
    EXPECT_EQ(text, "sent");
    ++answers;
  });
  calls.flushMessagesWithCompletion([&](std::optional<std::string> text, std::optional<Error> error) {
    EXPECT_FALSE(text);
    EXPECT_EQ(error, (Error{"domain", -1, "none"}));
    ++answers;
  });
  calls.uploadLogData({PropertyDictionary{{"LogData", "x"}}}, [&](bool success, std::optional<Error> error) {
    EXPECT_FALSE(success);
    EXPECT_EQ(error->code, 5);
    ++answers;
  });
  calls.sendMessageWithSessionInfo({}, std::nullopt, 65535, 1, std::nullopt, [&](std::optional<std::string> text) {
    EXPECT_EQ(text, "finished");
    ++answers;
  });
  calls.uploadFileAtPath("file:///x", std::string("to\0ken", 6), FileDescriptor(::open("/dev/null", O_RDONLY)),
                         [&](bool taken, bool delivered) {
                           EXPECT_TRUE(taken);
                           EXPECT_FALSE(delivered);
                           ++answers;
                         });
  calls.copyStatus([&](PropertyDictionary status) {
    EXPECT_EQ(status, (PropertyDictionary{{"sessions", 1}}));
    ++answers;
  });
  queue->runUntil([&] { return answers == 7; });
  EXPECT_EQ(session->asked[5],
            PropertyValue(PropertyArray({"uploadFile", "file:///x", std::string("to\0ken", 6), true})));
  EXPECT_TRUE(errors.empty());
}

TEST_F(SessionProxiesTest, ReportsADroppedReplyOnceAndDropsTheCompletion) {
  resume();
  bool called = false;
  bool abandoned = false;
  proxy().fetchDisplayURL(TextReply([&](std::optional<std::string>) { called = true; },
                                    [&] {
                                      EXPECT_EQ(errors.size(), 1U);
                                      abandoned = true;
                                    }));
  queue->runUntil([&] { return abandoned; });
  EXPECT_FALSE(called);
  EXPECT_EQ(errors, std::vector<int>{static_cast<int>(ConnectionError::dropped)});
}

TEST_F(SessionProxiesTest, ReportsACallThatCannotBeSent) {
  resume();
  client->closeAfterSending();
  bool abandoned = false;
  proxy().sendMessageWithDictionary({}, TextReply([](std::optional<std::string>) {}, [&] { abandoned = true; }));
  proxy().finishSessionGracefully();
  EXPECT_TRUE(abandoned);
  EXPECT_EQ(errors.size(), 2U);
}

TEST_F(SessionProxiesTest, RefusesWrongArgumentsAndStays) {
  resume();
  const auto refused = static_cast<int>(ConnectionError::refused);
  EXPECT_EQ(refusal(99, {}), refused);
  EXPECT_EQ(refusal(32, {nullptr, 0.0, 0, 0, nullptr}), refused);
  EXPECT_EQ(refusal(1, {PropertyDictionary{}, nullptr, PropertyArray{}}), refused);
  EXPECT_EQ(refusal(1, {"no dictionary", nullptr, PropertyArray{}, true}), refused);
  EXPECT_EQ(refusal(1, {PropertyDictionary{}, nullptr, PropertyArray{1}, true}), refused);
  EXPECT_EQ(refusal(1, {PropertyDictionary{}, nullptr, PropertyArray{}, 1}), refused);
  EXPECT_EQ(refusal(2, {1}), refused);
  EXPECT_EQ(refusal(3, {"text"}), refused);
  EXPECT_EQ(refusal(5, {nullptr}), refused);
  EXPECT_EQ(refusal(8, {1, "token"}), refused);
  EXPECT_EQ(refusal(9, {PropertyArray{1}}), refused);
  EXPECT_EQ(refusal(10, {PropertyDictionary{}, nullptr, 65536, 1, nullptr}), refused);
  EXPECT_EQ(refusal(10, {PropertyDictionary{}, nullptr, -1, 1, nullptr}), refused);
  EXPECT_EQ(refusal(11, {PropertyArray{}}), refused);
  EXPECT_EQ(refusal(12, {1, 2}), refused);
  EXPECT_EQ(refusal(13, {1, 2}), refused);
  EXPECT_TRUE(session->asked.empty());
  EXPECT_EQ(refusal(7, {}), 0);
  EXPECT_EQ(session->asked.size(), 1U);
}

TEST_F(SessionProxiesTest, RefusesTheStatusToPeersThatMayNotReadIt) {
  daemon->setExportedDispatcher(std::make_shared<SessionInterfaceDispatcher>(session));
  resume();
  EXPECT_EQ(refusal(64, {}), static_cast<int>(ConnectionError::refused));
}

class RecordingClient final : public ClientSessionReplyInterface {
 public:
  void sendMessageToClient(std::optional<PropertyDictionary> sessionInfo, double timestamp, std::uint16_t category,
                           std::uint16_t type, std::optional<PropertyDictionary> payload) override {
    events.push_back(PropertyArray{RecordingSession::optional(sessionInfo), timestamp, category, type,
                                   RecordingSession::optional(payload)});
  }
  std::vector<PropertyArray> events;
};

TEST_F(SessionProxiesTest, CarriesEventsToTheClient) {
  const auto receiver = std::make_shared<RecordingClient>();
  client->setExportedDispatcher(std::make_shared<ReplyInterfaceDispatcher>(receiver));
  resume();
  ReplyInterfaceProxy toClient(daemon);
  EXPECT_TRUE(toClient.sendMessageToClient(PropertyDictionary{{"a", 1}}, 1.5, 2, 65535, PropertyDictionary{}));
  EXPECT_TRUE(toClient.sendMessageToClient(std::nullopt, 0, 0, 0, std::nullopt));
  queue->runUntil([&] { return receiver->events.size() == 2; });
  EXPECT_EQ(receiver->events[0], (PropertyArray{PropertyDictionary{{"a", 1}}, 1.5, 2, 65535, PropertyDictionary{}}));
  EXPECT_EQ(receiver->events[1], (PropertyArray{nullptr, 0.0, 0, 0, nullptr}));
}

// Only the end of aggregation may use the room that is kept for replies, and no more than that.
TEST_F(SessionProxiesTest, TheEndOfAggregationFitsIntoAFullOutbox) {
  const auto receiver = std::make_shared<RecordingClient>();
  client->setExportedDispatcher(std::make_shared<ReplyInterfaceDispatcher>(receiver));
  ReplyInterfaceProxy toClient(daemon);
  const PropertyDictionary info{{"SessionID", 1}};
  const auto fill = [&](std::size_t bytes) {
    ReplyInterfaceProxy another(daemon);  // which has not been refused anything yet
    std::size_t sent = 0;
    while (another.sendMessageToClient(info, 0, 1, 1, PropertyDictionary{{"text", std::string(bytes, 'x')}})) ++sent;
    return sent;
  };
  // The client does not read yet.
  std::size_t events = fill(100'000) + fill(1'000) + fill(1);
  ASSERT_FALSE(toClient.sendMessageToClient(info, 0, 0, 0, std::nullopt));
  ASSERT_TRUE(toClient.sendMessageToClient(std::nullopt, 0, 0, 0, std::nullopt));
  resume();
  queue->runUntil([&] { return receiver->events.size() == events + 1; });
  EXPECT_EQ(receiver->events.back(), (PropertyArray{nullptr, 0.0, 0, 0, nullptr})) << "behind everything";
}

TEST_F(SessionProxiesTest, AfterAnEventThatDidNotFitNoneIsTriedBeforeAnyWouldFit) {
  const auto receiver = std::make_shared<RecordingClient>();
  client->setExportedDispatcher(std::make_shared<ReplyInterfaceDispatcher>(receiver));
  ReplyInterfaceProxy toClient(daemon);
  const PropertyDictionary large{{"text", std::string(900'000, 'x')}};
  std::size_t events = 0;
  while (toClient.sendMessageToClient(std::nullopt, 0, 1, 1, large)) ++events;
  const auto small = toClient.sendMessageToClient(std::nullopt, 0, 1, 1, PropertyDictionary{});
  ASSERT_FALSE(small) << "it would fit, and so would have been encoded";
  EXPECT_EQ(small.error().code, static_cast<int>(ConnectionError::outboxFull));
  resume();
  queue->runUntil([&] { return receiver->events.size() == events; });
  EXPECT_TRUE(daemon->waitUntilSent(kPatience));
  EXPECT_TRUE(toClient.sendMessageToClient(std::nullopt, 0, 1, 1, PropertyDictionary{}));
  queue->runUntil([&] { return receiver->events.size() == events + 1; });
}

TEST_F(SessionProxiesTest, EndsOfAggregationThatNobodyReadsAreBounded) {
  ReplyInterfaceProxy toClient(daemon);
  Result<void> sent;
  std::size_t count = 0;
  while (count < ipc::kMaximumOutboxBytes && (sent = toClient.sendMessageToClient(std::nullopt, 0, 0, 0, std::nullopt)))
    ++count;
  ASSERT_FALSE(sent);
  EXPECT_EQ(sent.error().code, static_cast<int>(ConnectionError::outboxFull));
}

TEST_F(SessionProxiesTest, CutsATextThatIsLargerThanAFrame) {
  std::string large;
  while (large.size() < ipc::kMaximumReplyTextBytes) large += "\xC3\xA9";
  large.insert(0, "x");  // so that the bound lies within a character
  large += "the end";
  session->text = large;
  resume();
  std::optional<std::string> flushed;
  std::optional<std::string> sent;
  SessionInterfaceProxy proxy(client);
  proxy.flushMessagesWithCompletion([&](std::optional<std::string> text, std::optional<Error> error) {
    EXPECT_FALSE(error) << error->description;
    flushed = std::move(text);
  });
  proxy.sendMessageWithDictionary({}, [&](std::optional<std::string> text) { sent = std::move(text); });
  queue->runUntil([&] { return sent.has_value(); });
  const std::size_t kept = ipc::kMaximumReplyTextBytes - 1;
  const std::string expected =
      large.substr(0, kept) + "\n(" + std::to_string(large.size() - kept) + " more bytes are left out)";
  EXPECT_TRUE(flushed == expected);
  EXPECT_TRUE(sent == expected);
}

TEST_F(SessionProxiesTest, RefusesAnEventThatIsTooLargeAndLivesOn) {
  resume();
  const auto sent = ReplyInterfaceProxy(daemon).sendMessageToClient(
      std::nullopt, 0, 1, 1, PropertyDictionary{{"text", std::string(ipc::kMaximumFrameBytes, 'x')}});
  ASSERT_FALSE(sent);
  EXPECT_EQ(sent.error().code, static_cast<int>(ConnectionError::tooLarge));
  EXPECT_FALSE(daemon->hasEnded());
}

TEST(MethodTable, FindsMethodsByNumberAndName) {
  for (const auto& method : allMethods()) {
    EXPECT_EQ(methodWithName(method.name), methodWithNumber(static_cast<std::uint32_t>(method.method)));
  }
  EXPECT_EQ(methodWithName("sendMessageWithDictionary")->method, Method::sendMessageWithDictionary);
  EXPECT_EQ(methodWithNumber(0), nullptr);
}

}  // namespace
}  // namespace velk
