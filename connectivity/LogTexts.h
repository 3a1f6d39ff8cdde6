// The fixed log and error texts of the transport, for the code and its tests.
#pragma once

namespace velk::connectivity_texts {

inline constexpr const char* kTaskCreated = "ConnectivityHelperTask with ID <%@> created";
inline constexpr const char* kTaskDealloced = "ConnectivityHelperTask with ID <%@> dealloced";

inline constexpr const char* kCreated = "ReportingSessionConnectivityHelper created with delegate %d";
inline constexpr const char* kDealloced = "ReportingSessionConnectivityHelper dealloced with ID <%@>";
inline constexpr const char* kActivating = "activate: activating connectivity helper for NetSession with ID <%@>";
inline constexpr const char* kInactiveIdentifier = "inactive";
inline constexpr const char* kAlreadyActive =
    "activate: connectivity helper is already active for NetSession with ID <%@>";
inline constexpr const char* kActivated = "NetSession created and activated with ID <%@>, delegate %d";
inline constexpr const char* kInvalidate = "ReportingSessionConnectivityHelper:invalidate: NetSession with ID <%@>";
inline constexpr const char* kInvalidateInactive =
    "ReportingSessionConnectivityHelper:invalidate: release %d IPC transactions for inactive connectivity helper";

inline constexpr const char* kServedCountIncremented =
    "Total Sessions Served Count is incremented for NetSession with ID <%@>";
inline constexpr const char* kUsageIncremented =
    "ownerIncrementUsageCount: connectivity helper incremented usage count for NetSession with ID <%@>. "
    "_usageCount=%d, _totalSessionsServedCount=%d";
inline constexpr const char* kUsageDecremented =
    "ownerDecrementUsageCountWithBlock: connectivity helper decremented usage count for NetSession with ID <%@>. "
    "_usageCount=%d, _totalSessionsServedCount=%d";
inline constexpr const char* kUsageAboveZero =
    "ownerDecrementUsageCountWithBlock: Usage count for NetSession with ID <%@> is greater than 0. Notifying owner "
    "that _usageCount=%d, _totalSessionsServedCount=%d";
inline constexpr const char* kUsageZero =
    "ownerDecrementUsageCountWithBlock: Usage count for NetSession with ID <%@> is equal to 0. Starting connectivity "
    "helper release timer";

inline constexpr const char* kEverLasting =
    "startConnectivityHelperReleaseTimerWithBlock: Special case of dealing with ever-lasting connectivity helper %@";
inline constexpr const char* kEverLastingRelease =
    "startConnectivityHelperReleaseTimerWithBlock: release %d IPC transactions for ever-lasting connectivity helper %@";
inline constexpr const char* kTimerStarted =
    "startConnectivityHelperReleaseTimerWithBlock: started connectivity helper release timer for NetSession with ID "
    "<%@>";
inline constexpr const char* kTimerFired =
    "startConnectivityHelperReleaseTimerWithBlock: Connectivity helper release timer fired for NetSession with ID "
    "<%@>, timeout %ds";
inline constexpr const char* kTimerCallsOwner =
    "startConnectivityHelperReleaseTimerWithBlock: Calling back owner of Connectivity helper with _usageCount=%d";
inline constexpr const char* kTimerStopping =
    "stopConnectivityHelperReleaseTimer: stopping connectivity helper release timer for NetSession with ID <%@>";

// Errors.
inline constexpr const char* kPostSessionInvalidated =
    "postURLRequestWithCompletionHandler: underlying NetSession has been invalidated with error %@. Ignoring POST "
    "request.";
inline constexpr const char* kPostWrongMode =
    "postURLRequestWithCompletionHandler: wrong mode for POST operation detected %d";
inline constexpr const char* kGetWrongMode =
    "getURLRequestWithCompletionHandler: wrong mode for GET operation detected %d";

inline constexpr const char* kGetDuplicate =
    "getURLRequestWithCompletionHandler: ignored duplicate request for storebag '%@'";
inline constexpr const char* kGetUrgent =
    "getURLRequestWithCompletionHandler: storebag immediate pull for '%@' has been initiated";
inline constexpr const char* kGetDelayed =
    "getURLRequestWithCompletionHandler: storebag delayed pull for '%@' delayed by %d seconds has been initiated. Time "
    "now %llu, scheduled time to pull %llu";
inline constexpr const char* kGetCancelledInactive =
    "getURLRequestWithCompletionHandler: new storebag pull for '%@' has been cancelled as NetSession is not active";
inline constexpr const char* kGetSessionInvalidated =
    "getURLRequestWithCompletionHandler: underlying NetSession has been invalidated with error %@. Ignoring GET "
    "request.";
inline constexpr const char* kGetCancelledNoTask =
    "getURLRequestWithCompletionHandler: new storebag pull for '%@' has been cancelled as NetSession data task "
    "creation "
    "has failed";
inline constexpr const char* kGetCompleted =
    "getURLRequestWithCompletionHandler: new storebag pull for '%@' has been completed with error %@";

// Texts of errors that requesters get.
inline constexpr const char* kGetUnrecognizedModeError = "getURLRequestWithCompletionHandler: unrecognized mode";
inline constexpr const char* kNotActiveError = "ConnectivityHelper is not ative";
inline constexpr const char* kNoDataTaskError = "getURLRequestWithCompletionHandler: unable to create data task";

inline constexpr const char* kHelperTaskCreated = "createHelperForTask: created helperTask for task <%@>";
inline constexpr const char* kDidReceiveResponse = "didReceiveResponse: for <session>:<task> <%@>:<%@>";
inline constexpr const char* kDidReceiveData = "didReceiveData: received %d bytes for <session>:<task> <%@>:<%@>";
inline constexpr const char* kDidComplete =
    "didCompleteWithError: for <session>:<task> <%@>:<%@> with response %@, error %@";
inline constexpr const char* kDidSendBodyData =
    "didSendBodyData: for <session>:<task> <%@>:<%@>: Sent %lld out of %lld";
/// An error.
inline constexpr const char* kDidBecomeDownloadTask =
    "didBecomeDownloadTask: session <%@> has become downoad task. SHOULD NEVER HAPPEN!!!";
inline constexpr const char* kDidBecomeInvalidRelease =
    "didBecomeInvalidWithError: release %d IPC transactions for session %@";
inline constexpr const char* kDidBecomeInvalid = "didBecomeInvalidWithError: session <%@> invalidated with error %@";

}  // namespace velk::connectivity_texts
