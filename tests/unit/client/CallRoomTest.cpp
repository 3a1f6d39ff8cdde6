// Calls for which a connection has no room just now wait for it, as events do.
#include "ipc/CallBody.h"
#include "ipc/FrameHeader.h"
#include "ipc/MethodTable.h"
#include "tests/unit/client/HeldQueueFixture.h"

namespace velk::test {
namespace {

class CallRoomTest : public HeldQueueTest {
 protected:
  static PropertyDictionary event(std::size_t textSize) {
    PropertyDictionary made = message(1);
    made.set("ParametersPayload", PropertyDictionary{{"text", std::string(textSize, 'x')}});
    return made;
  }
  static std::size_t bytesOnTheWire(const PropertyDictionary& event) {
    std::vector<std::uint8_t> body;
    CborWriter writer(body, ipc::kMaximumFrameBytes);
    ipc::writeCallBody(writer, static_cast<std::uint32_t>(Method::sendMessageWithDictionary), 1,
                       [&event](CborWriter& arguments) { arguments.value(event); });
    return ipc::kFrameHeaderBytes + body.size();
  }
  /// Sends events that fill an empty outbox but for so many bytes.
  void sendEventsThatLeave(std::size_t room) {
    constexpr std::size_t kTextSize = 800'000;
    const std::size_t last = ipc::kMaximumOutboxBytes - room - 2 * bytesOnTheWire(event(kTextSize));
    const std::size_t overhead = bytesOnTheWire(event(kTextSize)) - kTextSize;
    for (const std::size_t size : {kTextSize, kTextSize, last - overhead}) {
      Error error;
      EXPECT_TRUE(_client->sendMessageWithDictionary(event(size), &error)) << error.description;
    }
  }
};

TEST_F(CallRoomTest, ConfigurationWaitsForRoomBehindEventsThatJustFitted) {
  sendEventsThatLeave(10);
  auto states = std::make_shared<std::optional<PropertyArray>>();
  auto answered = std::make_shared<Semaphore>();
  _client->startConfigurationWithCompletionHandler([states, answered](const auto& enabled) {
    *states = enabled;
    answered->signal();
  });
  letGo();
  ASSERT_TRUE(answered->waitFor(kPatience));
  EXPECT_EQ(*states, (PropertyArray{"splunk"})) << "the daemon is there, and reads";
  EXPECT_FALSE(_log.contains("Failed to get remote object proxy"));
  EXPECT_FALSE(flush(*_client));
  EXPECT_EQ(_daemon.count("startConfigWithCompletionHandler"), 1U) << "the session would never have its backends";
}

TEST_F(CallRoomTest, SharedDataWaitsForRoomBehindOtherCalls) {
  const PropertyDictionary large{{"text", std::string(900'000, 'x')}};
  for (int call = 0; call < 3; ++call) _client->updateSharedDataWithDictionary(large);
  letGo();
  EXPECT_FALSE(flush(*_client));
  EXPECT_EQ(_daemon.count("updateSharedDataWithDictionary"), 3U) << "the daemon is there, and reads";
  EXPECT_FALSE(_log.contains("Failed to get remote object proxy"));
}

}  // namespace
}  // namespace velk::test
