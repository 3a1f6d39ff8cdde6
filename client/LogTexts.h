// The fixed lines of the library, used by its code and its tests.
#pragma once

#include <string_view>

namespace velk::texts {

// Creation
inline constexpr std::string_view kSessionInfoIsNil = "validateSessionInfo: sessionInfo is nil";
inline constexpr std::string_view kClientTypeIsInvalid = "validateSessionInfo: clientType is invalid";
inline constexpr std::string_view kClientStartsLogging = "startLogging: Client starts logging...";
inline constexpr std::string_view kSessionDisabled = "initWithSessionInfo: the session is disabled";
inline constexpr std::string_view kNotEntitled = "initWithSessionInfo: IPC not entitled, %d";
inline constexpr std::string_view kFailedToConnect = "initWithSessionInfo: Failed to connect to daemon";
inline constexpr std::string_view kFailedToCreateQueue = "initWithSessionInfo: Failed to create reporting queue";
inline constexpr std::string_view kNoThread =
    "%s: the library gets no thread: %s; raise the limits of this process on threads and descriptors, and try again";
inline constexpr std::string_view kConnectionInvalidated = "initWithSessionInfo: IPC connection invalidated";
inline constexpr std::string_view kConnectionInterrupted = "initWithSessionInfo: IPC connection interrupted";

// Proxy failures, one an operation. setDigestKey shares the text of uploadDataArray.
inline constexpr std::string_view kInitProxyFailure = "initWithSessionInfo: Failed to get remote object proxy: %s";
inline constexpr std::string_view kStartConfigurationProxyFailure =
    "startConfigurationWithCompletionHandler: Failed to get remote object proxy: %s";
inline constexpr std::string_view kFetchStatesProxyFailure =
    "fetchReportingStatesWithUserInfo: Failed to get remote object proxy: %s";
inline constexpr std::string_view kSendMessageProxyFailure =
    "sendMessageWithDictionary: Failed to get remote object proxy: %s";
inline constexpr std::string_view kFlushProxyFailure =
    "flushMessagesWithCompletion: Failed to get remote object proxy: %s";
inline constexpr std::string_view kFinishSessionProxyFailure = "finishSession: Failed to get remote object proxy: %s";
inline constexpr std::string_view kUpdateSharedDataWithDictionaryProxyFailure =
    "updateSharedDataWithDictionary: Failed to get remote object proxy: %s";
inline constexpr std::string_view kUpdateSharedDataForKeyProxyFailure =
    "updateSharedDataForKey: Failed to get remote object proxy: %s";
inline constexpr std::string_view kUploadFileProxyFailure = "uploadFileWithURL: Failed to get remote object proxy: %s";
inline constexpr std::string_view kUploadDataArrayProxyFailure =
    "uploadDataArray: Failed to get remote object proxy: %s";

// Configuration and sending
inline constexpr std::string_view kCachedLists = "Cached %d enabled backends, (%@, %@) listed events";
inline constexpr std::string_view kUrlForTheSession = "URL for the session is: %@";
inline constexpr std::string_view kUrlNotAvailable = "URL not available";
inline constexpr std::string_view kMissingCategory = "Missing mandatory parameter 'category'";
inline constexpr std::string_view kMissingType = "Missing mandatory parameter 'type'";
inline constexpr std::string_view kSentMessage = "sendMessageWithDictionary: %s";
inline constexpr std::string_view kEventIsNotSendable = "sendMessageWithDictionary: Event %u cannot be sent: %s";
inline constexpr std::string_view kEventIsFiltered = "Event %u is filtered by storebag";
inline constexpr std::string_view kDelegateIsSet = "Message Sent Delegate is set to %x:";
inline constexpr std::string_view kDelegateReads = "Message Sent Delegate reads %x:";
inline constexpr std::string_view kLoggingBlockSet = "setMessageLoggingBlock: called";
inline constexpr std::string_view kNotifyCalled = "notifyMessageWasSent: called";
inline constexpr std::string_view kDelegateIsSlow =
    "notifyMessageWasSent: the delegate is slower than messages come: until it has caught up, some are dropped";
inline constexpr std::string_view kDelegateWasSlow =
    "notifyMessageWasSent: %u messages were dropped: the delegate is slower than they come";
inline constexpr std::string_view kLoggingBlockIsSlow =
    "setMessageLoggingBlock: the block is slower than texts come: until it has caught up, some are dropped";
inline constexpr std::string_view kLoggingBlockWasSlow =
    "setMessageLoggingBlock: %u texts were dropped: the block is slower than they come";
inline constexpr std::string_view kFlushMessages = "flushMessages:";
inline constexpr std::string_view kFlushedSuccessfully =
    "flushMessagesWithCompletion: flushed session successfully with reply %s";
inline constexpr std::string_view kFlushFailed = "flushMessagesWithCompletion: flush failed with error '%s'";
inline constexpr std::string_view kDigestKeyIsNil = "setDigestKey: digestKey should not be nil!!!";

// Uploads
inline constexpr std::string_view kServerSupportsFileUpload = "serverSupportsFileUpload:%s (%lu backends)";
inline constexpr std::string_view kFileUrlIsNil = "uploadFileWithURL: fileURL provided is nil";
inline constexpr std::string_view kNoExtension =
    "uploadFileWithURL: Failed to get sandbox extension for path %s, errno %d";
inline constexpr std::string_view kUploadedFileStays = "uploadFileWithURL: An uploaded file stays: %s";
inline constexpr std::string_view kLogDataIsNoDictionary =
    "uploadDataArray: What is no dictionary stands in the log data array";
inline constexpr std::string_view kLogDataArrayIsEmpty = "uploadDataArray: Log data array is empty";

// What goes wrong in the library itself
inline constexpr std::string_view kNothingWasDone =
    "%s: nothing was done: %s; raise the limits of this process on memory and threads, and try again";

// Aggregation and the end
inline constexpr std::string_view kSendMessageToClient = "sendMessageToClient: %u, %u";
inline constexpr std::string_view kAggregationBlockThrew =
    "sendMessageToClient: Exception during invocation of aggregation block. Disabling aggregation";
inline constexpr std::string_view kAggregationBlockIsSlow =
    "sendMessageToClient: the aggregation block is slower than events come: until it has caught up, some are dropped";
inline constexpr std::string_view kAggregationBlockWasSlow =
    "sendMessageToClient: %u events were dropped: the aggregation block is slower than they come";
inline constexpr std::string_view kAboutToDealloc =
    "aboutToDealloc: VelkReporting client session %p is about to dealloc";
inline constexpr std::string_view kEventsAreLost = "aboutToDealloc: %u events are lost: no daemon takes them";

// Periodic tasks
inline constexpr std::string_view kRegisteredModule = "registerPeriodicTaskForModule: %u,%s update,%s reporting";
inline constexpr std::string_view kTooManyModules =
    "registerPeriodicTaskForModule: %u is refused: %u modules are there";
inline constexpr std::string_view kModuleRemoved = "unregisterPeriodTaskForModule: %u removed";
inline constexpr std::string_view kModuleDoesNotExist = "unregisterPeriodTaskForModule: %u doesn't exist";
inline constexpr std::string_view kTimerStarted = "startLogTimerWithInterval: %d, %d";
inline constexpr std::string_view kIntervalIsZero = "startLogTimerWithInterval: the interval is 0: no timer is started";
inline constexpr std::string_view kTimerStopped = "stopLogTimer.";
inline constexpr std::string_view kNoTimer = "stopLogTimer: No timer is present.";
inline constexpr std::string_view kTickStarted = "_myPeriodicTask: Started RT periodic task";
inline constexpr std::string_view kUpdateSchedulingTimeout =
    "_myPeriodicTask: Timeout scheduling RT metrics update tasks";
inline constexpr std::string_view kUpdateTimeout = "_myPeriodicTask: Timeout during RT metrics update";
inline constexpr std::string_view kUpdatesFinished = "_myPeriodicTask: Finished RT updates for all registered modules.";
inline constexpr std::string_view kReportSchedulingTimeout =
    "_myPeriodicTask: Timeout scheduling RT metrics report tasks";
inline constexpr std::string_view kReportTimeout =
    "_myPeriodicTask: Timeout during periodic tasks metrics collection. Not all stats will be reported";
inline constexpr std::string_view kMetricsCollected = "_myPeriodicTask: All RT metrics collected";
inline constexpr std::string_view kSentRealtimeEvent =
    "_myPeriodicTask: Sent realtime event after collection all RT metrics";
inline constexpr std::string_view kCollectionFinished = "_myPeriodicTask: Finished RT metrics collection";
inline constexpr std::string_view kServiceBlockThrew =
    "_myPeriodicTask: Exception during invocation of the callback of module %u";
inline constexpr std::string_view kTooManyCallsWait =
    "_myPeriodicTask: %u calls wait for a module's callback; later ones no longer do";

// One-shot messages
inline constexpr std::string_view kOneMessageFailedToConnect =
    "sendOneMessageWithSessionInfo: Failed to connect to daemon";
inline constexpr std::string_view kOneMessageNoProxy =
    "sendOneMessageWithSessionInfo: Failed to get remote object proxy";
inline constexpr std::string_view kOneMessageInvalidated = "sendOneMessageWithSessionInfo: IPC connection invalidated";
inline constexpr std::string_view kOneMessageInterrupted = "sendOneMessageWithSessionInfo: IPC connection interrupted";
inline constexpr std::string_view kOneMessageIsNotSendable =
    "sendOneMessageWithSessionInfo: Event %u cannot be sent: %s";
inline constexpr std::string_view kOneMessageReply = "sendOneMessageWithSessionInfo: %s";

}  // namespace velk::texts
