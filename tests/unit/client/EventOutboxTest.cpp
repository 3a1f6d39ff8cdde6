#include "client/EventOutbox.h"

#include <gtest/gtest.h>

#include "ipc/SessionProxies.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

PropertyDictionary eventWith(PropertyValue payload) {
  PropertyDictionary event = message(1);
  event.set("ParametersPayload", std::move(payload));
  return event;
}

PropertyValue nestedArrays(int depth) {
  PropertyValue value = 1;
  while (depth-- > 0) value = PropertyArray{value};
  return value;
}

/// Twice itself, so many times.
PropertyValue doubled(int times) {
  PropertyArray array;
  while (times-- > 0) array.append(array);
  return array;
}

TEST(EventEstimate, CallsNothingSurelySendableThatIsNot) {
  for (int depth = 0; depth < 40; ++depth) {
    const PropertyDictionary event = eventWith(nestedArrays(depth));
    EXPECT_EQ(estimateEvent(event).isSurelySendable, depth <= 30) << depth;
    EXPECT_EQ(SessionInterfaceProxy::reasonNotToSend(event) == nullptr, depth <= 30) << depth;
  }
  for (int number : {4000, 4090, 4096, 4097, 5000}) {
    PropertyDictionary keys;
    for (int key = 0; key < number; ++key) keys.set(std::to_string(key), nullptr);
    const PropertyDictionary event = eventWith(keys);
    EXPECT_EQ(SessionInterfaceProxy::reasonNotToSend(event) == nullptr, number <= 4096) << number;
    EXPECT_FALSE(estimateEvent(event).isSurelySendable && number > 4096) << number;
  }
  for (std::size_t length = 0; length < 20; ++length) {
    std::string text(length, 'x');
    EXPECT_TRUE(estimateEvent(eventWith(text)).isSurelySendable) << length;
    for (std::size_t at = 0; at < length; ++at) {
      std::string broken = text;
      broken[at] = '\xff';
      EXPECT_FALSE(estimateEvent(eventWith(broken)).isSurelySendable) << length << ", " << at;
      EXPECT_STREQ(SessionInterfaceProxy::reasonNotToSend(eventWith(broken)), "text that is not UTF-8");
      EXPECT_FALSE(estimateEvent(eventWith(PropertyDictionary{{broken, 1}})).isSurelySendable) << "a key";
    }
  }
  EXPECT_EQ(SessionInterfaceProxy::reasonNotToSend(eventWith("gr\u00fc\u00df")), nullptr)
      << "asked, since it is not plain";
  EXPECT_EQ(SessionInterfaceProxy::reasonNotToSend(eventWith(std::string(100'000, 'x'))), nullptr)
      << "asked, since it is large";
  EXPECT_STREQ(SessionInterfaceProxy::reasonNotToSend(eventWith(ByteData(1024 * 1024))), "too large for a frame");
}

TEST(EventEstimate, WalksNoFurtherThanTheOutboxIsLarge) {
  const PropertyDictionary event = eventWith(doubled(30));
  const EventEstimate estimate = estimateEvent(event);
  EXPECT_GT(estimate.size, EventRoom::kMaximumBytes);
  EXPECT_LT(estimate.size, 2 * EventRoom::kMaximumBytes);
  EXPECT_FALSE(estimate.isSurelySendable);
  EXPECT_STREQ(SessionInterfaceProxy::reasonNotToSend(event), "too many values");
}

class EventsThatContainThemselves : public VelkReportingTest {};

TEST_F(EventsThatContainThemselves, AreRefusedAtOnce) {
  struct Delegate : VelkReportingMessageSentDelegate {
    void didSendMessageForReportingClient(const std::shared_ptr<VelkReporting>&, const PropertyDictionary&) override {}
  };
  const auto client = makeClient();
  const auto delegate = std::make_shared<Delegate>();
  client->setMessageSentDelegate(delegate);
  Error error;
  EXPECT_FALSE(client->sendMessageWithDictionary(eventWith(doubled(30)), &error));
  EXPECT_EQ(error.code, 12);
}

}  // namespace
}  // namespace velk::test
