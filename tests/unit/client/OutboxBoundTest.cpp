// The bound on events that wait: it counts those that have not had their turn on the reporting queue, too, although a
// daemon is there to take them.
#include "client/EventOutbox.h"
#include "tests/unit/client/HeldQueueFixture.h"

namespace velk::test {
namespace {

using OutboxBoundTest = HeldQueueTest;

TEST_F(OutboxBoundTest, CountsWhatWaitsForTheReportingQueue) {
  constexpr int kEvents = 16'384;
  Error error;
  for (int event = 0; event < kEvents; ++event) {
    ASSERT_TRUE(_client->sendMessageWithDictionary(message(1, event), &error)) << event << ": " << error.description;
  }
  EXPECT_FALSE(_client->sendMessageWithDictionary(message(1, kEvents), &error));
  EXPECT_EQ(error.domain, "VelkReportingErrorDomain");
  EXPECT_EQ(error.code, 8);
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), 0U) << "none had its turn yet";
  letGo();
  EXPECT_FALSE(flush(*_client));  // behind them all
  int next = 0;
  for (const auto& call : _daemon.calls()) {
    if (call.method != "sendMessageWithDictionary") continue;
    ASSERT_EQ(integerValue(call.arguments[0].dictionary()->find("ParametersType")), next++);
  }
  EXPECT_EQ(next, kEvents) << "the refused one never arrives";
  EXPECT_EQ(_log.count(log::Level::error,
                       "sendMessageWithDictionary: 1 events were refused while the daemon was away or slow"),
            1);
  EXPECT_TRUE(_client->sendMessageWithDictionary(message(1), &error)) << "there is room again";
}

TEST_F(OutboxBoundTest, CountsBytesThatWaitForTheReportingQueue) {
  PropertyDictionary event = message(1);
  event.set("ParametersPayload", PropertyDictionary{{"text", std::string(500'000, 'x')}});
  constexpr std::size_t kFitting = EventRoom::kMaximumBytes / 500'000;
  Error error;
  for (std::size_t sent = 0; sent < kFitting; ++sent) {
    ASSERT_TRUE(_client->sendMessageWithDictionary(event, &error)) << sent << ": " << error.description;
  }
  EXPECT_FALSE(_client->sendMessageWithDictionary(event, &error));
  EXPECT_EQ(error.code, 8);
  EXPECT_TRUE(_client->sendMessageWithDictionary(message(1), &error)) << "a small one still fits";
  letGo();
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", kFitting + 1));
  EXPECT_FALSE(flush(*_client));
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), kFitting + 1) << "the refused one never arrives";
}

}  // namespace
}  // namespace velk::test
