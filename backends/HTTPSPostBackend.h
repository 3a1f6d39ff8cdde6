// Posts events as JSON over HTTPS: one by one, or in batches. Its storebag section (the profile) holds client entries;
// the one that fits the session's client decides whether and where events are posted, and what is left out of them.
//
// Made by the factory; used on its session's queue, as its base says. The batch and the counters belong to the state
// queue. Posts in flight hold nothing but the state, which a server's refusal disables.
//
//   not configured (0) --updateState--> disabled (1) | enabled (2) | waiting (3)
//   waiting --event with flag 2 or 3--> enabled --answer 500 to 599--> disabled
//   Once a flush has produced a text the configuration is frozen.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "backends/ClientEntryMatching.h"
#include "backends/EventBatch.h"
#include "backends/EventFilter.h"
#include "backends/VelkReportingBackend.h"

namespace velk {

class HTTPSPostBackend final : public VelkReportingBackend {
 public:
  /// Null without profile or product family, and (with an error line) without client entries.
  [[nodiscard]] static std::shared_ptr<HTTPSPostBackend> initWithName(const BackendContext& context,
                                                                      const std::string& name,
                                                                      const PropertyValue& profile,
                                                                      const std::optional<std::string>& productFamily);
  ~HTTPSPostBackend() override;

  std::int32_t updateState() override;
  std::optional<std::string> sendMessageWithEventID(const std::optional<PropertyDictionary>& message,
                                                    const TimeValue& timestamp, std::uint16_t method,
                                                    std::uint16_t respCode, std::uint16_t eventID,
                                                    std::uint32_t flag) override;
  std::optional<std::string> flushMessagesWithCompletion(BackendFlushCompletion completion) override;
  void setCorrelatedSessionID(const std::string& combinedSessionID) override;
  [[nodiscard]] std::uint64_t batchedEventsSize() const override;
  [[nodiscard]] std::uint64_t batchedEventsCount() const override;
  [[nodiscard]] bool isHTTPSPostBackend() const override { return true; }

  /// Where ordinary posts go; nothing: nowhere.
  [[nodiscard]] const std::optional<std::string>& postURL() const { return _postURL; }
  void setPostURL(std::optional<std::string> url) { _postURL = std::move(url); }

 private:
  struct Private {};  // keeps the constructor to initWithName, yet open to make_shared

 public:
  HTTPSPostBackend(Private, const BackendContext& context, const std::string& name, const PropertyValue& profile,
                   const std::optional<std::string>& productFamily);

 private:
  /// Consent as the chosen entry treats it.
  enum DnuType : std::int32_t { kConsentRespected = 0, kOffButOverridden = 1, kOnAndOverridden = 2 };

  /// A JSON body, and its text for the message log when that is wanted and allowed.
  struct Body {
    std::string json;
    std::optional<std::string> pretty;
  };
  /// What a flush found.
  struct Taken {
    enum class Outcome : std::uint8_t { nothing, userInfoMissing, events };
    Outcome outcome = Outcome::nothing;
    std::vector<PropertyDictionary> events;
  };
  using PostCompletion = Completion<std::optional<Error>>;

  // Configuration (HTTPSPostConfiguration.cpp).
  std::int32_t updateBackendState();
  std::int32_t configureWithClientEntry(const PropertyDictionary& entry, const std::string* clientName,
                                        const std::string* serviceName);
  void expedite(const PropertyArray& clients, const std::string* clientName, const std::string* serviceName);
  void configureWithoutUserInfo(const PropertyArray& clients);
  [[nodiscard]] bool isUsable(const std::optional<WrongType>& wrong) const;
  [[nodiscard]] bool passesConsent(const PropertyDictionary& entry);
  [[nodiscard]] bool passesPlaceAndDevice(const PropertyDictionary& entry, const std::string* countryCode) const;
  [[nodiscard]] bool takesFilters(const PropertyDictionary& entry);
  void updateSamplingThreshold(const PropertyDictionary& entry, const std::string* countryCode);
  [[nodiscard]] std::int32_t samplingDecision(const PropertyDictionary& entry);
  void resetBackendStateWithClient(const PropertyDictionary* entry);
  void takeCustomIdentifier(const PropertyDictionary& entry, const std::string* clientName,
                            const std::string* serviceName);
  bool updatePostLink(const PropertyDictionary& entry);
  bool updateOrdinaryURL(const PropertyDictionary& entry);
  void updateRealtimeURL(const PropertyDictionary& entry);
  void updateEventLists(const PropertyDictionary& entry);
  [[nodiscard]] const std::string& clientIdentifier() const;

  // Events and batches.
  [[nodiscard]] bool hasUserInfoIfRequired() const { return !_requireUserInfo || _userInfoDict.has_value(); }
  void addStopFields(PropertyDictionary& payload);
  [[nodiscard]] PropertyDictionary newEvent(const PropertyDictionary& payload, const PropertyDictionary* sharedData,
                                            const TimeValue& timestamp, std::uint16_t method, std::uint16_t respCode,
                                            std::uint16_t eventID) const;
  void prepareEventForMessage(PropertyDictionary& event, const PropertyDictionary* frameworkData) const;
  std::optional<std::string> sendNow(PropertyDictionary event, std::int32_t state, bool realtime, std::uint16_t method,
                                     std::uint16_t respCode, std::uint32_t flag);
  std::optional<std::string> batchEvent(PropertyDictionary event);
  void appendToBatch(PropertyDictionary event);
  [[nodiscard]] Taken takeBatch();
  [[nodiscard]] std::vector<PropertyDictionary> withoutUnlistedEvents(std::vector<PropertyDictionary> events) const;
  std::optional<std::string> postBatch(std::vector<PropertyDictionary> events, BackendFlushCompletion completion);

  // Posts.
  [[nodiscard]] std::optional<Body> createMessageForPostAndLogging(std::vector<PropertyDictionary> events);
  [[nodiscard]] bool mayLogEvents() const;
  [[nodiscard]] const std::optional<std::string>& urlFor(std::uint32_t flag) const;
  /// True when a post with this flag would end at a transport that has gone or takes none: its events are lost, and
  /// neither counted nor logged as sent. A missing address is told by the post itself.
  [[nodiscard]] bool isDropped(std::uint32_t flag) const;
  void postJSONMessage(std::string json, std::uint32_t flag, std::optional<std::uint16_t> method,
                       std::optional<std::uint16_t> responseCode, PostCompletion completion);

  // Constant after construction.
  bool _dnuEnabled = false;
  std::string _uuidRespectDnu;
  std::string _uuidOverrideDnu;
  bool _forceEventLogging = false;

  // Guarded by the state queue.
  const std::shared_ptr<EventBatch> _batch = std::make_shared<EventBatch>(_context.batchMemory);

  // Used on the owning session's queue only.
  std::optional<std::string> _postURL;
  std::optional<std::string> _realtimePostURL;
  bool _useDefaultPostURL = false;          ///< the suite's address stands, whatever storebags say
  bool _useDefaultRealtimePostURL = false;  ///< the same for realtime posts
  EventFilter _filter;
  std::int32_t _dnuType = kConsentRespected;
  std::int32_t _eventThreshold;
  std::int32_t _extrasOnInternal = 0;
  std::optional<double> _overrideSampling;
  std::optional<std::string> _uuidCustom;
  bool _immutable = false;  ///< events have left: the configuration stays as it is
  bool _includeSessionIDInHeader = false;
  bool _shouldUseWiFiOnly = false;
  std::size_t _lastBodySize = 0;  ///< how much room the next body is given
};

}  // namespace velk
