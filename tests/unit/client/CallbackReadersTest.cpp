// What a client tells of the callbacks that it was given, and whom they outlive.

#include <gtest/gtest.h>

#include <atomic>

#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

class CallbackReadersTest : public VelkReportingTest {};

TEST_F(CallbackReadersTest, TheLoggingBlockIsGivenBackAsACopy) {
  const auto client = makeClient();
  EXPECT_FALSE(client->messageLoggingBlock());
  auto calls = std::make_shared<std::atomic<int>>(0);
  client->setMessageLoggingBlock([calls](const std::string&) { ++*calls; });
  flush(*client);
  const auto block = client->messageLoggingBlock();
  ASSERT_TRUE(block);
  block("text");
  EXPECT_EQ(*calls, 1);
  client->setMessageLoggingBlock(nullptr);
  flush(*client);
  EXPECT_FALSE(client->messageLoggingBlock());
  block("another");
  EXPECT_EQ(*calls, 2) << "a copy is the caller's";
}

TEST_F(CallbackReadersTest, TheDelegateHearsOfAllMessagesAlthoughTheClientIsReleasedAtOnce) {
  constexpr int kMessages = 100;
  struct Delegate : VelkReportingMessageSentDelegate {
    void didSendMessageForReportingClient(const std::shared_ptr<VelkReporting>& client,
                                          const PropertyDictionary& event) override {
      if (heard == 0) released.wait();
      EXPECT_EQ(integerValue(event.find("ParametersType")), heard++);
      withoutClient += client == nullptr ? 1 : 0;
      if (heard == kMessages) all.signal();
    }
    Semaphore released;
    Semaphore all;
    int heard = 0;
    int withoutClient = 0;
  };
  const auto delegate = std::make_shared<Delegate>();
  _daemon.start();
  auto client = makeClient();
  client->setMessageSentDelegate(delegate);
  for (int number = 0; number < kMessages; ++number) {
    EXPECT_TRUE(client->sendMessageWithDictionary(message(1, number)));
  }
  client.reset();
  delegate->released.signal();
  ASSERT_TRUE(delegate->all.waitFor(kPatience));
  EXPECT_GE(delegate->withoutClient, kMessages - 1) << "the first may have been told before";
}

}  // namespace
}  // namespace velk::test
