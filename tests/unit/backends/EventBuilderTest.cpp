#include "backends/EventBuilder.h"

#include <cmath>
#include <limits>

#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {
namespace {

std::vector<std::string> keysOf(const PropertyDictionary& dictionary) {
  std::vector<std::string> keys;
  for (const auto& entry : dictionary) keys.push_back(entry.key);
  return keys;
}

class EventBuilderTest : public ::testing::Test {
 protected:
  EventAttributes attributes() {
    return EventAttributes{.startTimestamp = static_cast<double>(kNow) + 0.25,
                           .isInternal = isInternal,
                           .compType = compType,
                           .sessionID = 4242,
                           .clientVersion = 65'535,
                           .combinedSessionID = "c2Vzc2lvbg==",
                           .productFamily = family,
                           .hardwareType = hardware,
                           .productVersion = product,
                           .buildVersion = build,
                           .reportVersion = version,
                           .timeZoneOffset = -3600};
  }
  PropertyDictionary built(const PropertyDictionary& payload = {}) {
    return newEventDict(payload, attributes(), EventStamp{TimeValue{kNow + 10, 500'000}, 7, 3, 9}, 0);
  }

  bool isInternal = false;
  std::int32_t compType = 20;
  std::optional<std::string> family = "Lamp";
  std::optional<std::string> hardware = "Lamp9,1";
  std::optional<std::string> product = "10.2";
  std::optional<std::string> build = "B77";
  std::string version = "8.0";
};

TEST_F(EventBuilderTest, StampsThePayloadInOrder) {
  const auto event = built({{"a", 1}, {"b", "two"}});
  EXPECT_THAT(keysOf(event),
              ::testing::ElementsAre("a", "b", "_startTS", "_sender", "_clientVersion", "_sessionID", "_eventNumber",
                                     "_method", "_status", "_clientTS", "eventTime", "_productFamily", "_productModel",
                                     "_osVersion", "_build", "_internal", "_reportVers", "_timezoneOffset"));
  EXPECT_EQ(*event.find("_startTS"), PropertyValue(kNow / 60 * 60));
  EXPECT_EQ(*event.find("_sender"), PropertyValue(componentShortCode(20)));
  EXPECT_EQ(*event.find("_clientVersion"), PropertyValue(65'535));
  EXPECT_EQ(*event.find("_sessionID"), PropertyValue("c2Vzc2lvbg=="));
  EXPECT_EQ(*event.find("_eventNumber"), PropertyValue(9));
  EXPECT_EQ(*event.find("_method"), PropertyValue(7));
  EXPECT_EQ(*event.find("_status"), PropertyValue(3));
  EXPECT_EQ(*event.find("_productFamily"), PropertyValue("Lamp"));
  EXPECT_EQ(*event.find("_productModel"), PropertyValue("Lamp9,1"));
  EXPECT_EQ(*event.find("_osVersion"), PropertyValue("10.2"));
  EXPECT_EQ(*event.find("_build"), PropertyValue("B77"));
  EXPECT_EQ(*event.find("_internal"), PropertyValue(2));
  EXPECT_EQ(*event.find("_reportVers"), PropertyValue("8.0"));
  EXPECT_EQ(*event.find("_timezoneOffset"), PropertyValue(-3600));
}

TEST_F(EventBuilderTest, BlursTheStartButNotTheDistances) {
  const auto event = built();
  const double expected = static_cast<double>(kNow / 60 * 60) + 10.25;
  EXPECT_NEAR(*event.find("_clientTS")->real(), expected, 1e-6);
  EXPECT_EQ(*event.find("eventTime"), *event.find("_clientTS"));
}

TEST_F(EventBuilderTest, RoundsAStartWithinAMinuteDown) {
  constexpr std::int64_t kTwelveThirtyFour = 1'600'000'000 / 86'400 * 86'400 + 12 * 3600 + 34 * 60;
  EXPECT_EQ(roundedStart(static_cast<double>(kTwelveThirtyFour + 56), false), kTwelveThirtyFour);
  EXPECT_EQ(roundedStart(static_cast<double>(kTwelveThirtyFour) + 56.9, true), kTwelveThirtyFour + 56);
  EXPECT_EQ(roundedStart(-61, false), -60);
}

TEST_F(EventBuilderTest, KeepsTheExactStartOnInternalBuilds) {
  isInternal = true;
  const auto event = built();
  EXPECT_EQ(*event.find("_startTS"), PropertyValue(kNow));
  EXPECT_EQ(*event.find("_internal"), PropertyValue(3));
  EXPECT_EQ(*event.find("_sessionID"), PropertyValue("c2Vzc2lvbg=="));
}

TEST_F(EventBuilderTest, CarriesTheSessionsNumberForSomeInternalClients) {
  for (const std::int32_t type : {7, 11, 13}) {
    compType = type;
    isInternal = true;
    EXPECT_EQ(*built().find("_sessionID"), PropertyValue(4242));
    isInternal = false;
    EXPECT_EQ(*built().find("_sessionID"), PropertyValue("c2Vzc2lvbg=="));
  }
}

TEST_F(EventBuilderTest, LeavesOutWhatIsNotKnown) {
  hardware.reset();
  product.reset();
  build.reset();
  auto known = attributes();
  known.combinedSessionID.reset();
  const auto event = newEventDict({}, std::move(known), EventStamp{}, 0);
  for (const char* key : {"_productModel", "_osVersion", "_build", "_sessionID"}) EXPECT_FALSE(event.contains(key));
}

TEST_F(EventBuilderTest, OverwritesFieldsOfThePayloadInPlace) {
  const auto event = built({{"eventTime", "mine"}, {"x", 1}, {"_sender", "me"}});
  EXPECT_EQ(*event.find("_sender"), PropertyValue(componentShortCode(20)));
  EXPECT_NE(event.find("eventTime")->real(), nullptr);
  EXPECT_EQ(keysOf(event)[0], "eventTime");
  EXPECT_EQ(keysOf(event)[2], "_sender");
  EXPECT_EQ(event.size(), 17U);
}

TEST_F(EventBuilderTest, LeavesThePayloadAlone) {
  const PropertyDictionary payload{{"a", 1}};
  const PropertyDictionary copy = payload;
  static_cast<void>(built(copy));
  EXPECT_EQ(copy, (PropertyDictionary{{"a", 1}}));
}

TEST(JsonRepresentation, TurnsDatesIntoSeconds) {
  PropertyDictionary event{{"when", Date{12.5}}, {"never", Date{std::numeric_limits<double>::infinity()}}};
  makeEventRepresentableInJson(event, false);
  EXPECT_EQ(event, (PropertyDictionary{{"when", 12.5}, {"never", -1.0}}));
}

TEST(JsonRepresentation, RemovesWhatJsonCannotHold) {
  RecordingLog log;
  PropertyDictionary event{{"nan", std::numeric_limits<double>::quiet_NaN()},
                           {"kept", 1.5},
                           {"infinite", -std::numeric_limits<double>::infinity()},
                           {"bytes", ByteData{1, 2}},
                           {"nothing", nullptr},
                           {"list", PropertyArray{1}},
                           {"box", PropertyDictionary{{"a", 1}}},
                           {"text", "t"},
                           {"flag", true}};
  makeEventRepresentableInJson(event, false);
  EXPECT_THAT(keysOf(event), ::testing::ElementsAre("kept", "text", "flag"));
  EXPECT_EQ(log.lines().size(), 6U);
  EXPECT_EQ(log.count(log::Level::error,
                      "HTTPSPostBackend(createMessageForPostAndLogging): Serializer unable to handle key: list, "
                      "value: [1]"),
            1);
}

TEST(JsonRepresentation, RemovesAKeyWhoseNestedDataJsonCannotHold) {
  RecordingLog log;
  const PropertyDictionary sound{{"list", PropertyArray{1.5, nullptr, "t"}}};
  PropertyDictionary event{{"sound", sound},
                           {"dates", PropertyArray{1, PropertyArray{Date{12.5}}}},
                           {"nan", PropertyDictionary{{"a", PropertyDictionary{{"b", std::nan("")}}}}},
                           {"bytes", PropertyArray{PropertyDictionary{{"a", ByteData{1}}}}},
                           {"kept", 1}};
  makeEventRepresentableInJson(event, true);
  EXPECT_EQ(event, (PropertyDictionary{{"sound", sound}, {"kept", 1}}));
  EXPECT_EQ(log.lines().size(), 3U);
  EXPECT_TRUE(
      log.contains("HTTPSPostBackend(createMessageForPostAndLogging): Serializer unable to handle key: nan, value: "));
}

TEST(JsonRepresentation, KeepsNestedDataWhereItIsAllowed) {
  PropertyDictionary event{{"list", PropertyArray{1}}, {"box", PropertyDictionary{}}, {"bytes", ByteData{1}}};
  makeEventRepresentableInJson(event, true);
  EXPECT_THAT(keysOf(event), ::testing::ElementsAre("list", "box"));
}

}  // namespace
}  // namespace velk::test
