// The fixed texts of this folder's log lines. Code and tests use these constants; the marks inside them (a
// typographic quote, a missing one) are what people search their logs for and stay as they are.
#pragma once

#include <string_view>

namespace velk::daemontexts {

// Start-up.
inline constexpr std::string_view kStartLogging = "startLogging: Daemon starts logging...";
inline constexpr std::string_view kListenerResumes = "main: Listener resumes with sandbox, start loop.";

// Connections.
inline constexpr std::string_view kConnectionRefused =
    "listener: new IPC connection %s does not have required velkreporting entitlement. Closing connection...";
inline constexpr std::string_view kConnectionAccepted =
    "listener: Accepting new IPC connection %s as it has proper entitlement, %d(%d) connections.";
inline constexpr std::string_view kConnectionInterrupted = "listener: IPC connection to %s was interrupted";
inline constexpr std::string_view kConnectionInvalidated = "listener: IPC connection to %s was invalidated";

// Keep-alive.
inline constexpr std::string_view kTransactionStarted =
    "createReportingSessionWithDelegate: IPC transaction started with session %@";
inline constexpr std::string_view kTransactionRetained =
    "createReportingSessionWithDelegate: retained IPC Transaction. Ref count is %d";
inline constexpr std::string_view kTransactionReleased =
    "releaseIPCTransactions: IPC transaction ref count is %d, decremented by %d";
inline constexpr std::string_view kTransactionEnded = "releaseIPCTransactions: IPC transaction ended";

// Registry and the active-client limit.
inline constexpr std::string_view kSessionInvalidated =
    "invalidateReportingSession: ReportingdSession %@ was invalidated";
inline constexpr std::string_view kActiveCountDecremented =
    "invalidateReportingSession: active session count for clientType %d got decremented to %d";
inline constexpr std::string_view kMissingClientType =
    "isActiveClientLimitReachedForSession: session %u missing clientType in its sessionInfo %@. Session terminated...";
inline constexpr std::string_view kActiveLimitExceeded =
    "isActiveClientLimitReachedForSession: session %u exceeds number of allowed active connections for clientType %@. "
    "Session terminated...";
inline constexpr std::string_view kActiveCountIncremented =
    "isActiveClientLimitReachedForSession: active session count for clientType %d got incremented to %d";

// Hierarchies.
inline constexpr std::string_view kStandaloneSession =
    "updateCorrelatedSessions: Session %u has no correlated sessions as it is a standalone session";
inline constexpr std::string_view kAddingCorrelatedSession =
    "updateCorrelatedSessions: Adding session %u to list for hierarchyToken %s with hierarchyLevel %d";
inline constexpr std::string_view kCheckingChain =
    "parentSessionIDStringForSession: Checking hierarchyToken '%s' for session %u";
inline constexpr std::string_view kNoSessionsForChain =
    "parentSessionIDStringForSession: ERROR: No sessions found for hierarchyToken %s";
inline constexpr std::string_view kNotFoundForChain =
    "parentSessionIDStringForSession: Session %u not found for hierarchyToken %s";
inline constexpr std::string_view kGapInChain =
    "parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): incomplete parentSessionID "
    "is '%s'";
inline constexpr std::string_view kCheckingParent =
    "parentSessionForChild: Checking hierarchyToken '%s' for session %u";
inline constexpr std::string_view kNoSessionsForParent =
    "parentSessionForChild: ERROR: No sessions found for hierarchyToken %s";
inline constexpr std::string_view kNotFoundForParent =
    "parentSessionForChild: ERROR: Session %u not found for hierarchyToken %s";
inline constexpr std::string_view kNoParentAtLevel =
    "parentSessionForChild: Unable to find session with hierarchy of %d for hierarchyToken '%s'";
inline constexpr std::string_view kUpdatingDownstream =
    "updateDownstreamSessions: Updating combined session ID and syncing reporting states for session %u";

// Shared connectivity helpers.
inline constexpr std::string_view kRequestingHelper =
    "requestSharedConnectivityHelperForReportingSession: Requesting shared connectivity helper for userInfoKey %@";
inline constexpr std::string_view kFoundHelper =
    "requestSharedConnectivityHelperForReportingSession: Found existing shared connectivity helper for userInfoKey %@";
inline constexpr std::string_view kCreatingHelper =
    "requestSharedConnectivityHelperForReportingSession: Creating shared connectivity helper for userInfoKey %@";
inline constexpr std::string_view kIncrementingHelper =
    "requestSharedConnectivityHelperForReportingSession: Incrementing usage of shared connectivity helper for "
    "userInfoKey %@";
inline constexpr std::string_view kReleasingHelper =
    "releaseSharedConnectivityHelperForReportingSession: Releasing shared connectivity helper for userInfoKey %@";
inline constexpr std::string_view kDecrementingHelper =
    "releaseSharedConnectivityHelperForReportingSession: Decrementing usage count of shared connectivity helper for "
    "userInfoKey %@";
inline constexpr std::string_view kHelperReachedZero =
    "releaseSharedConnectivityHelperForReportingSession: Usage count of shared connectivity helper for userInfoKey %@ "
    "reached zero. Invalidating the helper";

// Storebags: memory cache.
inline constexpr std::string_view kRetrievingStorebag =
    "storebagForSession: Retrieving storebag for session %u with client type %d";
inline constexpr std::string_view kDiskCacheOverrides =
    "storebagForSession: Override maxAge as disk cache for storebag '%@' was updated: modification time '%@' is "
    "greater than last fetch time '%@";
inline constexpr std::string_view kCachedStorebagFound = "storebagForSession: Cached storebag found for client type %d";
inline constexpr std::string_view kStorebagMustWait =
    "storebagForSession: Not fetching storebag for client type %d - must wait %d seconds between attempts";
inline constexpr std::string_view kFetchingStorebag = "fetchAndCacheStorebag: Fetching storebag for client type %d";
inline constexpr std::string_view kClientTypeInvalid = "fetchAndCacheStorebag: clientType %d is invalid";
inline constexpr std::string_view kStorebagMaxAge = "fetchAndCacheStorebag: Storebag max age: %d seconds";
inline constexpr std::string_view kUnableToFetch = "fetchAndCacheStorebag: Unable to fetch storebag for client type %d";

// Storebags: section selection.
inline constexpr std::string_view kNoStorebagName =
    "fetchStorebagForEnvironmentAndClientType: Could not find storebag name for client type %d";
inline constexpr std::string_view kCouldNotFetch =
    "fetchStorebagForEnvironmentAndClientType: Could not fetch storebag for client type %d";
inline constexpr std::string_view kSeedMissing =
    "fetchStorebagForEnvironmentAndClientType: Seed section is missing in the storebag.";
inline constexpr std::string_view kNoSection =
    "fetchStorebagForEnvironmentAndClientType: Could not find storebag for client type %d with %s environment";
inline constexpr std::string_view kMaxAgeOverride =
    "fetchStorebagForEnvironmentAndClientType: Store bag override MaxAge=%d";

// Storebags: fetch, verification.
inline constexpr std::string_view kLoadedFromDisk =
    "fetchStorebagWithName: storebag '%@' loaded from disk cache. Disk cache %@ refreshed";
inline constexpr std::string_view kDiskExpired = "expired and will be";
inline constexpr std::string_view kDiskValid = "is valid and will not be";
inline constexpr std::string_view kEnvelopeParseError = "fetchStorebagWithName: propertyListWithData error %s";
inline constexpr std::string_view kSignatureMissing = "fetchStorebagWithName: Signature is missing";
inline constexpr std::string_view kSignatureInvalid = "fetchStorebagWithName: Signature can not be verified, %p";
inline constexpr std::string_view kStorebagSaved = "fetchStorebagWithName: storebag '%@' has been saved to disk cache";
inline constexpr std::string_view kServerUrl = "fetchNetworkStorebag: Storebag Server URL: %s";
inline constexpr std::string_view kAddingLastModified =
    "fetchNetworkStorebag: Adding 'Last-Modified: %@' to the header";
inline constexpr std::string_view kZeroLength =
    "fetchNetworkStorebag: received zero-length storebag for '%@‘, treat as unchanged";
inline constexpr std::string_view kNotChanged =
    "fetchNetworkStorebag: storebag '%@' does not need update as its content has not changed on the server";
inline constexpr std::string_view kErrorResolving =
    "fetchNetworkStorebag: Error resolving with lookup server %s, sendSynchronousRequest error %s";
inline constexpr std::string_view kLoadingDefault = "fetchNetworkStorebag: Loading default storebag '%s'";

// Storebags: metrics.
inline constexpr std::string_view kMaxAgeRead = "getLastLoadedStorebagMetricsWithName: maxAge is %d for storebag %@";
inline constexpr std::string_view kLastModifiedSame =
    "getLastLoadedStorebagMetricsWithName: 'Last-Modified' has not changed for storebag '%@': '%@'";
inline constexpr std::string_view kLastModifiedChanged =
    "getLastLoadedStorebagMetricsWithName: 'Last-Modified' has changed to '%@' for storebag '%@'";
inline constexpr std::string_view kMetricsSaved =
    "saveLastLoadedStorebagMetricsWithName: New storebag '%@' received: maxAge %d, Last-Modified '%@'";

// Storebags: disk cache.
inline constexpr std::string_view kCouldNotSave =
    "saveStorebagToDisk: could not save storebag '%@' to file '%@'. Error is '%@'";
inline constexpr std::string_view kCouldNotSetAttribute =
    "setStorageClassProtectionLevel: could not set attribute %@ to file '%@'. Error is '%@'";
inline constexpr std::string_view kCouldNotLoad =
    "loadStorebagFromDisk: could not load storebag '%@' from file '%@'. Error is '%@'";

}  // namespace velk::daemontexts
