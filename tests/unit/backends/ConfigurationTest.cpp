#include <algorithm>

#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {
namespace {

PropertyDictionary without(PropertyDictionary entry, std::string_view key) {
  entry.remove(key);
  return entry;
}

class ConfigurationTest : public BackendTest {
 protected:
  std::int32_t stateWith(const PropertyDictionary& entry) { return makePost(entry)->updateState(); }
  /// Where an event goes that the backend posts at once.
  std::string urlOf(VelkReportingBackend& backend, std::uint32_t flag = 0) {
    send(backend, {{"a", 1}}, 7, 3, flag);
    return lastRequest().url;
  }
};

TEST_F(ConfigurationTest, EnablesTheClientOfAnOpenEntry) {
  auto backend = makePost(openEntry());
  EXPECT_EQ(backend->state(), kBackendNotConfigured);
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
  EXPECT_EQ(backend->state(), kBackendEnabled);
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): korrin: client found Media:Calls, state=2, "
                      "samplingFactor=0.000000"),
            1);
  EXPECT_EQ(log.count("resetBackendStateWithClient: event_threshold set to 49"), 1);
  EXPECT_EQ(log.count("setBackendStateWithClient: extras on internal is set to 0"), 1);
  EXPECT_EQ(log.count("HTTPSPostBackend(updatePostLink): Storebag 'https://collector.example/events' for postURL"), 1);
  EXPECT_EQ(log.count("HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL "
                      "'https://collector.example/events'"),
            1);
}

TEST_F(ConfigurationTest, WaitsForUserInfo) {
  auto backend = makePost(openEntry());
  backend->setUserInfoDict(std::nullopt);
  EXPECT_EQ(backend->updateState(), kBackendNotConfigured);
  backend->setUserInfoDict(PropertyDictionary{});
  EXPECT_EQ(backend->updateState(), kBackendNotConfigured);
  backend->setUserInfoDict(userInfo());
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
}

TEST_F(ConfigurationTest, SkipsEveryTestWhenNoUserInfoIsRequired) {
  fakes.consent.enabled = false;
  auto backend = makePostWith(PropertyArray{
      PropertyDictionary{{"realtime_post_url", "https://first.example/rt"}},
      PropertyDictionary{{"client", "Nobody"}, {"post_url", "https://second.example/"}, {"event_threshold", 3}},
      PropertyDictionary{{"post_url", "https://third.example/"}}});
  backend->setRequireUserInfo(false);
  backend->setUserInfoDict(std::nullopt);
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
  EXPECT_EQ(backend->postURL(), "https://second.example/");
  EXPECT_TRUE(log.contains("event_threshold set to 3"));
  EXPECT_EQ(urlOf(*backend, 1), "https://second.example/");
  EXPECT_FALSE(log.contains("disabled by DNU"));
}

TEST_F(ConfigurationTest, LeavesTheRealtimeAddressOfTriedEntriesBehind) {
  auto backend = makePostWith(PropertyArray{5, PropertyDictionary{{"realtime_post_url", "https://first.example/rt"}}});
  backend->setRequireUserInfo(false);
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
  EXPECT_EQ(backend->postURL(), std::nullopt);
  EXPECT_EQ(urlOf(*backend, 1), "https://first.example/rt");
  EXPECT_TRUE(log.contains("event_threshold set to 49"));
}

TEST_F(ConfigurationTest, TakesTheFirstEntryThatFitsClientAndVersion) {
  auto backend = makePostWith(
      PropertyArray{"text", with(with(openEntry(), "client", "Other"), "post_url", "https://other.example/"),
                    with(with(openEntry(), "enabledSince", "8.1"), "post_url", "https://newer.example/"),
                    with(with(openEntry(), "service", "call"), "post_url", "https://mine.example/"), openEntry()});
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
  EXPECT_EQ(backend->postURL(), "https://mine.example/");
}

TEST_F(ConfigurationTest, DisablesClientsWithoutEntry) {
  EXPECT_EQ(stateWith(with(openEntry(), "client", "Other")), kBackendDisabled);
  auto backend = makePostWith(PropertyArray{5, "entry", PropertyArray{}});
  EXPECT_EQ(backend->updateState(), kBackendDisabled);
}

TEST_F(ConfigurationTest, OverridesBatching) {
  auto backend = makePostWith(PropertyArray{with(openEntry(), "client", "Other"), with(openEntry(), "expedite", 0),
                                            with(openEntry(), "expedite", 1)});
  backend->updateState();
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=1"), 1);
  send(*backend, {{"a", 1}});
  EXPECT_EQ(transport->count(), 0U);
  auto expedited = makePost(with(openEntry(), "expedite", "1"));
  expedited->setBatchEvents(true);
  expedited->updateState();
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=0"), 1);
  send(*expedited, {{"a", 1}});
  EXPECT_EQ(transport->count(), 1U);
}

TEST_F(ConfigurationTest, OverridesBatchingEvenForADisabledClient) {
  auto entry = with(openEntry(), "expedite", 0);
  entry.remove("filters");
  auto backend = makePost(entry);
  EXPECT_EQ(backend->updateState(), kBackendDisabled);
  EXPECT_TRUE(log.contains("Store bag override  _batchEvent=1"));
}

TEST_F(ConfigurationTest, RespectsConsentUnlessOverridden) {
  fakes.consent.enabled = false;
  EXPECT_EQ(stateWith(openEntry()), kBackendDisabled);
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): reporting disabled by DNU: 0."), 1);
  EXPECT_EQ(stateWith(with(openEntry(), "override_dnu", 2)), kBackendDisabled);
  EXPECT_EQ(stateWith(with(openEntry(), "override_dnu", 1)), kBackendEnabled);
}

TEST_F(ConfigurationTest, TakesConsentAsItWasAtCreation) {
  auto backend = makePost(openEntry());
  fakes.consent.enabled = false;
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
}

TEST_F(ConfigurationTest, NeedsACountryOnTheList) {
  EXPECT_EQ(stateWith(without(openEntry(), "locale_whitelist")), kBackendDisabled);
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): (US) isn't in country code list (null)"), 1);
  EXPECT_EQ(stateWith(with(openEntry(), "locale_whitelist", PropertyArray{"GB"})), kBackendDisabled);
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): (US) isn't in country code list [\"GB\"]"), 1);
  EXPECT_EQ(stateWith(with(openEntry(), "locale_whitelist", "US")), kBackendDisabled);
  EXPECT_EQ(stateWith(with(openEntry(), "locale_whitelist", PropertyArray{})), kBackendDisabled);
}

TEST_F(ConfigurationTest, ComparesCountriesLoosely) {
  fakes.locale.country = "GB";
  EXPECT_EQ(stateWith(with(openEntry(), "locale_whitelist", PropertyArray{"gb"})), kBackendEnabled);
  EXPECT_EQ(stateWith(with(openEntry(), "locale_whitelist", PropertyArray{"B"})), kBackendEnabled);
  EXPECT_EQ(stateWith(with(openEntry(), "locale_whitelist", PropertyArray{"GBR"})), kBackendDisabled);
}

TEST_F(ConfigurationTest, LetsAnAbsentCountryPassAListThatHasElements) {
  fakes.locale.country = std::nullopt;
  EXPECT_EQ(stateWith(openEntry()), kBackendEnabled);
  EXPECT_EQ(stateWith(without(openEntry(), "locale_whitelist")), kBackendDisabled);
}

TEST_F(ConfigurationTest, TestsFamilyAndModel) {
  EXPECT_EQ(stateWith(with(openEntry(), "device_whitelist", PropertyArray{"lam"})), kBackendEnabled);
  EXPECT_EQ(stateWith(with(openEntry(), "device_whitelist", PropertyArray{"Radio"})), kBackendDisabled);
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): (Lamp) isn't in device whitelist [\"Radio\"]"), 1);
  EXPECT_EQ(stateWith(with(openEntry(), "device_blacklist", PropertyArray{"Lamp9"})), kBackendDisabled);
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): (Lamp9,1) is in device blacklist [\"Lamp9\"]"), 1);
  EXPECT_EQ(stateWith(with(openEntry(), "device_blacklist", PropertyArray{"Lamp8"})), kBackendEnabled);
  EXPECT_EQ(stateWith(with(openEntry(), "device_blacklist", PropertyArray{})), kBackendEnabled);
}

TEST_F(ConfigurationTest, BarsAnUnknownModelFromABlacklist) {
  auto backend = makePost(with(openEntry(), "device_blacklist", PropertyArray{"Lamp8"}));
  backend->setHardwareType(std::nullopt);
  EXPECT_EQ(backend->updateState(), kBackendDisabled);
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): ((null)) is in device blacklist [\"Lamp8\"]"), 1);
}

TEST_F(ConfigurationTest, RequiresFilters) {
  EXPECT_EQ(stateWith(without(openEntry(), "filters")), kBackendDisabled);
  EXPECT_EQ(stateWith(with(openEntry(), "filters", "remove")), kBackendDisabled);
  EXPECT_EQ(log.count(log::Level::error, "HTTPSPostBackend(updateBackendState): filters are required."), 2);
}

TEST_F(ConfigurationTest, SamplesAgainstItsFactor) {
  fakes.random.setRest(5000);
  const auto sampled = [this](PropertyValue threshold, PropertyValue override = nullptr) {
    auto entry = with(openEntry(), "sampling_threshold", std::move(threshold));
    if (!override.isNull()) entry.set("override_sampling", std::move(override));
    return stateWith(entry);
  };
  EXPECT_EQ(sampled(0.4), kBackendWaiting);
  EXPECT_EQ(sampled(0.4, 0.3), kBackendDisabled);
  EXPECT_EQ(sampled(0.4, 0.5), kBackendDisabled);
  EXPECT_EQ(sampled(0.4, 0.6), kBackendWaiting);
  EXPECT_EQ(sampled(0.6), kBackendEnabled);
  EXPECT_EQ(sampled(0.5), kBackendWaiting);
  EXPECT_EQ(sampled("0.6"), kBackendEnabled);
  EXPECT_EQ(sampled(1), kBackendEnabled);
  EXPECT_EQ(stateWith(without(openEntry(), "sampling_threshold")), kBackendDisabled);
}

TEST_F(ConfigurationTest, ReplacesTheThresholdOfACountryOnce) {
  fakes.random.setRest(5000);
  fakes.locale.country = "CA";
  auto entry = with(with(openEntry(), "locale_whitelist", PropertyArray{"A"}), "sampling_threshold", 0.25);
  entry.set("per_country_sampling_thresholds",
            PropertyArray{PropertyDictionary{{"country", PropertyArray{"AC"}}, {"threshold", 0.1}},
                          PropertyDictionary{{"country", PropertyArray{"US", "CA"}}, {"threshold", 0.75}},
                          PropertyDictionary{{"country", PropertyArray{"CA"}}, {"threshold", 0.0}}});
  auto backend = makePost(entry);
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
  EXPECT_EQ(backend->samplingThreshold(), 0.75);
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): sampling threshold for CA changed from 0.25 to 0.75"), 1);
  fakes.locale.country = "ca";
  auto other = makePost(entry);
  EXPECT_EQ(other->updateState(), kBackendWaiting);
  EXPECT_EQ(other->samplingThreshold(), 0.25);
}

TEST_F(ConfigurationTest, DisablesACountryWithoutThreshold) {
  auto entry = with(openEntry(), "per_country_sampling_thresholds",
                    PropertyArray{PropertyDictionary{{"country", PropertyArray{"US"}}}});
  EXPECT_EQ(stateWith(entry), kBackendDisabled);
  EXPECT_TRUE(log.contains("sampling threshold for US changed from 1.00 to 0.00"));
}

TEST_F(ConfigurationTest, CopiesTheEventLists) {
  auto backend = makeConfigured(
      with(with(openEntry(), "event_whitelist", PropertyArray{7, 8}), "event_blacklist", PropertyArray{8}));
  EXPECT_EQ(backend->eventWhitelist(), (PropertyArray{7, 8}));
  EXPECT_EQ(backend->eventBlacklist(), PropertyArray{8});
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): korrin: eventWhitelist=[7,8]"), 1);
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): korrin: eventBlacklist=[8]"), 1);
}

TEST_F(ConfigurationTest, AppliesToNobodyWhenARestrictionHasTheWrongType) {
  const auto dictionary = [](const char* key, PropertyValue value) {
    return PropertyDictionary{{key, std::move(value)}};
  };
  auto badThreshold = dictionary("country", PropertyArray{"US"});
  badThreshold.set("threshold", PropertyArray{0});
  const auto listing = [](PropertyValue key, const char* action, PropertyValue value) {
    return PropertyArray{PropertyDictionary{{"key", std::move(key)}, {"action", action}, {"value", std::move(value)}}};
  };
  auto badMethod = dictionary("key", "a");
  badMethod.set("method", PropertyArray{7});
  for (const auto& [key, value] : std::vector<std::pair<const char*, PropertyValue>>{
           {"client", PropertyArray{"Media", "Other"}},
           {"client", nullptr},
           {"service", PropertyArray{"Calls"}},
           {"service", 5},
           {"enabledSince", PropertyArray{8, 0}},
           {"enabledSince", true},
           {"locale_whitelist", "US"},
           {"locale_whitelist", PropertyArray{"US", 1}},
           {"device_whitelist", "Lamp"},
           {"device_whitelist", PropertyArray{"Lamp", PropertyArray{}}},
           {"device_blacklist", "Radio"},
           {"device_blacklist", PropertyArray{5}},
           {"filters", PropertyArray{5}},
           {"filters", PropertyArray{dictionary("action", "remove")}},
           {"filters", listing(5, "remove", nullptr)},
           {"filters", listing("a", "blacklistValues", "b")},
           {"filters", listing("a", "whitelistValues", PropertyArray{"b", 5})},
           {"filters", PropertyArray{badMethod}},
           {"sampling_threshold", PropertyArray{1}},
           {"sampling_threshold", "often"},
           {"per_country_sampling_thresholds", dictionary("US", 0.1)},
           {"per_country_sampling_thresholds", PropertyArray{7}},
           {"per_country_sampling_thresholds", PropertyArray{dictionary("country", "US")}},
           {"per_country_sampling_thresholds", PropertyArray{badThreshold}},
           {"event_whitelist", "7"},
           {"event_whitelist", PropertyArray{7, "all"}},
           {"event_blacklist", 7},
           {"event_blacklist", PropertyArray{dictionary("id", 7)}},
           {"use_wifi_only", "yes"}}) {
    log.clear();
    const auto entry = with(with(openEntry(), "override_dnu", 1), key, value);
    EXPECT_EQ(stateWith(entry), kBackendDisabled) << key;
    const auto lines = log.lines();
    EXPECT_EQ(
        std::count_if(lines.begin(), lines.end(), [](const auto& line) { return line.level == log::Level::error; }), 1)
        << key;
    EXPECT_TRUE(log.contains("korrin: \"" + std::string(key) + "\" of a client entry must be ")) << key;
  }
  EXPECT_EQ(log.count("HTTPSPostBackend(updateBackendState): korrin: \"use_wifi_only\" of a client entry must be a "
                      "number, so the entry applies to nothing"),
            1);
}

TEST_F(ConfigurationTest, TakesNumbersThatAreGivenAsText) {
  auto entry = with(with(openEntry(), "event_whitelist", PropertyArray{"7"}), "sampling_threshold", " +1");
  entry.set("use_wifi_only", "1");
  EXPECT_EQ(stateWith(entry), kBackendEnabled);
}

TEST_F(ConfigurationTest, GoesOnToTheNextEntryWhenNamesHaveTheWrongType) {
  auto backend = makePostWith(
      PropertyArray{with(with(openEntry(), "client", PropertyArray{"Media"}), "post_url", "https://first.example/"),
                    with(with(openEntry(), "expedite", 0), "post_url", "https://second.example/")});
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
  EXPECT_EQ(backend->postURL(), "https://second.example/");
  EXPECT_TRUE(log.contains("Store bag override  _batchEvent=1"));
}

TEST_F(ConfigurationTest, PrefersTheAddressesOfTheSuite) {
  fakes.defaults.put("httpsPostURL", "https://mine.example/");
  auto backend = makePost(with(openEntry(), "realtime_post_url", "https://realtime.example/"));
  EXPECT_EQ(log.count("HTTPSPostBackend(initWithName): Using user default 'https://mine.example/' for postURL"), 1);
  for (int refresh = 0; refresh < 2; ++refresh) {
    backend->updateState();
    EXPECT_EQ(backend->postURL(), "https://mine.example/");
  }
  EXPECT_EQ(urlOf(*backend, 1), "https://realtime.example/");
  auto defaulting = makeConfigured(openEntry());
  EXPECT_EQ(urlOf(*defaulting, 1), "https://mine.example/");
}

TEST_F(ConfigurationTest, ReadsItsAddressesBeforeItsIdentifiers) {
  fakes.defaults.put("httpsPostURL", "https://mine.example/");
  fakes.defaults.put("httpsRealtimePostURL", "https://rt.example/");
  const auto backend = makePost(openEntry());
  std::vector<std::string> subjects;
  for (const auto& line : log.lines()) subjects.push_back(line.text.substr(0, line.text.find(':')));
  EXPECT_THAT(subjects, ::testing::ElementsAre("HTTPSPostBackend(initWithName)", "HTTPSPostBackend(initWithName)",
                                               "getPersistentIdentifierForDNU", "getPersistentIdentifierForDNU"));
}

TEST_F(ConfigurationTest, PrefersTheRealtimeAddressOfTheSuite) {
  fakes.defaults.put("httpsRealtimePostURL", "https://rt.example/");
  auto backend = makeConfigured(with(openEntry(), "realtime_post_url", "https://realtime.example/"));
  EXPECT_EQ(log.count("HTTPSPostBackend(initWithName): Using user default 'https://rt.example/' for realtimePostURL"),
            1);
  EXPECT_EQ(urlOf(*backend, 1), "https://rt.example/");
  EXPECT_EQ(urlOf(*backend, 0), "https://collector.example/events");
}

TEST_F(ConfigurationTest, KeepsTheAddressThatAnEntryDoesNotName) {
  auto backend = makeConfigured(without(openEntry(), "post_url"));
  EXPECT_EQ(backend->postURL(), std::nullopt);
  EXPECT_EQ(log.count("HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL '(null)'"), 1);
}

TEST_F(ConfigurationTest, ReadsFlagsByTheirLowByte) {
  const auto headerWith = [this](PropertyValue flag) {
    auto backend = makeConfigured(with(openEntry(), "include_session_id", std::move(flag)));
    send(*backend, {{"a", 1}});
    return headerOf(lastRequest(), "X-Velk-Session-ID");
  };
  EXPECT_EQ(headerWith(1), "c2Vzc2lvbg==");
  EXPECT_EQ(headerWith(256), std::nullopt);
  EXPECT_EQ(headerWith(257), "c2Vzc2lvbg==");
  EXPECT_EQ(headerWith("x"), std::nullopt);
  auto wifi = makeConfigured(with(openEntry(), "use_wifi_only", true));
  send(*wifi, {{"a", 1}});
  EXPECT_FALSE(lastRequest().allowsCellularAccess);
}

TEST_F(ConfigurationTest, ChoosesTheClientIdentifier) {
  fakes.defaults.put("uuidRespectDNU", "respect");
  fakes.defaults.put("uuidOverrideDNU", "override");
  const auto identifierWith = [this](const PropertyDictionary& entry) {
    auto backend = makeConfigured(entry);
    send(*backend, {{"a", 1}});
    return *bodyOf(lastRequest()).string("clientId");
  };
  EXPECT_EQ(identifierWith(openEntry()), "respect");
  EXPECT_EQ(identifierWith(with(openEntry(), "override_dnu", 1)), "override");
  const auto custom = with(openEntry(), "custom_clientId", false);
  const auto own = identifierWith(custom);
  EXPECT_EQ(own.size(), 36U);
  EXPECT_EQ(identifierWith(custom), own);
  const auto extras = with(custom, "extras_on_internal", 1);
  EXPECT_EQ(identifierWith(extras), own);
  isInternal = true;
  EXPECT_EQ(identifierWith(extras), "0123456789abcdef0123456789abcdef01234567");
  EXPECT_EQ(identifierWith(custom), own);
}

TEST_F(ConfigurationTest, SurvivesAStorebagOfWrongTypes) {
  const PropertyValue junk[] = {PropertyValue(5),
                                PropertyValue("text"),
                                PropertyValue(nullptr),
                                PropertyValue(-1.5),
                                PropertyValue(PropertyArray{5, PropertyArray{}, nullptr}),
                                PropertyValue(PropertyDictionary{{"a", 1}}),
                                PropertyValue(ByteData{1})};
  for (const char* key : {"client",
                          "service",
                          "expedite",
                          "enabledSince",
                          "override_dnu",
                          "locale_whitelist",
                          "device_whitelist",
                          "device_blacklist",
                          "filters",
                          "sampling_threshold",
                          "per_country_sampling_thresholds",
                          "override_sampling",
                          "custom_clientId",
                          "post_url",
                          "realtime_post_url",
                          "event_threshold",
                          "extras_on_internal",
                          "event_whitelist",
                          "event_blacklist",
                          "include_session_id",
                          "use_wifi_only"}) {
    for (const auto& value : junk) {
      auto backend = makeConfigured(with(openEntry(), key, value));
      send(*backend, {{"a", "text"}});
      send(*backend, {{"a", "text"}}, 7, 3, 1);
      backend->flushMessagesWithCompletion({});
      EXPECT_LE(backend->state(), kBackendWaiting) << key;
    }
  }
}

}  // namespace
}  // namespace velk::test
