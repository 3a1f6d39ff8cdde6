// All calls of one client, mixed with events from the same thread: the daemon runs them in the order in which they
// were made, whether they leave at once or wait for room behind events.
#include <algorithm>
#include <string>
#include <vector>

#include "client/LogTexts.h"
#include "ipc/Limits.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

class CallOrderTest : public VelkReportingTest, public ::testing::WithParamInterface<bool> {
 protected:
  void SetUp() override {
    _daemon.start();
    _client = VelkReporting::initWithSessionInfo(
        PropertyDictionary{{"ComponentType", 9}, {"SessionID", 7}, {"BatchEvents", GetParam()}}, userInfo(), {});
    ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
    _client->setEndOfLifeBound(std::chrono::minutes(1));  // what is told of here is the order, however slow the machine
    _expected.emplace_back("setSessionInfo");
  }

  /// Every call that takes its turn, an event before each; `first` tells with which of them the round begins.
  void makeCalls(std::size_t first, const PropertyDictionary& payload) {
    constexpr std::size_t kCalls = 8;
    for (std::size_t call = 0; call < kCalls; ++call) {
      sendEvent(payload);
      if (call % 3 == 0) sendEvent(payload);
      makeCall((first + call) % kCalls);
    }
    sendEvent(payload);
  }

  void sendEvent(const PropertyDictionary& payload) {
    const int number = expect("sendMessageWithDictionary");
    Error error;
    if (number % 2 == 0) {
      _client->sendMessageWithCategory(1, static_cast<std::uint16_t>(number), payload, &error);
    } else {
      PropertyDictionary event = message(1, number);
      event.set("ParametersPayload", payload);
      EXPECT_TRUE(_client->sendMessageWithDictionary(event, &error));
    }
    EXPECT_EQ(error, Error());
  }

  /// Holds the reporting queue until `endTick`.
  void beginTick() {
    auto entered = std::make_shared<Semaphore>();
    _client->registerPeriodicTaskForModule(1, true, false, [entered, leave = _leave](auto*) {
      entered->signal();
      leave->wait();
    });
    _client->startLogTimerWithInterval(3600, 0, 3, 4);
    ASSERT_TRUE(entered->waitFor(kPatience));
  }
  void endTick() { _leave->signal(); }

  /// The end of the session goes behind everything else.
  void end() {
    expect("finishSessionGracefully");
    // The last line of a connection: what was not answered by then has failed, and does not tell so in another test.
    auto ended = std::make_shared<Semaphore>();
    log::setSink(std::make_shared<Trigger>(texts::kConnectionInvalidated, [ended] { ended->signal(); }));
    _client.reset();
    EXPECT_TRUE(ended->waitFor(kPatience));
    log::setSink(nullptr);
    ASSERT_TRUE(_daemon.waitForEnds(1));
    std::vector<std::string> arrived;
    for (const auto& call : _daemon.calls()) arrived.push_back(described(call));
    const auto [there, expected] = std::mismatch(arrived.begin(), arrived.end(), _expected.begin(), _expected.end());
    EXPECT_EQ(arrived.size(), _expected.size());
    EXPECT_EQ(there == arrived.end() ? "nothing" : *there, expected == _expected.end() ? "nothing" : *expected)
        << "behind " << there - arrived.begin() << " calls that came in their order";
  }

 private:
  void makeCall(std::size_t which) {
    switch (which) {
      case 0:
        expect("startConfigWithCompletionHandler");
        expect("fetchDisplayURL");
        return _client->startConfigurationWithCompletionHandler(nullptr);
      case 1:
        return _client->fetchReportingStatesWithUserInfo(numbered(expect("fetchStatesWithUserInfo")), nullptr);
      case 2:
        expect("flushMessagesWithCompletion");
        return static_cast<void>(_client->flushMessages());
      case 3: {
        const int number = expect("uploadFileAtPath");
        const auto path = _directory.write(std::to_string(number), "text");
        EXPECT_TRUE(_client->uploadFileWithURL(path, nullptr));
        return;
      }
      case 4:
        EXPECT_TRUE(_client->uploadDataArray(PropertyArray{numbered(expect("uploadLogData"))}, nullptr));
        return;
      case 5:
        return _client->updateSharedDataWithDictionary(numbered(expect("updateSharedDataWithDictionary")));
      case 6:
        return _client->updateSharedDataForKey("n", PropertyValue(expect("updateSharedDataForKey")));
      default:
        EXPECT_TRUE(_client->setDigestKey(ByteData{1}, static_cast<std::uint32_t>(expect("setDigestKey"))));
    }
  }

  static PropertyDictionary numbered(int number) { return {{"n", number}}; }

  /// Takes note of a call that is about to be made; its number, which it carries if it carries anything.
  int expect(const std::string& method) {
    const int number = static_cast<int>(_expected.size());
    const bool isBare = method == "startConfigWithCompletionHandler" || method == "fetchDisplayURL" ||
                        method == "flushMessagesWithCompletion" || method == "finishSessionGracefully";
    _expected.push_back(isBare ? method : method + " " + std::to_string(number));
    return number;
  }

  /// A call in the words of `expect`.
  static std::string described(const FakeDaemon::Call& call) {
    const auto& arguments = call.arguments;
    const auto with = [&call](const PropertyValue* number) {
      return call.method + " " + std::to_string(integerValue(number));
    };
    if (call.method == "sendMessageWithDictionary") return with(arguments[0].dictionary()->find("ParametersType"));
    if (call.method == "fetchStatesWithUserInfo") return with(arguments[0].dictionary()->find("n"));
    if (call.method == "uploadLogData") return with((*arguments[0].array())[0].dictionary()->find("n"));
    if (call.method == "updateSharedDataWithDictionary") return with(arguments[0].dictionary()->find("n"));
    if (call.method == "updateSharedDataForKey" || call.method == "setDigestKey") return with(&arguments[1]);
    if (call.method == "uploadFileAtPath") {
      const std::string& path = *arguments[0].string();
      return call.method + " " + path.substr(path.rfind('/') + 1);
    }
    return call.method;
  }

  const TemporaryDirectory _directory;
  const std::shared_ptr<Semaphore> _leave = std::make_shared<Semaphore>();
  std::vector<std::string> _expected;

 protected:
  /// Of a large event: many fill an outbox, and the room that one leaves when it does not fit is far from what the
  /// small ones and the calls behind it need.
  static constexpr std::size_t kEventBytes = 50'000;

  std::shared_ptr<VelkReporting> _client;
};

TEST_P(CallOrderTest, HoldsBetweenAllCallsAndEvents) {
  // No more rounds than files may wait for their answers.
  for (std::size_t round = 0; round < 60; ++round) makeCalls(round, {{"a", 1}});
  end();
}

TEST_P(CallOrderTest, HoldsBehindATick) {
  beginTick();
  for (std::size_t round = 0; round < 16; ++round) makeCalls(round, {{"a", 1}});
  EXPECT_EQ(_daemon.calls().size(), 1U) << "none overtakes the tick";
  endTick();
  end();
}

TEST_P(CallOrderTest, HoldsBehindAnEventThatWaitsForRoom) {
  // What is queued during a tick has its turn at once, without a byte leaving in between.
  beginTick();
  const PropertyDictionary large{{"text", std::string(kEventBytes, 'x')}};
  for (std::size_t event = 0; event <= ipc::kMaximumOutboxBytes / kEventBytes; ++event) sendEvent(large);
  for (std::size_t round = 0; round < 16; ++round) makeCalls(round, {{"a", 1}});
  endTick();
  end();
}

INSTANTIATE_TEST_SUITE_P(Of, CallOrderTest, ::testing::Bool(),
                         [](const auto& info) { return info.param ? "BatchedEvents" : "EventsAtOnce"; });

TEST(SingleMessageOrder, IsNotThatOfAClientsCalls) {
  RecordingLog log;
  FakeDaemon daemon;
  daemon.start();
  const auto client = VelkReporting::initWithSessionInfo(sessionInfo(), userInfo(), {});
  ASSERT_TRUE(daemon.waitForCalls("setSessionInfo", 1));
  client->sendMessageWithCategory(1, 1);
  EXPECT_TRUE(VelkReporting::sendOneMessageWithSessionInfo(sessionInfo(), userInfo(), 1, 2, std::nullopt));
  ASSERT_TRUE(daemon.waitForCalls("sendMessageWithSessionInfo", 1));
  ASSERT_TRUE(daemon.waitForCalls("sendMessageWithDictionary", 1));
  for (const auto& call : daemon.calls()) {
    EXPECT_EQ(call.connection, call.method == "sendMessageWithSessionInfo" ? 2U : 1U) << call.method;
  }
}

}  // namespace
}  // namespace velk::test
