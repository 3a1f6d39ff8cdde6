// The fixed log texts of sessions, for the code and its tests. Those under "error" are error lines; all others stand
// at the default level.
#pragma once

#include <string_view>

namespace velk::session_texts {

// Life.
inline constexpr std::string_view kSessionInit =
    "initWithSessionDelegate: ReportingdSession initWithSessionDelegate:%s";
inline constexpr std::string_view kSessionInitialized = "initWithSessionDelegate: Initialized session with UUID %s";
inline constexpr std::string_view kFinishedGracefully =
    "finishSessionGracefully: Session %u has been finished gracefully";
inline constexpr std::string_view kSessionDealloc = "dealloc: ReportingdSession dealloc: %u";
inline constexpr std::string_view kReleaseTransactionWithoutHelper =
    "ReportingdSession dealloc: release IPC transaction for session without connectivity helper for session %u";
inline constexpr std::string_view kIncrementSessionsServed =
    "ReportingdSession dealloc: incrementing total sessions count for session %u";

// Configuration.
inline constexpr std::string_view kConfiguringSession = "setSessionInfo: Configuring session %u";
inline constexpr std::string_view kReceivedUserInfo = "receivedUserInfo: Received new user info for session %u";
inline constexpr std::string_view kStartingConfiguration =
    "startConfigWithCompletionHandler: Starting configuration for session %u";
inline constexpr std::string_view kFetchingStates = "fetchStatesWithUserInfo: Fetching states for session %u";
inline constexpr std::string_view kCreatingBackends = "createBackendsWithStorebag: Creating backends for session %u";
// error
inline constexpr std::string_view kUserInfoNotRequired =
    "setSessionInfo: Configure session: user info provided without requiring it";
inline constexpr std::string_view kConfiguredMoreThanOnce =
    "startConfigWithCompletionHandler: has been called more than once for session %u";
inline constexpr std::string_view kBackendsWithoutStorebag =
    "createBackends: Attempted to create backends with nil storebag";
inline constexpr std::string_view kBackendsWithoutSessionInfo =
    "createBackends: Attempted to create backends with nil session info";

// Relatives.
inline constexpr std::string_view kParentMissing =
    "syncReportingStates: child session %u (backend %s) with hierarchy %d is missing its parent";
inline constexpr std::string_view kStateFromParent =
    "HTTPSPostBackend(syncReportingStates): %s: state and sampling rate updated to %d, %.02f%%";
inline constexpr std::string_view kParentWithoutBackend =
    "HTTPSPostBackend(syncReportingStates): Parent session  does not have backend %@. Current state '%d' kept for "
    "child session";
inline constexpr std::string_view kUpdatingCombinedSessionID =
    "updateCombinedSessionID: Updating combined session ID '%s' for session %u backends";

// Messages.
inline constexpr std::string_view kSendingMessage = "sendMessageWithDictionary: Sending message for session %u";
inline constexpr std::string_view kNoBackendsForMessage =
    "sendMessageWithDictionary: No backends available to send message";
inline constexpr std::string_view kMissingCategory =
    "sendMessageWithDictionary: Missing mandatory parameter 'category'";
inline constexpr std::string_view kMissingType = "sendMessageWithDictionary: Missing mandatory parameter 'type'";
inline constexpr std::string_view kDroppingNotWhitelisted =
    "sendMessageWithDictionary: Dropping event with category %d as it is not whitelisted for backend %s";
inline constexpr std::string_view kDroppingBlacklisted =
    "sendMessageWithDictionary: Dropping event with category %d as it is blacklisted for backend %s";
inline constexpr std::string_view kSentInternalMessage =
    "internalSendMessage: Sent internal message (method:%d respCode:%d)";
inline constexpr std::string_view kMessageLogMessage = "[%@ -> sendMessageWithDictionary] %@";

// Aggregation.
inline constexpr std::string_view kProxyFailure = "sendMessageWithDictionary: Failed to get remote object proxy: %s";
inline constexpr std::string_view kDisableAggregation =
    "shutdownSessionAggregation: Disable aggregation module for session %u";

// One-shot messages.
inline constexpr std::string_view kSendingWithSessionInfo =
    "sendMessageWithSessionInfo: Sending message with session info for session %u";
inline constexpr std::string_view kSendingSingleMessage =
    "sendOneMessageWithSessionInfo: Sending single message with sessionID %ld";
inline constexpr std::string_view kSingleNotWhitelisted =
    "sendOneMessageWithSessionInfo: Dropping event with category %d as it is not whitelisted for backend %s";
inline constexpr std::string_view kSingleBlacklisted =
    "sendOneMessageWithSessionInfo: Dropping event with category %d as it is blacklisted for backend %s";
inline constexpr std::string_view kMessageLogSingleMessage = "[%@ -> sendOneMessageWithSessionInfo] %@";
// error
inline constexpr std::string_view kNoIdentifiers =
    "sendMessageWithSessionInfo: Could not retrieve identifiers from sessionInfo";
inline constexpr std::string_view kSingleWithNilParameters =
    "sendOneMessageWithSessionInfo: Attempted to send message with one or more nil parameters";
inline constexpr std::string_view kSingleWithoutUserInfo =
    "sendOneMessageWithSessionInfo: userInfo must be present and valid!!! Aborting method...";
inline constexpr std::string_view kNoBackendsForSingle =
    "sendOneMessageWithSessionInfo: No backends available to send single message";

// Flush.
inline constexpr std::string_view kFlushingMessages = "flushMessagesWithCompletion: Flushing messages for session %u";
inline constexpr std::string_view kInternalFlush = "internalFlushMessagesWithCompletion: %s";
inline constexpr std::string_view kMessageLogFlush = "[%@ -> flushMessages] %@";

// Uploads and the display URL.
inline constexpr std::string_view kFetchingDisplayURL = "fetchDisplayURL: Fetching display URL for session %u";
inline constexpr std::string_view kUploadingFile = "uploadFileAtPath: Uploading file for session %u";
inline constexpr std::string_view kUploadSuccessful = "uploadFileWithURL: File upload successful for %s";
inline constexpr std::string_view kLogDataSuccessful = "uploadLogData: Log data array upload successful";
inline constexpr std::string_view kMessageLogUpload = "[uploadFileWithURL] Upload %@ for file %@";
// error
inline constexpr std::string_view kUploadFailed = "uploadFileWithURL: File upload failed for %s";
inline constexpr std::string_view kLogDataFailed = "uploadLogData: Log data array upload failed";
inline constexpr std::string_view kTooManyUploads =
    "uploadFileAtPath: session %u takes no more: %d uploads of its own, or its user's share of the %d places, are "
    "under way";

// What clients are told.
inline constexpr std::string_view kReplyNoDisplayURL = "URL not available";
inline constexpr std::string_view kReplyLimitExceeded =
    "Exceeded maximum active reporting session limit for userInfo='%@'";
inline constexpr std::string_view kReplyNoIdentifiers = "Could not retrieve identifiers from sessionInfo";
inline constexpr std::string_view kReplyNoStorebag = "storebag not available";
inline constexpr std::string_view kReplyFinished = "finished";
inline constexpr std::string_view kNoBackendsAvailable = "No backends available to send message";

}  // namespace velk::session_texts
