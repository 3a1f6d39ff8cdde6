// The fixed texts of this folder, with their placeholders: log lines, and the errors that completions receive.
// Code and tests share them; whoever watches the log relies on every letter, misprints included.
#pragma once

namespace velk::backend_texts {

// Factory.
inline constexpr const char* kUnknownBackend = "VelkReportingBackend(newBackendWithName): %s";

// Creation of the HTTPS post backend.
inline constexpr const char* kNoClientList = "HTTPSPostBackend(initWithName): can't find the client list.";
inline constexpr const char* kDefaultPostURL = "HTTPSPostBackend(initWithName): Using user default '%s' for postURL";
inline constexpr const char* kDefaultRealtimePostURL =
    "HTTPSPostBackend(initWithName): Using user default '%s' for realtimePostURL";

// Its configuration.
inline constexpr const char* kEventThreshold = "resetBackendStateWithClient: event_threshold set to %d";
inline constexpr const char* kExtrasOnInternal = "setBackendStateWithClient: extras on internal is set to %d";
inline constexpr const char* kStorebagPostURL = "HTTPSPostBackend(updatePostLink): Storebag '%s' for postURL";
inline constexpr const char* kStorebagRealtimePostURL =
    "HTTPSPostBackend(updatePostLink): Storebag '%s' for realtimePostURL";
inline constexpr const char* kRealtimePostURLDefaults =
    "HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL '%s'";
inline constexpr const char* kBatchEventOverride =
    "HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=%d";
inline constexpr const char* kDisabledByConsent =
    "HTTPSPostBackend(updateBackendState): reporting disabled by DNU: %d.";
inline constexpr const char* kNotInCountryList =
    "HTTPSPostBackend(updateBackendState): (%s) isn't in country code list %s";
inline constexpr const char* kNotInDeviceWhitelist =
    "HTTPSPostBackend(updateBackendState): (%s) isn't in device whitelist %s";
inline constexpr const char* kInDeviceBlacklist =
    "HTTPSPostBackend(updateBackendState): (%s) is in device blacklist %s";
inline constexpr const char* kFiltersRequired = "HTTPSPostBackend(updateBackendState): filters are required.";
inline constexpr const char* kWrongType =
    "HTTPSPostBackend(updateBackendState): %s: \"%s\" of a client entry must be %s, so the entry applies to nothing";
inline constexpr const char* kSamplingThresholdChanged =
    "HTTPSPostBackend(updateBackendState): sampling threshold for %s changed from %.02f to %.02f";
inline constexpr const char* kClientFound =
    "HTTPSPostBackend(updateBackendState): %s: client found %s:%s, state=%d, samplingFactor=%f";
inline constexpr const char* kEventWhitelist = "HTTPSPostBackend(updateBackendState): %s: eventWhitelist=%@";
inline constexpr const char* kEventBlacklist = "HTTPSPostBackend(updateBackendState): %s: eventBlacklist=%@";

inline constexpr const char* kPersistentIdentifierForCustomClientIDSuffix =
    "getPersistentIdentifierForCustomClientIDSuffix: The value for %s: %s";
inline constexpr const char* kIdentifierNameTooLong =
    "getPersistentIdentifierForCustomClientIDSuffix: a client or service name is longer than %d bytes, so identifiers "
    "of such names are not kept";
inline constexpr const char* kTooManyIdentifiers =
    "getPersistentIdentifierForCustomClientIDSuffix: %d identifiers are stored, further ones are not kept";

// Sending and batching.
inline constexpr const char* kNoMessage = "HTTPSPostBackend(sendMessage): SESSION_TYPE_STOP message dictionary is nil";
inline constexpr const char* kAddingStopFields =
    "HTTPSPostBackend(sendMessage): Adding dnu type and sampling threshold to SESSION_TYPE_STOP message dictionary";
inline constexpr const char* kRealtime = "HTTPSPostBackend(sendMessage): realtime is %d";
inline constexpr const char* kForcingFlush =
    "HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been batched. Forcing Flush here "
    "to keep events in order.";
inline constexpr const char* kSending = "HTTPSPostBackend(sendMessage): Sending %d, %d, %d";
inline constexpr const char* kBatching = "HTTPSPostBackend(sendMessage): Batching %d, %d, %d";
inline constexpr const char* kFlushedAndStandalone = "Flushed events:\n%@\nStandalone event:\n%@";
inline constexpr const char* kThresholdReached =
    "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for method %d";
inline constexpr const char* kBatchFull =
    "HTTPSPostBackend(batchEvent): batch of backend %s is full, dropping events until it is flushed";
inline constexpr const char* kUnableToSerialize =
    "HTTPSPostBackend(createMessageForPostAndLogging): Serializer unable to handle key: %s, value: %s";
inline constexpr const char* kNoBody =
    "HTTPSPostBackend(createMessageForPostAndLogging): %d events of backend %s have no JSON form and are lost";

// Posting.
inline constexpr const char* kPostURLMissing = "postURL is nil";
inline constexpr const char* kPostError = "HTTPSPostBackend(postJsonMessage): post error: %s";
inline constexpr const char* kDisabledByServer = "backend %s disabled by server %d return code";
inline constexpr const char* kPostJSONMessage = "postJSONMessage: %s";

// Flushing.
inline constexpr const char* kFlushCalled = "HTTPSPostBackend(flushMessagesWithCompletion): called";
inline constexpr const char* kFlushNotWhitelisted =
    "flushMessagesWithCompletion: Dropping event with category %d as it is not whitelisted for backend %s";
inline constexpr const char* kFlushBlacklisted =
    "flushMessagesWithCompletion: Dropping event with category %d as it is blacklisted for backend %s";
inline constexpr const char* kUserInfoRequired = "Can not flush: userInfo is required";
inline constexpr const char* kNothingToFlush = "Nothing to flush";
inline constexpr const char* kEverythingFiltered = "Nothing to flush: batched events were completely filtered out";

// Diagnostics adaptor.
inline constexpr const char* kLoadingQuillAdaptor =
    "QuillBackend(initWithName): Loading Quill adaptor class for client type %d";
inline constexpr const char* kNoQuillBundle = "QuillBackend(initWithName): No matching bundle found for client type %d";
inline constexpr const char* kQuillDoesNotRespond =
    "QuillBackend(sendMessage): Quill adaptor %s does not respond to forwarding selector %s";
inline constexpr const char* kQuillBundleUnusable = "QuillBackend(initWithName): no Quill adaptor: %s";
inline constexpr const char* kQuillEventLost = "QuillBackend(sendMessage): an event is lost: %s";

// Dashboard.
inline constexpr const char* kNoServerIP = "DashboardBackend(initWithName): can't resolve server IP";
inline constexpr const char* kNoServerPort = "DashboardBackend(initWithName): can't resolve server port";
inline constexpr const char* kSocketFailed = "DashboardBackend(initWithName): socket() failed (%d)";
inline constexpr const char* kAllNullParameters = "DashboardBackend(initWithName): initWitName with all null params.";
inline constexpr const char* kNoServerAddress =
    "DashboardBackend(initWithName): '%s' is no IPv4 address, so no datagrams are sent";
inline constexpr const char* kConnectFailed = "DashboardBackend(initWithName): socket connect() failed.";
inline constexpr const char* kNoTimerSource = "DashboardBackend(initWithName): can't create timer source.";
inline constexpr const char* kCannotBind = "DashboardBackend(useReliableUDP): can't bind socket, %d";
inline constexpr const char* kNoReadSource = "DashboardBackend(useReliableUDP): can't create read source";
inline constexpr const char* kNoMemory = "DashboardBackend(sendMessage): can't malloc.";
inline constexpr const char* kCleanUpAtTick = "DashboardBackend(myPeriodicTask): clean up at myPeriodicTask.";
inline constexpr const char* kLastResort = "DashboardBackend(myPeriodicTask): scheduled last resort clean-up in %d ms.";
inline constexpr const char* kNoLogDataURL = "DashboardBackend(uploadLogData): Post URL for log data array is nil";
inline constexpr const char* kLogDataNotSerialized =
    "DashboardBackend(uploadLogData): Failed to serialize log data array for upload";
inline constexpr const char* kLogDataUploaded = "DashboardBackend(uploadLogData): Log data uploaded to %s";
inline constexpr const char* kLogDataNotUploaded =
    "DashboardBackend(uploadLogData): Error uploading log data array (%s)";

// File uploads.
inline constexpr const char* kNoUploadPostURL = "UploadBackend(initWithName): can't resolve upload post URL.";
inline constexpr const char* kUploadingFile = "UploadBackend(uploadFileAtPath): Uploading file %s";
inline constexpr const char* kNotARegularFile = "UploadBackend(uploadFileAtPath): Only upload a regular file.";
inline constexpr const char* kInputFileIsEmpty = "UploadBackend(uploadFileAtPath): Input file is empty";
inline constexpr const char* kNoUploadRequest = "UploadBackend(uploadFileAtPath): Unable to create URL request";
inline constexpr const char* kUploadPostFailed = "UploadBackend(uploadFileAtPath): post %s";
inline constexpr const char* kUploadAnswered = "UploadBackend(uploadFileAtPath): sending to |%s|, Json output: %s";
inline constexpr const char* kUploadTooLarge =
    "UploadBackend(uploadFileAtPath): a file of %llu bytes is larger than the %llu that are taken";
inline constexpr const char* kUploadNotKept =
    "UploadBackend(uploadFileAtPath): there is no room for %s, compressed: %s";

// Macro expansion.
inline constexpr const char* kExpandingMacro = "expandMacroForDataSet: Expanding macro '%@' into '%@'";

// Compression.
inline constexpr const char* kCompressEmpty = "compressDataWithZlibOrGzip: Cannot compress empty ByteBuffer";
inline constexpr const char* kCompressSetupError =
    "compressDataWithZlibOrGzip: deflateInit2() Error: \"%s\" Message: \"%s\"";
inline constexpr const char* kCompressed = "compressDataWithZlibOrGzip: Compressed file from %u to %u";
inline constexpr const char* kCompressError =
    "compressDataWithZlibOrGzip: zlib error while attempting compression: \"%s\" Message: \"%s\"";

}  // namespace velk::backend_texts
