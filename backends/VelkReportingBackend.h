// The abstract base of every destination to which a session delivers events. It holds what every backend stamps on
// what it sends, the sampling draw, the event lists and the state; by default every operation does nothing.
//
// Made by `newBackendWithName` for a section of the session's storebag; the session sets its properties before the
// first event and calls it from its connection's queue. What other sessions may call from their threads says so.
// Lives as long as the session's backends: work in flight holds nothing but the backend's state.
//
//   newBackendWithName -> properties -> updateState -> events ... -> flush -> cleanup
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "backends/BackendStateHandle.h"
#include "backends/BatchMemory.h"
#include "backends/ClientIdentifiers.h"
#include "backends/DottedVersion.h"
#include "backends/ProcessUploads.h"
#include "connectivity/ConnectivityInterface.h"
#include "foundation/Completion.h"
#include "foundation/Error.h"
#include "foundation/PropertyValue.h"
#include "foundation/TimeValue.h"
#include "platform/FileDescriptor.h"
#include "platform/Lock.h"
#include "platform/Platform.h"

namespace velk {

class DeviceEnvironment;

/// Enable state of a backend. Numbers other than these do not occur.
enum BackendState : std::int32_t {
  kBackendNotConfigured = 0,
  kBackendDisabled = 1,
  kBackendEnabled = 2,
  kBackendWaiting = 3,
};

/// Result text and error, either may be absent.
using BackendFlushCompletion = Completion<std::optional<std::string>, std::optional<Error>>;

/// What backends need of the process around them. Outlives every backend.
struct BackendContext {
  Platform& platform;
  const DeviceEnvironment& environment;
  /// On a disk with room for what is too large for memory. What is kept there has no name.
  std::string largeFilesDirectory = "/var/tmp";
  std::shared_ptr<ProcessUploads> uploads = std::make_shared<ProcessUploads>();
  std::shared_ptr<BatchMemory> batchMemory = std::make_shared<BatchMemory>();
  std::shared_ptr<ClientIdentifiers> identifiers = std::make_shared<ClientIdentifiers>();
};

/// A file that a client hands over for upload.
struct FileUpload {
  std::string path;            ///< what the client calls it; it is never opened
  std::string extensionToken;  ///< what the client calls the descriptor
  FileDescriptor file;         ///< opened by the client; none when it gave none
  /// Set when a server has said that it has the file, which its owner may then remove.
  bool isDelivered = false;
  ProcessUploads::User user = 0;  ///< whose upload it is
};

/// In whose name the backends of one session post. Made by the session; used on its queue alone.
struct PostSender {
  /// Unique in the process.
  std::uint64_t number = 0;
  /// A post has been handed to the transport since the session last asked it for room.
  bool hasPosted = false;
};

class VelkReportingBackend : public std::enable_shared_from_this<VelkReportingBackend> {
 public:
  VelkReportingBackend(const BackendContext& context, std::string name, PropertyValue profile,
                       std::optional<std::string> productFamily);
  virtual ~VelkReportingBackend();
  VelkReportingBackend(const VelkReportingBackend&) = delete;
  VelkReportingBackend& operator=(const VelkReportingBackend&) = delete;

  /// Lower-case hexadecimal SHA-256 of the text's first bytes, as many as the text has UTF-16 units.
  [[nodiscard]] static std::string convertIntoSHA256(std::string_view text);

  /// Ends timers and sockets, if any. Called once, when the session ends.
  virtual void cleanup() {}

  // Any thread. The state is read and written on the state queue: reads wait for it, writes are queued.
  [[nodiscard]] std::int32_t state() const { return _state.read(); }
  /// A backend that becomes enabled activates its transport: what it posts must not end there.
  void setState(std::int32_t state);
  /// Reads the configuration again and answers the new state.
  virtual std::int32_t updateState();

  /// Numbers the event (the first is 1; 16 bits, wrapping) and sends it. Answers the text for the message log.
  /// An absent message (a payload that was never given) still makes an event.
  std::optional<std::string> sendMessage(const std::optional<PropertyDictionary>& message, const TimeValue& timestamp,
                                         std::uint16_t method, std::uint16_t respCode, std::uint32_t flag);
  virtual std::optional<std::string> sendMessageWithEventID(const std::optional<PropertyDictionary>& message,
                                                            const TimeValue& timestamp, std::uint16_t method,
                                                            std::uint16_t respCode, std::uint16_t eventID,
                                                            std::uint32_t flag);
  /// Posts what is batched. Answers the text for the message log. The completion runs on the calling thread before
  /// this returns, or on the transport's queue; it is dropped uncalled when the transport drops the post.
  virtual std::optional<std::string> flushMessagesWithCompletion(BackendFlushCompletion completion);
  // Uploads: on the session's upload queue, beside its other calls. They may block until a server has answered.
  /// True when the file was taken in hand.
  [[nodiscard]] virtual bool uploadFileAtPath(FileUpload& upload);
  [[nodiscard]] virtual bool uploadLogData(const PropertyArray& logData);
  /// Any thread.
  virtual void setCorrelatedSessionID(const std::string& combinedSessionID);
  /// True without a whitelist; an empty one lets nothing pass.
  [[nodiscard]] bool isWhitelistedEvent(std::int32_t event) const;
  [[nodiscard]] bool isBlacklistedEvent(std::uint32_t event) const;
  /// Estimated bytes of the events that wait. Any thread; waits for the state queue.
  [[nodiscard]] virtual std::uint64_t batchedEventsSize() const;
  /// How many those are. Any thread; waits for the state queue.
  [[nodiscard]] virtual std::uint64_t batchedEventsCount() const;

  /// The transport of an enabled backend is activated.
  void setReportingSessionConnectivityDelegate(const std::shared_ptr<ReportingSessionConnectivityInterface>& transport);
  void setSender(std::shared_ptr<PostSender> sender);
  /// "major.middle.minor", each cut to 8 bits; what is missing is 0.
  void setSelfVersion(std::string_view version);
  void setStartTimestamp(const TimeValue& timestamp);
  void setSessionID(std::uint32_t sessionID);
  void setCompType(std::int32_t compType);
  void setClientVersion(std::uint16_t clientVersion);
  void setUdid(std::string udid);
  void setProductVersion(std::optional<std::string> productVersion);
  void setBuildVersion(std::optional<std::string> buildVersion);
  void setHardwareType(std::optional<std::string> hardwareType);
  void setIsInternal(bool isInternal);
  void setRequireUserInfo(bool requireUserInfo);
  void setBatchEvents(bool batchEvents);
  void setAllowNestedData(bool allowNestedData);
  void setUserInfoDict(std::optional<PropertyDictionary> userInfo);
  void setDigestKey(std::optional<ByteData> key, std::int32_t algorithm);
  /// The sampling threshold of a parent session's backend of the same name. Any thread.
  void setSamplingThreshold(std::optional<double> threshold);

  [[nodiscard]] const std::string& name() const { return _name; }
  [[nodiscard]] std::optional<std::string> displayURL() const { return _displayURL; }
  /// Any thread.
  [[nodiscard]] std::optional<double> samplingThreshold() const;
  /// One of 0.0000 to 0.9999, drawn once.
  [[nodiscard]] double samplingFactor() const { return _samplingFactor; }
  [[nodiscard]] std::optional<PropertyArray> eventWhitelist() const { return _eventWhitelist; }
  [[nodiscard]] std::optional<PropertyArray> eventBlacklist() const { return _eventBlacklist; }
  /// True for the class that posts JSON over HTTPS: the lists of a session's reply look at these alone.
  [[nodiscard]] virtual bool isHTTPSPostBackend() const { return false; }

 protected:
  /// Any thread.
  [[nodiscard]] std::optional<std::string> combinedSessionIDString() const;
  /// The session's transport as it is now; null when there is none or it has gone. Any thread: uploads run beside the
  /// session's queue, which replaces the transport when the user changes.
  [[nodiscard]] std::shared_ptr<ReportingSessionConnectivityInterface> transport() const;

  // Constant after construction.
  const BackendContext _context;
  const std::string _name;
  const PropertyValue _profile;
  const std::optional<std::string> _productFamily;
  const double _samplingFactor;
  std::optional<std::string> _displayURL;  ///< set by the constructors of derived classes alone

  // Self-synchronised.
  const BackendStateHandle _state;
  std::atomic<std::uint32_t> _totalBytesSent{0};            ///< since the last stop message
  std::atomic<std::uint32_t> _bytesSentSinceLastReport{0};  ///< since the last periodic report
  std::atomic<std::uint16_t> _eventID{0};                   ///< the last event's number

  // Used on the owning session's queue only.
  std::shared_ptr<PostSender> _sender = std::make_shared<PostSender>();
  DottedVersion _selfVersion;
  std::string _reportVersion = _selfVersion.reportVersion();
  double _startTimestamp = 0;  ///< seconds since 1970
  std::uint32_t _sessionID = 0;
  std::int32_t _compType = 0;
  std::uint16_t _clientVersion = 0;
  std::string _udid;
  std::optional<std::string> _productVersion;
  std::optional<std::string> _buildVersion;
  std::optional<std::string> _hardwareType;
  std::optional<PropertyDictionary> _userInfoDict;
  std::optional<ByteData> _digestKey;
  std::int32_t _digestAlgorithm = 0;
  std::optional<PropertyArray> _eventWhitelist;
  std::optional<PropertyArray> _eventBlacklist;
  bool _isInternal = false;
  bool _requireUserInfo = false;
  bool _batchEvents = false;
  bool _allowNestedData = false;

 private:
  // Guarded by _lock: other sessions write these when sessions join a hierarchy, and uploads read the transport.
  mutable Lock _lock;
  std::weak_ptr<ReportingSessionConnectivityInterface> _transport VELK_GUARDED_BY(_lock);
  std::optional<std::string> _combinedSessionIDString VELK_GUARDED_BY(_lock);
  std::optional<double> _samplingThreshold VELK_GUARDED_BY(_lock);
};

/// The backend of a storebag section, or null (and an error line) for a name that is none.
[[nodiscard]] std::shared_ptr<VelkReportingBackend> newBackendWithName(const BackendContext& context,
                                                                       const std::string& name,
                                                                       const PropertyValue& profile,
                                                                       const std::optional<std::string>& productFamily,
                                                                       std::int32_t clientType);

}  // namespace velk
