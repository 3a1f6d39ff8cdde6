#include "tools/ctl/Conversation.h"

#include <gtest/gtest.h>

#include <cmath>
#include <filesystem>
#include <sstream>

#include "tests/support/TemporaryDirectory.h"

namespace velk::ctl {
namespace {

class RecordingWire final : public SessionWire {
 public:
  struct Call {
    Method method;
    PropertyArray arguments;
    ReplyHandler reply;
    std::size_t descriptors = 0;
  };

  Result<void> call(const MethodDescription& method, const PropertyArray& arguments, ReplyHandler reply,
                    std::vector<FileDescriptor> descriptors) override {
    if (refusal) return Failure(*refusal);
    calls.push_back({method.method, arguments, std::move(reply), descriptors.size()});
    return {};
  }

  std::vector<Call> calls;
  std::optional<Error> refusal;
};

class ConversationTest : public ::testing::Test {
 protected:
  double take(std::string_view line) { return conversation.take(line, ++number, wire); }

  std::ostringstream printed;
  tools::JsonLines lines{printed};
  Conversation conversation{lines};
  RecordingWire wire;
  int number = 0;
};

TEST_F(ConversationTest, WritesAReplyWithItsMethodAndLine) {
  EXPECT_EQ(take(R"({"method":"startConfigWithCompletionHandler"})"), 0);
  ASSERT_EQ(wire.calls.size(), 1u);
  wire.calls[0].reply(PropertyArray{PropertyArray{"splunk"}, nullptr, PropertyArray()});
  EXPECT_EQ(printed.str(),
            "{\"method\":\"startConfigWithCompletionHandler\",\"line\":1,\"reply\":[[\"splunk\"],null,[]]}\n");
  conversation.waitForReplies();
}

TEST_F(ConversationTest, WritesRepliesInTheOrderInWhichTheyCome) {
  (void)take(R"({"method":"fetchDisplayURL"})");
  (void)take(R"({"method":"fetchDisplayURL"})");
  wire.calls[1].reply(PropertyArray{"b"});
  wire.calls[0].reply(PropertyArray{"a"});
  EXPECT_EQ(printed.str(),
            "{\"method\":\"fetchDisplayURL\",\"line\":2,\"reply\":[\"b\"]}\n"
            "{\"method\":\"fetchDisplayURL\",\"line\":1,\"reply\":[\"a\"]}\n");
}

TEST_F(ConversationTest, NamesThePartsOfAnError) {
  (void)take(R"({"method":"flushMessagesWithCompletion"})");
  wire.calls[0].reply(PropertyArray{nullptr, PropertyArray{"VelkReportingErrorDomain", -1, "Nothing to flush"}});
  EXPECT_EQ(printed.str(),
            "{\"method\":\"flushMessagesWithCompletion\",\"line\":1,\"reply\":[null,{\"domain\":"
            "\"VelkReportingErrorDomain\",\"code\":-1,\"description\":\"Nothing to flush\"}]}\n");
}

TEST_F(ConversationTest, LeavesListsInOtherRepliesAlone) {
  (void)take(R"({"method":"startConfigWithCompletionHandler"})");
  wire.calls[0].reply(PropertyArray{PropertyArray{"a"}, PropertyArray{1, 2, 3}, nullptr});
  EXPECT_NE(printed.str().find("\"reply\":[[\"a\"],[1,2,3],null]"), std::string::npos) << printed.str();
}

TEST_F(ConversationTest, SaysNothingOfAMethodWithoutReply) {
  (void)take(R"({"method":"finishSessionGracefully"})");
  ASSERT_EQ(wire.calls.size(), 1u);
  wire.calls[0].reply(PropertyArray());
  EXPECT_EQ(printed.str(), "");
}

TEST_F(ConversationTest, TellsWhenTheDaemonRefusesTheArguments) {
  (void)take(R"({"method":"setSessionInfo","sessionInfo":5})");
  wire.calls[0].reply(Failure(connectionError(ConnectionError::refused, "wrong types")));
  EXPECT_EQ(printed.str(), "{\"error\":\"wrong types\",\"line\":1,\"method\":\"setSessionInfo\"}\n");
}

TEST_F(ConversationTest, TellsOfARepliesLossButNotOfAnAcknowledgements) {
  (void)take(R"({"method":"flushMessagesWithCompletion"})");
  (void)take(R"({"method":"finishSessionGracefully"})");
  for (auto& call : wire.calls) call.reply(Failure(connectionError(ConnectionError::ended, "it ended")));
  EXPECT_EQ(printed.str(), "{\"error\":\"it ended\",\"line\":1,\"method\":\"flushMessagesWithCompletion\"}\n");
  conversation.waitForReplies();
}

TEST_F(ConversationTest, TellsWhenACallCannotBeSent) {
  wire.refusal = connectionError(ConnectionError::tooLarge, "too large");
  (void)take(R"({"method":"fetchDisplayURL"})");
  EXPECT_EQ(printed.str(), "{\"error\":\"too large\",\"line\":1}\n");
  conversation.waitForReplies();
}

TEST_F(ConversationTest, ComplainsOfALineAndGoesOn) {
  (void)take("nonsense");
  (void)take("");
  (void)take("  \r");
  (void)take(R"({"method":"fetchDisplayURL"})");
  EXPECT_EQ(wire.calls.size(), 1u);
  EXPECT_NE(printed.str().find("\"line\":1}"), std::string::npos) << printed.str();
}

TEST_F(ConversationTest, HandsTheSecondsOfAWaitBack) {
  EXPECT_EQ(take(R"({"method":"wait","seconds":2.5})"), 2.5);
  EXPECT_TRUE(wire.calls.empty());
}

TEST_F(ConversationTest, SendsADescriptorAndATokenWithAnUpload) {
  const test::TemporaryDirectory directory;
  const std::string path = directory.write("log", "text");
  (void)take("{\"method\":\"uploadFileAtPath\",\"path\":\"" + path + "\"}");
  ASSERT_EQ(wire.calls.size(), 1u) << printed.str();
  EXPECT_EQ(wire.calls[0].descriptors, 1u);
  ASSERT_EQ(wire.calls[0].arguments.size(), 2u);
  EXPECT_EQ(*wire.calls[0].arguments[0].string(), path);
  ASSERT_NE(wire.calls[0].arguments[1].data(), nullptr);
  EXPECT_GE(wire.calls[0].arguments[1].data()->size(), 16u);
  wire.calls[0].reply(PropertyArray{true});
  EXPECT_NE(printed.str().find("\"reply\":[true]"), std::string::npos);
}

TEST_F(ConversationTest, RemovesAFileThatAServerHas) {
  const test::TemporaryDirectory directory;
  const std::string kept = directory.write("kept", "text");
  const std::string delivered = directory.write("delivered", "text");
  const std::string replaced = directory.write("replaced", "text");
  for (const auto& path : {kept, delivered, replaced}) {
    (void)take("{\"method\":\"uploadFileAtPath\",\"path\":\"" + path + "\"}");
  }
  std::filesystem::remove(replaced);
  (void)directory.write("replaced", "another one");
  wire.calls[0].reply(PropertyArray{true, false});
  wire.calls[1].reply(PropertyArray{true, true});
  wire.calls[2].reply(PropertyArray{true, true});
  EXPECT_TRUE(std::filesystem::exists(kept));
  EXPECT_FALSE(std::filesystem::exists(delivered));
  EXPECT_EQ(directory.read("replaced"), "another one");
  EXPECT_EQ(printed.str(),
            "{\"method\":\"uploadFileAtPath\",\"line\":1,\"reply\":[true]}\n"
            "{\"method\":\"uploadFileAtPath\",\"line\":2,\"reply\":[true]}\n"
            "{\"method\":\"uploadFileAtPath\",\"line\":3,\"reply\":[true]}\n");
}

TEST_F(ConversationTest, ComplainsOfAFileThatIsNotThere) {
  (void)take(R"({"method":"uploadFileAtPath","path":"/nowhere/at/all"})");
  EXPECT_TRUE(wire.calls.empty());
  EXPECT_NE(printed.str().find("\"error\""), std::string::npos);
}

TEST_F(ConversationTest, WritesWhatTheDaemonCalls) {
  conversation.sendMessageToClient(PropertyDictionary{{"SessionID", 1}}, 2.5, 3, 4, PropertyDictionary{{"d", Date{5}}});
  conversation.sendMessageToClient(std::nullopt, 0, 0, 0, std::nullopt);
  EXPECT_EQ(printed.str(),
            "{\"event\":\"sendMessageToClient\",\"sessionInfo\":{\"SessionID\":1},\"timestamp\":2.5,\"category\":3,"
            "\"type\":4,\"payload\":{\"d\":{\"$date\":5.0}}}\n"
            "{\"event\":\"sendMessageToClient\",\"sessionInfo\":null,\"timestamp\":0.0,\"category\":0,\"type\":0,"
            "\"payload\":null}\n");
}

TEST_F(ConversationTest, WritesValuesThatJsonHasNoFormFor) {
  (void)take(R"({"method":"fetchDisplayURL"})");
  wire.calls[0].reply(PropertyArray{std::nan(""), ByteData{1, 2}});
  EXPECT_NE(printed.str().find("\"reply\":[null,{\"$data\":\"AQI=\"}]"), std::string::npos) << printed.str();
}

TEST_F(ConversationTest, AnnouncesTheEnd) {
  conversation.announce("interrupted");
  EXPECT_EQ(printed.str(), "{\"event\":\"interrupted\"}\n");
}

}  // namespace
}  // namespace velk::ctl
