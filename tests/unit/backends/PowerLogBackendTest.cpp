#include "backends/PowerLogBackend.h"

#include "platform/PowerLog.h"
#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {
namespace {

struct Recorded {
  std::uint32_t client;
  std::string name;
  PropertyDictionary event;
};

class FakePowerLog : public PowerLog {
 public:
  void logRegisteredEvent(std::uint32_t clientIdentifier, std::string_view eventName,
                          const PropertyDictionary& event) override {
    entries.push_back({clientIdentifier, std::string(eventName), event});
  }
  std::vector<Recorded> entries;
};

class PowerLogBackendTest : public BackendTest {
 protected:
  PowerLogBackendTest() { platform.powerLog = &powerLog; }

  void record(const std::optional<PropertyDictionary>& payload, std::uint16_t method, std::uint16_t respCode = 3,
              std::uint16_t eventID = 9) {
    PowerLogBackend::initWithName(context, "power", PropertyDictionary{}, "Lamp")
        ->sendMessageWithoutFlag(payload, kStart, method, respCode, eventID);
  }

  FakePowerLog powerLog;
};

TEST_F(PowerLogBackendTest, RecordsPayloadAndNumbers) {
  record(PropertyDictionary{{"wakeups", 12}}, 65'535, 65'534, 65'533);
  ASSERT_EQ(powerLog.entries.size(), 1U);
  EXPECT_EQ(powerLog.entries[0].client, 28U);
  EXPECT_EQ(powerLog.entries[0].name, "Orlenad-Velk");
  EXPECT_EQ(powerLog.entries[0].event,
            (PropertyDictionary{{"wakeups", 12}, {"method", 65'535}, {"respCode", 65'534}, {"event", 65'533}}));
}

TEST_F(PowerLogBackendTest, ReplacesPayloadEntriesOfTheSameNames) {
  record(PropertyDictionary{{"event", "mine"}, {"method", "mine"}, {"respCode", "mine"}, {"kept", true}}, 7, 3, 9);
  ASSERT_EQ(powerLog.entries.size(), 1U);
  EXPECT_EQ(powerLog.entries[0].event,
            (PropertyDictionary{{"event", 9}, {"method", 7}, {"respCode", 3}, {"kept", true}}));
}

TEST_F(PowerLogBackendTest, RecordsNothingForMethodZero) {
  record(PropertyDictionary{{"a", 1}}, 0);
  EXPECT_TRUE(powerLog.entries.empty());
}

TEST_F(PowerLogBackendTest, RecordsNothingWithoutPayload) {
  record(PropertyDictionary{}, 1);
  record(std::nullopt, 1);
  EXPECT_TRUE(powerLog.entries.empty());
}

TEST_F(PowerLogBackendTest, IsMadeByItsNameForEveryClientType) {
  EXPECT_TRUE(make("power", PropertyDictionary{}));
  EXPECT_TRUE(make("power", PropertyValue()));
  EXPECT_FALSE(make("Power", PropertyDictionary{}));
}

TEST_F(PowerLogBackendTest, RecordsNothingOfWhatSessionsDeliver) {
  const auto backend = make("power", PropertyDictionary{});
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
  EXPECT_EQ(send(*backend, {{"a", 1}}), std::nullopt);
  EXPECT_EQ(backend->sendMessageWithEventID(PropertyDictionary{{"a", 1}}, kStart, 1, 2, 3, 0), std::nullopt);
  EXPECT_TRUE(powerLog.entries.empty()) << "kept: the generic entry reaches an operation that this class lacks";
}

TEST_F(PowerLogBackendTest, DoesNothingWithoutPowerLog) {
  platform.powerLog = nullptr;
  record(PropertyDictionary{{"a", 1}}, 1);
}

}  // namespace
}  // namespace velk::test
