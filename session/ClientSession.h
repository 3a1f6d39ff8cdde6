// The session itself: configuration, backends, message pipeline, aggregation, flush, health, uploads, teardown.
// Private to this folder; the agent holds it as a ReportingdSession.
//
// The interface methods, and `teardown`, run on the connection's queue, one at a time: they are the only writers of
// the fields. Whatever other threads may ask for is atomic, or an immutable value that is published under `_lock`.
// No backend is called, nothing is logged and no file is touched under `_lock`. Completions that a session hands out
// hold no session. The destructor only drops references: it may run on any thread, inside another session's teardown.
//
// Locks, outermost first: the agent's monitor, `_aggregationLock`, `_lock`.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/Lock.h"
#include "session/ReportingdSession.h"
#include "session/SessionBackends.h"
#include "session/UploadQueue.h"

namespace velk {

class ClientSession final : public ReportingdSession {
 public:
  ClientSession(ReportingdSessionDelegate& delegate, std::shared_ptr<SessionConnection> connection,
                const SessionServices& services);

  // What clients ask (configuration).
  void setSessionInfo(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                      PropertyArray frameworksToCheck, bool hasAggregationBlock) override;
  void startConfigWithCompletionHandler(ConfigurationReply reply) override;
  void fetchStatesWithUserInfo(std::optional<PropertyDictionary> userInfo, ConfigurationReply reply) override;
  /// The algorithm goes to the "qrs" backend and is not kept: a later refresh of the user info hands on 0.
  void setDigestKey(ByteData key, std::int32_t algorithm) override;

  // What clients ask (messages).
  void sendMessageWithDictionary(PropertyDictionary dictionary, TextReply reply) override;
  void sendMessageWithSessionInfo(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                                  std::uint16_t category, std::uint16_t type, std::optional<PropertyDictionary> payload,
                                  TextReply reply) override;
  void updateSharedDataWithDictionary(PropertyDictionary dictionary) override;
  void updateSharedDataForKey(std::string key, std::optional<PropertyValue> value) override;

  // What clients ask (the rest).
  void flushMessagesWithCompletion(FlushReply reply) override;
  void finishSessionGracefully() override;
  void fetchDisplayURL(TextReply reply) override;
  void uploadFileAtPath(std::string url, std::string extensionToken, FileDescriptor file, UploadReply reply) override;
  void uploadLogData(PropertyArray logData, LogDataReply reply) override;

  // What the agent and other sessions read and ask: see the base class.
  [[nodiscard]] std::optional<PropertyDictionary> sessionInfo() const override;
  [[nodiscard]] std::optional<PropertyDictionary> userInfo() const override;
  [[nodiscard]] std::uint32_t sessionID() const override { return _sessionID; }
  [[nodiscard]] const std::string& sessionIDString() const override { return _sessionIDString; }
  [[nodiscard]] std::optional<std::string> hierarchyToken() const override;
  [[nodiscard]] std::uint32_t hierarchyLevel() const override;
  [[nodiscard]] bool hasAggregator() const override { return _hasAggregator; }
  [[nodiscard]] bool hasValidUserInfoKeys() const override;
  [[nodiscard]] bool isCounted() const override { return _counted; }
  void setCounted(bool counted) override { _counted = counted; }
  [[nodiscard]] std::uint64_t batchedEventsSize() const override;
  [[nodiscard]] PropertyDictionary statusDictionary() const override;
  [[nodiscard]] std::string description() const override;
  [[nodiscard]] std::shared_ptr<const SessionBackends> backends() const override;
  void updateCombinedSessionID() override;
  void syncReportingStates() override;
  void shutdownSessionAggregation() override;
  [[nodiscard]] Result<void> sendToAggregator(const std::optional<PropertyDictionary>& sessionInfo, double timestamp,
                                              std::uint16_t category, std::uint16_t type,
                                              const std::optional<PropertyDictionary>& payload) override;
  void clientHasGone() override;
  [[nodiscard]] bool takesAggregatorFailureLine() override;
  void invalidate() override;
  void teardown() override;

 private:
  /// Where a session stands among its relatives.
  struct Hierarchy {
    std::optional<std::string> token;
    std::uint32_t level = 0;
  };

  // Configuration (SessionConfiguration.cpp).
  void storeSessionInfo(PropertyDictionary sessionInfo);
  /// Stores the hierarchy token of the session info that is stored, if it has one.
  void storeHierarchy();
  void storeUserInfo(std::optional<PropertyDictionary> userInfo);
  void readDeviceIdentifier();
  void updateUserInfo(std::optional<PropertyDictionary> userInfo);
  void releaseUserInfo();
  void storeHelper(std::shared_ptr<ReportingSessionConnectivityHelper> helper);
  void receivedUserInfo(const std::optional<PropertyDictionary>& userInfo);
  void createBackendsWithStorebag(const PropertyDictionary& storebag);
  void publishBackends(std::shared_ptr<const SessionBackends> backends);
  void setAggregator(bool hasAggregator);

  // Reporting states (ReportingStates.cpp).
  void updateUserInfoForBackends();
  /// True when a backend is enabled afterwards.
  bool updateReportingStates();
  void updateSessionWithDefaultSessionInfo();
  void replyWithStates(ConfigurationReply reply) const;

  // Messages (MessagePipeline.cpp).
  /// The single entry of client messages and internal messages. Answers the text for the client.
  std::optional<std::string> sendMessageWithDictionary(const PropertyDictionary& dictionary);
  /// Back-pressure: the client's next message waits while too many of this session's posts are under way.
  void waitForRoom();
  [[nodiscard]] PropertyDictionary makeMessageBlob(const PropertyDictionary* payload);
  void internalSendMessage(PropertyDictionary payload, std::uint16_t method, std::uint16_t respCode);
  void sendStartMessage();

  // Aggregation (Aggregation.cpp).
  void aggregateMessage(double timestamp, std::uint16_t category, std::uint16_t type,
                        const PropertyDictionary* payload);
  [[nodiscard]] Result<void> appendToConnection(const std::optional<PropertyDictionary>& sessionInfo, double timestamp,
                                                std::uint16_t category, std::uint16_t type,
                                                const std::optional<PropertyDictionary>& payload)
      VELK_REQUIRES(_aggregationLock);

  // One-shot messages (OneShot.cpp).
  void sendOneMessageWithSessionInfo(const std::optional<PropertyDictionary>& sessionInfo,
                                     const std::optional<PropertyDictionary>& userInfo,
                                     const std::optional<PropertyDictionary>& storebag, std::uint16_t category,
                                     std::uint16_t type, const std::optional<PropertyDictionary>& payload);

  // Uploads (Uploads.cpp).
  void uploadFileWithURL(std::string url, std::string extensionToken, FileDescriptor file, UploadReply reply);

  // Flush (Flush.cpp).
  void flushBackends(FlushReply reply);

  // Teardown (Teardown.cpp).
  [[nodiscard]] PropertyDictionary makeHealthPayload();
  void letGo();
  void returnKeepAlive();
  void releaseEverything();

  // The connection's queue is the only writer, so it reads its own fields without the lock.
  [[nodiscard]] const std::optional<PropertyDictionary>& ownSessionInfo() const VELK_NO_THREAD_SAFETY_ANALYSIS {
    return _sessionInfo;
  }
  [[nodiscard]] const std::optional<PropertyDictionary>& ownUserInfo() const VELK_NO_THREAD_SAFETY_ANALYSIS {
    return _userInfo;
  }
  [[nodiscard]] const Hierarchy& ownHierarchy() const VELK_NO_THREAD_SAFETY_ANALYSIS { return _hierarchy; }
  [[nodiscard]] const std::shared_ptr<const SessionBackends>& ownBackends() const VELK_NO_THREAD_SAFETY_ANALYSIS {
    return _backends;
  }
  [[nodiscard]] const std::shared_ptr<ReportingSessionConnectivityHelper>& ownHelper() const
      VELK_NO_THREAD_SAFETY_ANALYSIS {
    return _connectivityHelper;
  }

  // Constant after construction.
  ReportingdSessionDelegate& _delegate;
  const SessionServices& _services;
  const std::string _sessionIDString;

  // Of the connection's queue alone.
  /// The posts of the backends carry its number.
  const std::shared_ptr<PostSender> _sender;
  PropertyArray _frameworks;
  std::string _deviceIdentifier;
  std::optional<std::string> _storebagVersion;
  std::optional<ByteData> _digestKey;
  std::int32_t _digestAlgorithm = 0;
  std::uint32_t _connectivityHelperReleaseTimeout;
  UploadQueue _uploads;
  /// Where the texts of flushes are written to the message log, made with the first flush.
  std::shared_ptr<Queue> _flushLogQueue;
  bool _tornDown = false;

  // Self-synchronised.
  std::atomic<std::uint32_t> _sessionID{0};
  std::atomic<bool> _hasAggregator{false};  // changes under _aggregationLock
  std::atomic<bool> _hasFinishedGracefully{false};
  std::atomic<bool> _counted{false};
  std::atomic<bool> _clientHasGone{false};
  /// Held where events and the end marker are appended to this session's connection, so that nothing follows the
  /// marker. May be taken with the agent's monitor held; what runs under it waits for nobody.
  Lock _aggregationLock;
  std::optional<SteadyTime> _lastFailureLine VELK_GUARDED_BY(_aggregationLock);

  // Guarded by _lock.
  mutable Lock _lock;
  std::shared_ptr<SessionConnection> _connection VELK_GUARDED_BY(_lock);
  std::optional<PropertyDictionary> _sessionInfo VELK_GUARDED_BY(_lock);
  std::optional<PropertyDictionary> _userInfo VELK_GUARDED_BY(_lock);
  Hierarchy _hierarchy VELK_GUARDED_BY(_lock);
  std::shared_ptr<const SessionBackends> _backends VELK_GUARDED_BY(_lock);
  std::shared_ptr<ReportingSessionConnectivityHelper> _connectivityHelper VELK_GUARDED_BY(_lock);
};

}  // namespace velk
