// A session that is what a test says it is and remembers what the agent asks of it.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "ipc/Vocabulary.h"
#include "session/ReportingdSession.h"

namespace velk::test {

class FakeReportingdSession : public ReportingdSession {
 public:
  explicit FakeReportingdSession(std::shared_ptr<SessionConnection> connection = nullptr)
      : connection(std::move(connection)) {}

  /// A session of this client type.
  static std::shared_ptr<FakeReportingdSession> ofType(std::int64_t clientType) {
    auto session = std::make_shared<FakeReportingdSession>();
    session->info = PropertyDictionary{{kVelkReportingSessionInfoClientType, clientType}};
    return session;
  }
  /// A session of a hierarchy.
  static std::shared_ptr<FakeReportingdSession> relative(std::string token, std::uint32_t level, std::string idString,
                                                         bool aggregates = false) {
    auto session = std::make_shared<FakeReportingdSession>();
    session->token = std::move(token);
    session->level = level;
    session->idString = std::move(idString);
    session->aggregates = aggregates;
    return session;
  }

  void setSessionInfo(PropertyDictionary, std::optional<PropertyDictionary>, PropertyArray, bool) override {}
  void startConfigWithCompletionHandler(ConfigurationReply) override {}
  void fetchStatesWithUserInfo(std::optional<PropertyDictionary>, ConfigurationReply) override {}
  void fetchDisplayURL(TextReply) override {}
  void sendMessageWithDictionary(PropertyDictionary, TextReply) override {}
  void flushMessagesWithCompletion(FlushReply) override {}
  void finishSessionGracefully() override {}
  void uploadFileAtPath(std::string, std::string, FileDescriptor, UploadReply) override {}
  void uploadLogData(PropertyArray, LogDataReply) override {}
  void sendMessageWithSessionInfo(PropertyDictionary, std::optional<PropertyDictionary>, std::uint16_t, std::uint16_t,
                                  std::optional<PropertyDictionary>, TextReply) override {}
  void updateSharedDataWithDictionary(PropertyDictionary) override {}
  void updateSharedDataForKey(std::string, std::optional<PropertyValue>) override {}
  void setDigestKey(ByteData, std::int32_t) override {}

  std::optional<PropertyDictionary> sessionInfo() const override { return info; }
  std::optional<PropertyDictionary> userInfo() const override { return user; }
  std::uint32_t sessionID() const override { return number; }
  const std::string& sessionIDString() const override { return idString; }
  std::optional<std::string> hierarchyToken() const override { return token; }
  std::uint32_t hierarchyLevel() const override { return level; }
  bool hasAggregator() const override { return aggregates; }
  bool hasValidUserInfoKeys() const override {
    return user &&
           (user->contains(kVelkReportingUserInfoClientName) || user->contains(kVelkReportingUserInfoServiceName));
  }
  bool isCounted() const override { return counted; }
  void setCounted(bool value) override { counted = value; }
  std::uint64_t batchedEventsSize() const override { return 0; }
  PropertyDictionary statusDictionary() const override {
    if (whenAskedForStatus) whenAskedForStatus();
    return status.empty() ? PropertyDictionary{{"sessionID", number}} : status;
  }
  std::string description() const override { return "<session " + idString + ">"; }

  void updateCombinedSessionID() override { calls.push_back("updateCombinedSessionID"); }
  void syncReportingStates() override { calls.push_back("syncReportingStates"); }
  void shutdownSessionAggregation() override { calls.push_back("shutdownSessionAggregation"); }
  void clientHasGone() override { ++departures; }
  void invalidate() override {
    ++invalidations;
    if (connection) connection->invalidate();
  }
  void teardown() override { ++teardowns; }

  std::shared_ptr<SessionConnection> connection;
  std::optional<PropertyDictionary> info;
  std::optional<PropertyDictionary> user;
  std::uint32_t number = 7;
  std::string idString = "ID";
  std::optional<std::string> token;
  std::uint32_t level = 0;
  bool aggregates = false;
  bool counted = false;
  PropertyDictionary status;
  std::function<void()> whenAskedForStatus;
  std::vector<std::string> calls;
  std::atomic<int> invalidations{0};
  std::atomic<int> teardowns{0};
  std::atomic<int> departures{0};
};

}  // namespace velk::test
