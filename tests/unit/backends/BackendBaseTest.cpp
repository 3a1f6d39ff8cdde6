#include <set>

#include "backends/UploadBackend.h"
#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {
namespace {

/// A backend that notes what reaches it.
class NotingBackend : public VelkReportingBackend {
 public:
  explicit NotingBackend(const BackendContext& context)
      : VelkReportingBackend(context, "noting", PropertyDictionary{}, "Lamp") {}
  std::optional<std::string> sendMessageWithEventID(const std::optional<PropertyDictionary>&, const TimeValue&,
                                                    std::uint16_t, std::uint16_t, std::uint16_t eventID,
                                                    std::uint32_t) override {
    eventIDs.push_back(eventID);
    return "text";
  }
  void setLists(std::optional<PropertyArray> white, std::optional<PropertyArray> black) {
    _eventWhitelist = std::move(white);
    _eventBlacklist = std::move(black);
  }
  [[nodiscard]] std::string version() const {
    return formatText("%u.%u.%u", {_selfVersion.major, _selfVersion.middle, _selfVersion.minor});
  }
  std::vector<std::uint16_t> eventIDs;
};

class BackendBaseTest : public BackendTest {
 protected:
  NotingBackend backend{context};
};

TEST_F(BackendBaseTest, DoesNothingByDefault) {
  VelkReportingBackend plain(context, "plain", PropertyDictionary{}, "Lamp");
  EXPECT_EQ(plain.sendMessage(PropertyDictionary{}, kStart, 1, 2, 0), std::nullopt);
  FileUpload upload{"/tmp/x", "", {}};
  EXPECT_FALSE(plain.uploadFileAtPath(upload));
  EXPECT_FALSE(plain.uploadLogData({}));
  EXPECT_EQ(plain.batchedEventsSize(), 0U);
  EXPECT_FALSE(plain.isHTTPSPostBackend());
  plain.cleanup();
}

TEST_F(BackendBaseTest, AnswersAFlushAtOnceWithoutError) {
  FlushOutcome outcome;
  EXPECT_EQ(backend.flushMessagesWithCompletion(outcome.completion()), std::nullopt);
  EXPECT_EQ(outcome.calls, 1);
  EXPECT_EQ(outcome.text, std::nullopt);
  EXPECT_EQ(outcome.error, std::nullopt);
  EXPECT_EQ(backend.flushMessagesWithCompletion({}), std::nullopt);
}

TEST_F(BackendBaseTest, StartsUnconfiguredAndIsEnabledByAnUpdate) {
  EXPECT_EQ(backend.state(), kBackendNotConfigured);
  EXPECT_EQ(backend.updateState(), kBackendEnabled);
  EXPECT_EQ(backend.state(), kBackendEnabled);
}

TEST_F(BackendBaseTest, WritesTheStateLaterAndReadsItAfterTheWrite) {
  backend.setState(kBackendDisabled);
  EXPECT_EQ(fakes.scheduler.pendingTasks(), 1U);
  EXPECT_EQ(backend.state(), kBackendDisabled);
  EXPECT_EQ(fakes.scheduler.pendingTasks(), 0U);
}

TEST_F(BackendBaseTest, NumbersItsEventsFromOneInSixteenBits) {
  EXPECT_EQ(backend.sendMessage(PropertyDictionary{}, kStart, 1, 2, 0), "text");
  for (int sent = 1; sent < 65'537; ++sent) backend.sendMessage(PropertyDictionary{}, kStart, 1, 2, 0);
  EXPECT_EQ(backend.eventIDs.front(), 1);
  EXPECT_EQ(backend.eventIDs[65'534], 65'535);
  EXPECT_EQ(backend.eventIDs[65'535], 0);
  EXPECT_EQ(backend.eventIDs[65'536], 1);
}

TEST_F(BackendBaseTest, CutsItsVersionIntoThreeBytes) {
  const auto versionOf = [this](const char* text) {
    backend.setSelfVersion(text);
    return backend.version();
  };
  EXPECT_EQ(versionOf("7"), "7.0.0");
  EXPECT_EQ(versionOf("1.2.3.4"), "1.2.3");
  EXPECT_EQ(versionOf("300.1"), "44.1.0");
  EXPECT_EQ(versionOf("3.1.2"), "3.1.2");
  EXPECT_EQ(versionOf(""), "0.0.0");
  EXPECT_EQ(versionOf("x.2b.-1"), "0.2.255");
}

TEST_F(BackendBaseTest, LetsEverythingPassWithoutLists) {
  EXPECT_TRUE(backend.isWhitelistedEvent(5));
  EXPECT_FALSE(backend.isBlacklistedEvent(5));
}

TEST_F(BackendBaseTest, LetsNothingPassAnEmptyWhitelist) {
  backend.setLists(PropertyArray{}, PropertyArray{});
  EXPECT_FALSE(backend.isWhitelistedEvent(5));
  EXPECT_FALSE(backend.isWhitelistedEvent(0));
  EXPECT_FALSE(backend.isBlacklistedEvent(5));
}

TEST_F(BackendBaseTest, ComparesListedEventsAsNumbers) {
  const PropertyArray list{5, "7", 9.9, true, PropertyArray{}};
  backend.setLists(list, list);
  for (const int event : {5, 7, 9, 1, 0}) {
    EXPECT_TRUE(backend.isWhitelistedEvent(event)) << event;
    EXPECT_TRUE(backend.isBlacklistedEvent(static_cast<std::uint32_t>(event))) << event;
  }
  EXPECT_FALSE(backend.isWhitelistedEvent(6));
  EXPECT_FALSE(backend.isBlacklistedEvent(6));
}

TEST_F(BackendBaseTest, HashesTextIntoLowerCaseHexadecimal) {
  EXPECT_EQ(VelkReportingBackend::convertIntoSHA256("abc"),
            "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad");
}

TEST_F(BackendBaseTest, HashesAsManyBytesAsTheTextHasUnits) {
  // Three units (e acute, b, c) in four bytes: the last byte is left out.
  EXPECT_EQ(VelkReportingBackend::convertIntoSHA256("\xC3\xA9"
                                                    "bc"),
            VelkReportingBackend::convertIntoSHA256("\xC3\xA9"
                                                    "b!")
                .substr(0, 64));
  EXPECT_NE(VelkReportingBackend::convertIntoSHA256("\xC3\xA9"
                                                    "bc"),
            VelkReportingBackend::convertIntoSHA256("\xC3\xA9"
                                                    "xc"));
}

TEST_F(BackendBaseTest, DrawsItsSamplingFactorOnce) {
  fakes.random.push(9999);
  fakes.random.push(0);
  fakes.random.push(1234);
  EXPECT_DOUBLE_EQ(NotingBackend(context).samplingFactor(), 0.9999);
  EXPECT_DOUBLE_EQ(NotingBackend(context).samplingFactor(), 0.0);
  const NotingBackend third(context);
  EXPECT_DOUBLE_EQ(third.samplingFactor(), 0.1234);
  EXPECT_DOUBLE_EQ(third.samplingFactor(), 0.1234);
  EXPECT_EQ(fakes.random.bounds().back(), 10'000U);
}

TEST_F(BackendBaseTest, TakesTheSamplingThresholdOfAParent) {
  EXPECT_EQ(backend.samplingThreshold(), std::nullopt);
  backend.setSamplingThreshold(0.25);
  EXPECT_EQ(backend.samplingThreshold(), 0.25);
  backend.setSamplingThreshold(std::nullopt);
  EXPECT_EQ(backend.samplingThreshold(), std::nullopt);
}

class BackendFactoryTest : public BackendTest {};

TEST_F(BackendFactoryTest, MakesPostBackendsOfThreeNames) {
  const PropertyValue profile = profileWith(PropertyArray{openEntry()});
  for (const char* name : {"splunk", "my_splunk_backend", "korrin", "qrs"}) {
    const auto backend = make(name, profile);
    ASSERT_TRUE(backend) << name;
    EXPECT_EQ(backend->name(), name);
    EXPECT_TRUE(backend->isHTTPSPostBackend());
    EXPECT_EQ(backend->displayURL(), "https://display.example/");
  }
}

TEST_F(BackendFactoryTest, RefusesUnknownNames) {
  for (const char* name : {"Dashboard", "release_timeout", "my_korrin", "qrs2", "Splunk", ""}) {
    EXPECT_FALSE(make(name, profileWith(PropertyArray{openEntry()}))) << name;
    EXPECT_EQ(log.count(log::Level::error, std::string("VelkReportingBackend(newBackendWithName): ") + name), 1);
  }
}

TEST_F(BackendFactoryTest, UploadServerIsTheOneThatTakesFiles) {
  const auto uploads = make("upload_server", PropertyDictionary{{"post_url", "https://logs.example"}});
  ASSERT_NE(std::dynamic_pointer_cast<UploadBackend>(uploads), nullptr);
  EXPECT_EQ(uploads->updateState(), kBackendEnabled);
  EXPECT_EQ(make("upload_server", PropertyDictionary{}), nullptr) << "it has nowhere to post to";
  EXPECT_EQ(make("upload_server2", PropertyDictionary{{"post_url", "https://logs.example"}}), nullptr);
}

TEST_F(BackendFactoryTest, KeepsQuillOffOneFamily) {
  fakes.device.set("ProductType", "Hollin");
  EXPECT_FALSE(make("quill", PropertyDictionary{}));
  EXPECT_EQ(log.count(log::Level::error, "VelkReportingBackend(newBackendWithName): quill"), 1);
  fakes.device.set("ProductType", "Hollin2");
  EXPECT_FALSE(make("quill", PropertyDictionary{}));
  EXPECT_EQ(log.count(log::Level::error, "VelkReportingBackend(newBackendWithName): quill"), 1);
}

TEST_F(BackendFactoryTest, NeedsProfileAndProductFamily) {
  const PropertyValue profile = profileWith(PropertyArray{openEntry()});
  EXPECT_FALSE(make("korrin", PropertyValue()));
  EXPECT_FALSE(make("korrin", PropertyValue("text")));
  EXPECT_FALSE(newBackendWithName(context, "korrin", profile, std::nullopt, 20));
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(BackendFactoryTest, NeedsAListOfClients) {
  for (const PropertyValue& clients : {PropertyValue(), PropertyValue("clients"), PropertyValue(PropertyArray{}),
                                       PropertyValue(PropertyDictionary{{"a", 1}})}) {
    log.clear();
    EXPECT_FALSE(make("korrin", PropertyDictionary{{"clients", clients}}));
    EXPECT_EQ(log.count(log::Level::error, "HTTPSPostBackend(initWithName): can't find the client list."), 1);
  }
  EXPECT_FALSE(make("korrin", PropertyDictionary{{"display_url", "x"}}));
}

}  // namespace
}  // namespace velk::test
