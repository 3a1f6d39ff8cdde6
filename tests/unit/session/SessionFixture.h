// A session between fakes: an agent, a connection, a message log and backends that do as they are told.
#pragma once

#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "device/DeviceEnvironment.h"
#include "ipc/Vocabulary.h"
#include "session/LogTexts.h"
#include "session/ReportingdSession.h"
#include "session/SessionBackends.h"
#include "tests/support/FakeHttpSession.h"
#include "tests/support/FakePlatform.h"
#include "tests/support/RecordingLog.h"

namespace velk::test {

/// What happened, in order. Any thread.
class Journal {
 public:
  void note(std::string entry);
  [[nodiscard]] std::vector<std::string> entries() const;
  [[nodiscard]] int count(std::string_view entry) const;
  void clear();

 private:
  mutable Lock _lock;
  std::vector<std::string> _entries VELK_GUARDED_BY(_lock);
};

class FakeMessageLog : public MessageLog {
 public:
  void writeToLogFile(std::string_view text) override { journal.note(std::string(text)); }
  Journal journal;
};

class FakeConnection : public SessionConnection {
 public:
  struct Call {
    std::optional<PropertyDictionary> sessionInfo;
    double timestamp;
    std::uint16_t category;
    std::uint16_t type;
    std::optional<PropertyDictionary> payload;
    [[nodiscard]] bool isEndMarker() const {
      return !sessionInfo && !payload && timestamp == 0 && category == 0 && type == 0;
    }
  };

  void invalidate() override { ++invalidations; }
  [[nodiscard]] Result<void> sendMessageToClient(const std::optional<PropertyDictionary>& sessionInfo, double timestamp,
                                                 std::uint16_t category, std::uint16_t type,
                                                 const std::optional<PropertyDictionary>& payload) override;
  [[nodiscard]] std::string description() const override { return "<connection>"; }
  [[nodiscard]] std::uint32_t user() const override { return 1000; }

  [[nodiscard]] std::vector<Call> calls() const;

  std::atomic<int> invalidations{0};
  /// Nothing fits any more.
  std::atomic<bool> full{false};

 private:
  mutable Lock _lock;
  std::vector<Call> _calls VELK_GUARDED_BY(_lock);
};

/// Set the answers before other threads call.
class FakeBackend : public VelkReportingBackend {
 public:
  struct Sent {
    std::optional<PropertyDictionary> message;
    TimeValue timestamp;
    std::uint16_t method;
    std::uint16_t respCode;
    std::uint16_t eventID;
    std::uint32_t flag;
  };

  FakeBackend(const BackendContext& context, std::string name, PropertyValue profile,
              std::optional<std::string> productFamily, std::int32_t clientType, Journal& journal);

  void cleanup() override { journal.note("cleanup " + name()); }
  std::int32_t updateState() override;
  std::optional<std::string> sendMessageWithEventID(const std::optional<PropertyDictionary>& message,
                                                    const TimeValue& timestamp, std::uint16_t method,
                                                    std::uint16_t respCode, std::uint16_t eventID,
                                                    std::uint32_t flag) override;
  std::optional<std::string> flushMessagesWithCompletion(BackendFlushCompletion completion) override;
  [[nodiscard]] bool uploadFileAtPath(FileUpload& upload) override;
  [[nodiscard]] bool uploadLogData(const PropertyArray& logData) override;
  [[nodiscard]] std::uint64_t batchedEventsSize() const override { return batchedSize; }
  [[nodiscard]] std::uint64_t batchedEventsCount() const override { return batchedCount; }
  [[nodiscard]] bool isHTTPSPostBackend() const override { return isPost; }

  void setWhitelist(std::optional<PropertyArray> whitelist) { _eventWhitelist = std::move(whitelist); }
  void setBlacklist(std::optional<PropertyArray> blacklist) { _eventBlacklist = std::move(blacklist); }
  void setDisplayURL(std::optional<std::string> url) { _displayURL = std::move(url); }

  // What the session has set.
  [[nodiscard]] std::optional<std::string> combinedID() const { return combinedSessionIDString(); }
  [[nodiscard]] const std::optional<PropertyDictionary>& heldUserInfo() const { return _userInfoDict; }
  [[nodiscard]] const std::optional<ByteData>& heldDigestKey() const { return _digestKey; }
  [[nodiscard]] std::int32_t heldDigestAlgorithm() const { return _digestAlgorithm; }
  [[nodiscard]] PostSender& sender() const { return *_sender; }
  [[nodiscard]] bool nestedDataAllowed() const { return _allowNestedData; }
  using VelkReportingBackend::transport;
  /// Its attributes as one line.
  [[nodiscard]] std::string attributes() const;

  Journal& journal;
  const std::int32_t clientType;
  std::vector<Sent> sent;
  std::vector<BackendFlushCompletion> flushes;
  std::optional<std::string> text;
  std::uint64_t batchedSize = 0;
  std::uint64_t batchedCount = 0;
  std::int32_t nextState = kBackendEnabled;
  int stateUpdates = 0;
  bool isPost = false;
  bool takesUploads = false;
  bool deliversUploads = false;
  ProcessUploads::User uploadsUser = 0;
};

/// The agent. Tables and answers are the test's.
class FakeDelegate : public ReportingdSessionDelegate {
 public:
  FakeDelegate(Platform& platform, Journal& journal) : _platform(platform), _journal(journal) {}

  [[nodiscard]] std::optional<PropertyDictionary> storebagForSession(ReportingdSession&) override { return storebag; }
  [[nodiscard]] std::optional<std::string> storebagVersionForSession(ReportingdSession&) override { return version; }
  [[nodiscard]] std::optional<std::string> parentSessionIDStringForSession(ReportingdSession&) override {
    return parentID;
  }
  void updateCorrelatedSessions(ReportingdSession& session) override;
  [[nodiscard]] std::shared_ptr<ReportingdSession> getAncestorWithAggregatorForSession(ReportingdSession&) override {
    return ancestor && ancestor->hasAggregator() ? ancestor : nullptr;
  }
  void updateDownstreamSessions(ReportingdSession&) override { _journal.note("updateDownstreamSessions"); }
  [[nodiscard]] std::shared_ptr<ReportingdSession> parentSessionForChild(ReportingdSession&) override { return parent; }
  void updateSharedDataForSession(ReportingdSession&, const PropertyDictionary& data) override;
  void removeObjectFromSharedDataForSession(ReportingdSession&, const std::string& key) override;
  [[nodiscard]] std::optional<PropertyDictionary> sharedDataForSession(ReportingdSession&) override {
    return sharedData;
  }
  [[nodiscard]] ReportingAgentState copyReportingAgentState() override {
    ++stateCopies;
    return state;
  }
  void releaseIPCTransactions(std::uint32_t count) override;
  [[nodiscard]] std::shared_ptr<ReportingSessionConnectivityHelper> copySharedConnectivityHelperForReportingSession(
      ReportingdSession& session, std::int32_t mode) override;
  void releaseSharedConnectivityHelperForReportingSession(ReportingdSession& session) override;
  [[nodiscard]] bool isActiveClientLimitReachedForSession(ReportingdSession& session,
                                                          const PropertyDictionary& sessionInfo) override;
  [[nodiscard]] Monitor& monitor() override { return _monitor; }
  [[nodiscard]] std::string description() const override { return "<agent>"; }

  /// The helper of that user, or null.
  [[nodiscard]] std::shared_ptr<ReportingSessionConnectivityHelper> helper(const std::string& key) const;
  /// Active helpers live until they are told to end.
  void invalidateHelpers();

  std::optional<PropertyDictionary> storebag;
  std::optional<std::string> version = "5";
  std::optional<std::string> parentID;
  std::shared_ptr<ReportingdSession> ancestor;
  std::shared_ptr<ReportingdSession> parent;
  std::optional<PropertyDictionary> sharedData;
  ReportingAgentState state;
  int stateCopies = 0;
  bool limitReached = false;
  std::vector<PropertyDictionary> limitQuestions;

 private:
  Platform& _platform;
  Journal& _journal;
  Monitor _monitor;
  std::map<std::string, std::shared_ptr<ReportingSessionConnectivityHelper>> _helpers;
};

struct ConfigurationAnswer {
  int calls = 0;
  std::optional<PropertyArray> states;
  std::optional<PropertyArray> whitelist;
  std::optional<PropertyArray> blacklist;
};

struct FlushAnswer {
  int calls = 0;
  int dropped = 0;
  std::optional<std::string> text;
  std::optional<Error> error;
};

class SessionTest : public ::testing::Test {
 protected:
  SessionTest();
  ~SessionTest() override;

  /// Another session of the same agent, with a connection of its own.
  [[nodiscard]] std::shared_ptr<ReportingdSession> makeSession(std::shared_ptr<FakeConnection> itsConnection);
  void makeInternalBuild() { fakes.device.set("ReleaseType", "Internal"); }

  /// A storebag with a section under each name, in that order.
  void serveBackends(const std::vector<std::string>& names);
  /// Describes the session with client type 8 and number 7, and these additions.
  void describe(PropertyDictionary additions = {}, std::optional<PropertyDictionary> userInfo = std::nullopt,
                bool hasAggregationBlock = false);
  ConfigurationAnswer configure();
  ConfigurationAnswer fetchStates(std::optional<PropertyDictionary> userInfo);
  /// describe, serveBackends and configure, then forget what was sent so far.
  void start(const std::vector<std::string>& names, PropertyDictionary additions = {},
             std::optional<PropertyDictionary> userInfo = std::nullopt, bool hasAggregationBlock = false);
  /// Sends and answers the reply's text.
  std::optional<std::string> send(PropertyDictionary message);
  std::string sendOnce(PropertyDictionary sessionInfo, std::optional<PropertyDictionary> userInfo,
                       std::optional<PropertyDictionary> payload, std::uint16_t category = 3, std::uint16_t type = 4);
  FlushReply recordInto(FlushAnswer& answer);
  /// The newest backend of that name.
  [[nodiscard]] FakeBackend& backend(const std::string& name);

  FakePlatform fakes;
  FakeHttpSessionService http;
  RecordingLog recordedLog;
  Journal journal;
  FakeMessageLog messageLog;
  Platform platform;
  DeviceEnvironment environment;
  std::vector<std::shared_ptr<FakeBackend>> made;
  /// What a new backend is told before the session sees it.
  std::function<void(FakeBackend&)> prepareBackend;
  SessionServices services;
  FakeDelegate delegate;
  std::shared_ptr<FakeConnection> connection = std::make_shared<FakeConnection>();
  std::shared_ptr<ReportingdSession> session;
};

/// A message dictionary.
PropertyDictionary message(PropertyValue category, PropertyValue type,
                           std::optional<PropertyDictionary> payload = std::nullopt);
PropertyDictionary userNamed(std::string_view client, std::string_view service);
PropertyArray numbers(std::initializer_list<int> values);

}  // namespace velk::test
