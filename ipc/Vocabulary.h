// The words that clients and the daemon share. The values travel over the wire, stand in storebags and in posted
// events, and never change. The public header of the library repeats them for its users.
#pragma once

#include <string_view>

namespace velk {

inline constexpr std::string_view kServiceName = "com.tavrin.velkreportingd";
inline constexpr std::string_view kServiceEntitlement = "com.tavrin.private.velkreportingd";
/// Needed to read the daemon's status over the same socket.
inline constexpr std::string_view kStatusEntitlement = "com.tavrin.private.velkreportingd.status";
inline constexpr std::string_view kFrameworkBundleIdentifier = "com.tavrin.VelkReporting";

// The message blob that a session hands to each backend.
inline constexpr std::string_view kVelkReportingMessageBlobClientData = "ClientData";
inline constexpr std::string_view kVelkReportingMessageBlobSharedData = "SharedData";

// The message dictionary.
inline constexpr std::string_view kVelkReportingMessageParametersCategory = "ParametersCategory";
inline constexpr std::string_view kVelkReportingMessageParametersType = "ParametersType";
inline constexpr std::string_view kVelkReportingMessageParametersPayload = "ParametersPayload";
inline constexpr std::string_view kVelkReportingMessageParametersFlag = "ParametersFlag";

// Backend names.
inline constexpr std::string_view kVelkReportingBackendDashboard = "dashboard";
inline constexpr std::string_view kVelkReportingBackendUploadServer = "upload_server";
inline constexpr std::string_view kVelkReportingBackendHTTPPost = "splunk";
inline constexpr std::string_view kVelkReportingBackendHTTPPost2 = "korrin";
inline constexpr std::string_view kVelkReportingBackendPowerlog = "power";
inline constexpr std::string_view kVelkReportingBackendQRS = "qrs";
inline constexpr std::string_view kVelkReportingBackendQuill = "quill";

// The session info.
inline constexpr std::string_view kVelkReportingSessionInfoEnableFlag = "EnableFlag";
inline constexpr std::string_view kVelkReportingSessionInfoClientType = "ComponentType";
inline constexpr std::string_view kVelkReportingSessionInfoClientVersion = "ClientVersion";
inline constexpr std::string_view kVelkReportingSessionInfoSessionID = "SessionID";
inline constexpr std::string_view kVelkReportingSessionInfoBatchEvent = "BatchEvents";
inline constexpr std::string_view kVelkReportingSessionInfoRequireUserInfo = "RequireUserDict";
inline constexpr std::string_view kVelkReportingSessionInfoHierarchyToken = "HierarchyToken";

// The user info.
inline constexpr std::string_view kVelkReportingUserInfoClientName = "_clientName";
inline constexpr std::string_view kVelkReportingUserInfoServiceName = "_serviceName";

// One element of a log-data array.
inline constexpr std::string_view kVelkReportingLogDataData = "LogData";
inline constexpr std::string_view kVelkReportingLogDataStartTime = "StartTime";
inline constexpr std::string_view kVelkReportingLogDataEndTime = "EndTime";

inline constexpr std::string_view kVelkReportingErrorDomain = "VelkReportingErrorDomain";

// A hierarchy token.
inline constexpr std::string_view kVelkReportingHierarchyTokenTokenID = "token";
inline constexpr std::string_view kVelkReportingHierarchyTokenLevel = "level";

}  // namespace velk
