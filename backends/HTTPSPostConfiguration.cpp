// The configuration half of the HTTPS post backend: from its storebag section to state, addresses, filters and lists.
#include <utility>

#include "backends/ClientEntryMatching.h"
#include "backends/HTTPSPostBackend.h"
#include "backends/LogTexts.h"
#include "ipc/Vocabulary.h"
#include "platform/DeviceInformation.h"
#include "platform/Log.h"
#include "platform/PersistentIdentifier.h"
#include "platform/UserDefaults.h"

namespace velk {

namespace {

constexpr std::int32_t kDefaultEventThreshold = 49;

/// The section's client entries; null when there are none.
const PropertyArray* clientEntries(const PropertyValue& profile) {
  const PropertyDictionary* section = profile.dictionary();
  const PropertyArray* clients = section != nullptr ? section->array("clients") : nullptr;
  return clients != nullptr && !clients->empty() ? clients : nullptr;
}

std::optional<std::string> textOf(const PropertyDictionary& dictionary, std::string_view key) {
  const std::string* text = dictionary.string(key);
  return text != nullptr ? std::optional(*text) : std::nullopt;
}

std::optional<std::string> defaultText(const UserDefaults& defaults, std::string_view key) {
  const auto value = defaults.value(key);
  const std::string* text = value ? value->string() : nullptr;
  return text != nullptr ? std::optional(*text) : std::nullopt;
}

std::optional<double> numberOf(const PropertyDictionary& dictionary, std::string_view key) {
  const PropertyValue* value = dictionary.find(key);
  return value != nullptr ? std::optional(doubleValue(value)) : std::nullopt;
}

/// What a flag of a storebag keeps: the low 8 bits of its number.
bool lowByteIsSet(const PropertyDictionary& entry, std::string_view key) {
  return static_cast<std::uint8_t>(integerValue(entry.find(key))) != 0;
}

/// The first entry that passes; null when none does. Elements that are no dictionaries pass nothing.
template <class Passes>
const PropertyDictionary* firstEntry(const PropertyArray& clients, Passes passes) {
  for (const PropertyValue& client : clients) {
    const PropertyDictionary* entry = client.dictionary();
    if (entry != nullptr && passes(*entry)) return entry;
  }
  return nullptr;
}

}  // namespace

std::shared_ptr<HTTPSPostBackend> HTTPSPostBackend::initWithName(const BackendContext& context, const std::string& name,
                                                                 const PropertyValue& profile,
                                                                 const std::optional<std::string>& productFamily) {
  if (profile.dictionary() == nullptr || !productFamily) return nullptr;
  if (clientEntries(profile) == nullptr) {
    log::error(backend_texts::kNoClientList);
    return nullptr;
  }
  return std::make_shared<HTTPSPostBackend>(Private{}, context, name, profile, productFamily);
}

HTTPSPostBackend::HTTPSPostBackend(Private, const BackendContext& context, const std::string& name,
                                   const PropertyValue& profile, const std::optional<std::string>& productFamily)
    : VelkReportingBackend(context, name, profile, productFamily), _eventThreshold(kDefaultEventThreshold) {
  UserDefaults& defaults = context.platform.defaults;
  _postURL = defaultText(defaults, "httpsPostURL");
  if (_postURL) log::standard(backend_texts::kDefaultPostURL, *_postURL);
  _useDefaultPostURL = _postURL.has_value();
  _realtimePostURL = defaultText(defaults, "httpsRealtimePostURL");
  if (_realtimePostURL) log::standard(backend_texts::kDefaultRealtimePostURL, *_realtimePostURL);
  _useDefaultRealtimePostURL = _realtimePostURL.has_value();
  _displayURL = textOf(*_profile.dictionary(), "display_url");
  _dnuEnabled = context.platform.consent.diagnosticsAndUsageEnabled();
  _uuidRespectDnu = getPersistentIdentifierForDNU(defaults, true);
  _uuidOverrideDnu = getPersistentIdentifierForDNU(defaults, false);
  const auto forced = defaults.value("forceEventLogging");
  _forceEventLogging = forced && booleanValue(&*forced);
}

std::int32_t HTTPSPostBackend::updateState() {
  // Nothing is written back: meanwhile a server's refusal may have disabled the backend.
  if (_immutable) return state();
  const std::int32_t newState = updateBackendState();
  setState(newState);
  return newState;
}

std::int32_t HTTPSPostBackend::updateBackendState() {
  const PropertyArray* clients = clientEntries(_profile);
  if (clients == nullptr) return kBackendDisabled;
  const bool hasUserInfo = _userInfoDict && !_userInfoDict->empty();
  const std::string* clientName = hasUserInfo ? _userInfoDict->string(kVelkReportingUserInfoClientName) : nullptr;
  const std::string* serviceName = hasUserInfo ? _userInfoDict->string(kVelkReportingUserInfoServiceName) : nullptr;
  expedite(*clients, clientName, serviceName);
  if (!_requireUserInfo) {
    configureWithoutUserInfo(*clients);
    return kBackendEnabled;
  }
  if (!hasUserInfo) return kBackendNotConfigured;
  const PropertyDictionary* entry = firstEntry(*clients, [&](const PropertyDictionary& candidate) {
    return isUsable(wrongTypeOfChoice(candidate)) && matchClientNameAndServiceID(candidate, clientName, serviceName) &&
           isFrameworkEnabledForClient(candidate, _selfVersion);
  });
  return entry != nullptr ? configureWithClientEntry(*entry, clientName, serviceName) : kBackendDisabled;
}

void HTTPSPostBackend::expedite(const PropertyArray& clients, const std::string* clientName,
                                const std::string* serviceName) {
  const PropertyDictionary* entry = firstEntry(clients, [&](const PropertyDictionary& candidate) {
    return matchClientNameAndServiceID(candidate, clientName, serviceName);
  });
  const PropertyValue* expedited = entry != nullptr ? entry->find("expedite") : nullptr;
  if (expedited == nullptr) return;
  _batchEvents = integerValue(expedited) == 0;
  log::standard(backend_texts::kBatchEventOverride, _batchEvents);
}

/// Every entry up to the first that sets the ordinary address also leaves its realtime address behind.
void HTTPSPostBackend::configureWithoutUserInfo(const PropertyArray& clients) {
  resetBackendStateWithClient(
      firstEntry(clients, [this](const PropertyDictionary& candidate) { return updatePostLink(candidate); }));
}

std::int32_t HTTPSPostBackend::configureWithClientEntry(const PropertyDictionary& entry, const std::string* clientName,
                                                        const std::string* serviceName) {
  const auto country = _context.platform.locale.countryCode();
  const std::string* countryCode = country ? &*country : nullptr;
  if (!passesConsent(entry) || !isUsable(wrongTypeOfRestriction(entry)) || !passesPlaceAndDevice(entry, countryCode) ||
      !takesFilters(entry)) {
    return kBackendDisabled;
  }
  updateSamplingThreshold(entry, countryCode);
  const std::int32_t newState = samplingDecision(entry);
  resetBackendStateWithClient(&entry);
  takeCustomIdentifier(entry, clientName, serviceName);
  log::standard(backend_texts::kClientFound, _name, clientName, serviceName, newState, _samplingFactor);
  updatePostLink(entry);
  updateEventLists(entry);
  _includeSessionIDInHeader = lowByteIsSet(entry, "include_session_id");
  _shouldUseWiFiOnly = lowByteIsSet(entry, "use_wifi_only");
  return newState;
}

bool HTTPSPostBackend::isUsable(const std::optional<WrongType>& wrong) const {
  if (wrong) log::error(backend_texts::kWrongType, _name, wrong->key, wrong->expected);
  return !wrong;
}

bool HTTPSPostBackend::passesConsent(const PropertyDictionary& entry) {
  if (integerValue(entry.find("override_dnu")) == 1) {
    _dnuType = _dnuEnabled ? kOnAndOverridden : kOffButOverridden;
    return true;
  }
  _dnuType = kConsentRespected;
  if (!_dnuEnabled) log::standard(backend_texts::kDisabledByConsent, _dnuEnabled);
  return _dnuEnabled;
}

bool HTTPSPostBackend::passesPlaceAndDevice(const PropertyDictionary& entry, const std::string* countryCode) const {
  if (!matchStringWithList(entry.array("locale_whitelist"), countryCode, false)) {
    log::standard(backend_texts::kNotInCountryList, countryCode, entry.find("locale_whitelist"));
    return false;
  }
  if (!matchStringWithList(entry.array("device_whitelist"), &*_productFamily, true)) {
    log::standard(backend_texts::kNotInDeviceWhitelist, *_productFamily, entry.find("device_whitelist"));
    return false;
  }
  const std::string* hardwareType = _hardwareType ? &*_hardwareType : nullptr;
  if (matchStringWithList(entry.array("device_blacklist"), hardwareType, false)) {
    log::standard(backend_texts::kInDeviceBlacklist, hardwareType, entry.find("device_blacklist"));
    return false;
  }
  return true;
}

/// Filters of the wrong type count as absent: nothing is posted unfiltered by mistake.
bool HTTPSPostBackend::takesFilters(const PropertyDictionary& entry) {
  const PropertyArray* filters = entry.array("filters");
  if (filters == nullptr) {
    log::error(backend_texts::kFiltersRequired);
    return false;
  }
  if (!isUsable(wrongTypeOfFilters(entry))) return false;
  _filter.createFiltersFromArray(*filters);
  return true;
}

void HTTPSPostBackend::updateSamplingThreshold(const PropertyDictionary& entry, const std::string* countryCode) {
  auto threshold = numberOf(entry, "sampling_threshold");
  const PropertyArray* perCountry = entry.array("per_country_sampling_thresholds");
  const PropertyDictionary* own =
      perCountry == nullptr ? nullptr : firstEntry(*perCountry, [&](const PropertyDictionary& candidate) {
        return containsText(candidate.array("country"), countryCode);
      });
  if (own != nullptr) {
    const auto ownThreshold = numberOf(*own, "threshold");
    log::standard(backend_texts::kSamplingThresholdChanged, countryCode, threshold.value_or(0),
                  ownThreshold.value_or(0));
    threshold = ownThreshold;
  }
  setSamplingThreshold(threshold);
}

/// A device that is sampled out waits, unless an override excludes it: so an entry without override makes it wait.
std::int32_t HTTPSPostBackend::samplingDecision(const PropertyDictionary& entry) {
  const auto threshold = samplingThreshold();
  if (!threshold) return kBackendDisabled;
  if (_samplingFactor < *threshold) return kBackendEnabled;
  _overrideSampling = numberOf(entry, "override_sampling");
  return _overrideSampling && *_overrideSampling <= _samplingFactor ? kBackendDisabled : kBackendWaiting;
}

void HTTPSPostBackend::resetBackendStateWithClient(const PropertyDictionary* entry) {
  const PropertyValue* threshold = entry != nullptr ? entry->find("event_threshold") : nullptr;
  _eventThreshold = threshold != nullptr ? int32Value(threshold) : kDefaultEventThreshold;
  log::standard(backend_texts::kEventThreshold, _eventThreshold);
  _extrasOnInternal = entry != nullptr ? int32Value(entry->find("extras_on_internal")) : 0;
  log::standard(backend_texts::kExtrasOnInternal, _extrasOnInternal);
}

void HTTPSPostBackend::takeCustomIdentifier(const PropertyDictionary& entry, const std::string* clientName,
                                            const std::string* serviceName) {
  if (!entry.contains("custom_clientId")) return;
  _uuidCustom = _context.identifiers->getPersistentIdentifierForCustomClientIDSuffix(_context.platform.defaults,
                                                                                     clientName, serviceName);
}

bool HTTPSPostBackend::updatePostLink(const PropertyDictionary& entry) {
  const bool setsOrdinaryURL = updateOrdinaryURL(entry);
  updateRealtimeURL(entry);
  return setsOrdinaryURL;
}

bool HTTPSPostBackend::updateOrdinaryURL(const PropertyDictionary& entry) {
  if (_useDefaultPostURL && _postURL) return false;
  _useDefaultPostURL = false;
  auto url = textOf(entry, "post_url");
  if (!url) return false;
  _postURL = std::move(url);
  log::standard(backend_texts::kStorebagPostURL, *_postURL);
  return true;
}

void HTTPSPostBackend::updateRealtimeURL(const PropertyDictionary& entry) {
  if (_useDefaultRealtimePostURL && _realtimePostURL) return;
  _useDefaultRealtimePostURL = false;
  _realtimePostURL = textOf(entry, "realtime_post_url");
  if (_realtimePostURL) {
    log::standard(backend_texts::kStorebagRealtimePostURL, *_realtimePostURL);
    return;
  }
  _realtimePostURL = _postURL;
  log::standard(backend_texts::kRealtimePostURLDefaults, _postURL);
}

void HTTPSPostBackend::updateEventLists(const PropertyDictionary& entry) {
  if (const PropertyArray* whitelist = entry.array("event_whitelist")) {
    _eventWhitelist = *whitelist;
    log::standard(backend_texts::kEventWhitelist, _name, *whitelist);
  }
  if (const PropertyArray* blacklist = entry.array("event_blacklist")) {
    _eventBlacklist = *blacklist;
    log::standard(backend_texts::kEventBlacklist, _name, *blacklist);
  }
}

const std::string& HTTPSPostBackend::clientIdentifier() const {
  if (_extrasOnInternal != 0 && _isInternal) return _udid;
  if (_uuidCustom) return *_uuidCustom;
  return _dnuType != kConsentRespected ? _uuidOverrideDnu : _uuidRespectDnu;
}

}  // namespace velk
