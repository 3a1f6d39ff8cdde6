// The object that a process creates to report through the daemon.
//
// It validates the session info, connects to "com.tavrin.velkreportingd" and from then on turns each call into a call
// on the session that the daemon keeps for it, from a queue of its own, so that calls arrive in the order in which they
// were made. No daemon need be running: the connection is made at first use, and again after the daemon came back;
// events wait meanwhile, within a bound. No call below blocks on the daemon.
//
// Any thread may call any operation. Callbacks run on threads of the library that are there only while they are needed;
// a callback may take its time and may wait for another one. Message texts and aggregated events arrive in order, one
// at a time; answers to different calls may arrive at the same time.
//
// When the last reference goes, what was handed over is sent, the session is finished, and the connection is closed.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "foundation/ErrorValue.h"
#include "foundation/Export.h"
#include "foundation/PropertyValue.h"

namespace velk {

class VelkReporting;
class VelkReportingImplementation;

/// Hears of every valid message that a client hands over, filtered or not. Called in order, on the library's threads.
class VelkReportingMessageSentDelegate {
 public:
  virtual ~VelkReportingMessageSentDelegate() = default;
  virtual void didSendMessageForReportingClient(const std::shared_ptr<VelkReporting>& client,
                                                const PropertyDictionary& event) = 0;
};

/// Session info of the client that an event came from (absent in the call that ends the aggregation), time in seconds
/// since 1970, category, type, payload with the sender's user info merged in. One that throws is never called again.
using VelkReportingAggregationBlock =
    std::function<void(const std::optional<PropertyDictionary>& client, double timestamp, std::uint16_t category,
                       std::uint16_t type, const std::optional<PropertyDictionary>& payload)>;

class VELK_EXPORT VelkReporting : public std::enable_shared_from_this<VelkReporting> {
 public:
  /// The names of the backends that are enabled, or nothing when the daemon could not be asked.
  using StatesCallback = std::function<void(const std::optional<PropertyArray>& enabledBackends)>;
  using LoggingBlock = std::function<void(const std::string& text)>;
  using FlushCallback = std::function<void(const std::optional<Error>& error)>;
  using UploadCallback = std::function<void(bool uploaded, const std::optional<Error>& error)>;

  /// A client, or null (and a line in the log) without session info, with a "ComponentType" outside 5 to 30, or with
  /// an "EnableFlag" of 0. `frameworksToCheck` is handed to the daemon. With an aggregation block the client is
  /// handed its own events and those of the sessions below it.
  [[nodiscard]] static std::shared_ptr<VelkReporting> initWithSessionInfo(
      const std::optional<PropertyDictionary>& sessionInfo, const std::optional<PropertyDictionary>& userInfo,
      const PropertyArray& frameworksToCheck, VelkReportingAggregationBlock aggregationBlock = nullptr);

  ~VelkReporting();
  VelkReporting(const VelkReporting&) = delete;
  VelkReporting& operator=(const VelkReporting&) = delete;

  /// Has the daemon build the session's backends; once, before events are sent.
  void startConfigurationWithCompletionHandler(StatesCallback completionHandler);
  /// Gives the session a new user info and asks which backends are enabled now.
  void fetchReportingStatesWithUserInfo(const std::optional<PropertyDictionary>& userInfo,
                                        StatesCallback fetchComplete);

  /// Sends an event. False, with error code 4, only for category 0: an event that the storebag filters, and one that
  /// finds the outbox full, answer true.
  bool sendMessageWithCategory(std::uint16_t category, std::uint16_t type,
                               const std::optional<PropertyDictionary>& payload = std::nullopt, Error* error = nullptr);
  /// Sends a message dictionary ("ParametersCategory", "ParametersType", "ParametersPayload", "ParametersFlag").
  /// False without error when the storebag filters it; false with an error for a missing category or type (code 7),
  /// a category of 0 (4), and when the outbox is full (8).
  bool sendMessageWithDictionary(const PropertyDictionary& dictionary, Error* error = nullptr);

  /// Has the daemon post what it batched for this session. Always true.
  bool flushMessages();
  void flushMessagesWithCompletion(FlushCallback completion);
  /// Marks the session as finished gracefully. Overtakes what is still queued, and awaits nothing.
  void finishSession();

  // Data that the sessions of one hierarchy share: it travels with the events of all of them.
  void updateSharedDataWithDictionary(const PropertyDictionary& dictionary);
  /// Without a value the key is removed.
  void updateSharedDataForKey(const std::string& key, const std::optional<PropertyValue>& value);

  void setMessageSentDelegate(std::weak_ptr<VelkReportingMessageSentDelegate> delegate);
  [[nodiscard]] std::shared_ptr<VelkReportingMessageSentDelegate> messageSentDelegate() const;
  /// Is given the text of each message that left, and the address at which reports can be viewed.
  void setMessageLoggingBlock(LoggingBlock block);

  /// True when the list of allowed categories is empty or holds this one.
  [[nodiscard]] bool isWhitelistedEvent(std::uint16_t category) const;
  [[nodiscard]] bool isBlacklistedEvent(std::uint16_t category) const;

  [[nodiscard]] bool serverSupportsFileUpload() const;
  /// Hands a file (a path, or a file URL) to the daemon for upload: opened here, without following links.
  bool uploadFileWithURL(const std::optional<std::string>& fileURL, UploadCallback completionHandler);
  bool uploadDataArray(const std::optional<PropertyArray>& logData, UploadCallback completionHandler);
  /// The key of the digest that goes with each post of the "qrs" backend. False without a key.
  bool setDigestKey(const std::optional<ByteData>& digestKey, std::uint32_t algorithm);

  // Services that need no client object.

  /// A random identifier of this user that lasts until it is regenerated: one for use while the user's consent to
  /// diagnostics and usage data is respected, one for use regardless of it.
  [[nodiscard]] static std::string getPersistentIdentifierForDNU(bool respectConsent);
  static void regeneratePersistentIdentifierForDNU(bool respectConsent);

  /// A token for a session below that of `parentToken` (nothing: a new root of level 0). Nothing when the parent is
  /// no dictionary or has no "token".
  [[nodiscard]] static std::optional<PropertyDictionary> newHierarchyTokenFromParentToken(
      const std::optional<PropertyValue>& parentToken);

  /// Reports a single event without a client object. True: it was taken; delivery is not reported. False, with an
  /// error: 2 no session info, 3 client type outside 5 to 30, 4 category 0, 8 too many are waiting.
  static bool sendOneMessageWithSessionInfo(const std::optional<PropertyDictionary>& sessionInfo,
                                            const std::optional<PropertyDictionary>& userInfo, std::uint16_t category,
                                            std::uint16_t type, const std::optional<PropertyDictionary>& payload,
                                            Error* error = nullptr);

 private:
  explicit VelkReporting(std::shared_ptr<VelkReportingImplementation> implementation);
  void notifyMessageWasSent(const PropertyDictionary& message);

  const std::shared_ptr<VelkReportingImplementation> _implementation;
};

}  // namespace velk
