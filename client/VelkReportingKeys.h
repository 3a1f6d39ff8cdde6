/* The keys and names that clients share with the daemon, for C11 and C++. Each is a constant of the library that points
 * to its text; the texts travel over the wire and never change. */
#pragma once

#include "foundation/Export.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Session info: who reports. Client type and session number identify the session; the rest is optional. */
VELK_EXPORT extern const char* const kVelkReportingSessionInfoClientType;    /* integer, 5 to 30 */
VELK_EXPORT extern const char* const kVelkReportingSessionInfoClientVersion; /* integer, its low 16 bits count */
VELK_EXPORT extern const char* const kVelkReportingSessionInfoSessionID;     /* unsigned 32-bit, the client's choice */
VELK_EXPORT extern const char* const kVelkReportingSessionInfoBatchEvent;    /* boolean, false when absent */
VELK_EXPORT extern const char* const kVelkReportingSessionInfoRequireUserInfo; /* boolean, true when absent */
VELK_EXPORT extern const char* const kVelkReportingSessionInfoHierarchyToken;  /* dictionary, a hierarchy token */
VELK_EXPORT extern const char* const kVelkReportingSessionInfoEnableFlag;      /* integer; 0: no client is made */

/* User info: at least one of the two is needed. Other keys may stand beside them. */
VELK_EXPORT extern const char* const kVelkReportingUserInfoClientName;  /* text */
VELK_EXPORT extern const char* const kVelkReportingUserInfoServiceName; /* text */

/* Message dictionary: an event. Category and type are mandatory. */
VELK_EXPORT extern const char* const kVelkReportingMessageParametersCategory; /* integer, its low 16 bits count */
VELK_EXPORT extern const char* const kVelkReportingMessageParametersType;     /* the same */
VELK_EXPORT extern const char* const kVelkReportingMessageParametersPayload;  /* dictionary */
VELK_EXPORT extern const char* const kVelkReportingMessageParametersFlag;     /* unsigned 32-bit; bit 0: realtime */

/* Hierarchy token: what links the sessions of one activity. */
VELK_EXPORT extern const char* const kVelkReportingHierarchyTokenTokenID; /* text */
VELK_EXPORT extern const char* const kVelkReportingHierarchyTokenLevel;   /* integer, 0 for a root */

/* One element of a log-data array. Passed on unread. */
VELK_EXPORT extern const char* const kVelkReportingLogDataData;
VELK_EXPORT extern const char* const kVelkReportingLogDataStartTime;
VELK_EXPORT extern const char* const kVelkReportingLogDataEndTime;

/* Names of backends, as the list of enabled ones holds them. */
VELK_EXPORT extern const char* const kVelkReportingBackendDashboard;
VELK_EXPORT extern const char* const kVelkReportingBackendUploadServer;
VELK_EXPORT extern const char* const kVelkReportingBackendHTTPPost;
VELK_EXPORT extern const char* const kVelkReportingBackendHTTPPost2;
VELK_EXPORT extern const char* const kVelkReportingBackendPowerlog;
VELK_EXPORT extern const char* const kVelkReportingBackendQRS;
VELK_EXPORT extern const char* const kVelkReportingBackendQuill;

/* The message blob that the daemon hands to each backend. */
VELK_EXPORT extern const char* const kVelkReportingMessageBlobClientData;
VELK_EXPORT extern const char* const kVelkReportingMessageBlobSharedData;

/* The domain of errors. */
VELK_EXPORT extern const char* const kVelkReportingErrorDomain;

#ifdef __cplusplus
}
#endif
