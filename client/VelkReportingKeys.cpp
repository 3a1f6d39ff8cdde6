#include "client/VelkReportingKeys.h"

#include "ipc/Vocabulary.h"

// One source for every text: these point to what the code itself uses.
const char* const kVelkReportingSessionInfoClientType = velk::kVelkReportingSessionInfoClientType.data();
const char* const kVelkReportingSessionInfoClientVersion = velk::kVelkReportingSessionInfoClientVersion.data();
const char* const kVelkReportingSessionInfoSessionID = velk::kVelkReportingSessionInfoSessionID.data();
const char* const kVelkReportingSessionInfoBatchEvent = velk::kVelkReportingSessionInfoBatchEvent.data();
const char* const kVelkReportingSessionInfoRequireUserInfo = velk::kVelkReportingSessionInfoRequireUserInfo.data();
const char* const kVelkReportingSessionInfoHierarchyToken = velk::kVelkReportingSessionInfoHierarchyToken.data();
const char* const kVelkReportingSessionInfoEnableFlag = velk::kVelkReportingSessionInfoEnableFlag.data();
const char* const kVelkReportingUserInfoClientName = velk::kVelkReportingUserInfoClientName.data();
const char* const kVelkReportingUserInfoServiceName = velk::kVelkReportingUserInfoServiceName.data();
const char* const kVelkReportingMessageParametersCategory = velk::kVelkReportingMessageParametersCategory.data();
const char* const kVelkReportingMessageParametersType = velk::kVelkReportingMessageParametersType.data();
const char* const kVelkReportingMessageParametersPayload = velk::kVelkReportingMessageParametersPayload.data();
const char* const kVelkReportingMessageParametersFlag = velk::kVelkReportingMessageParametersFlag.data();
const char* const kVelkReportingHierarchyTokenTokenID = velk::kVelkReportingHierarchyTokenTokenID.data();
const char* const kVelkReportingHierarchyTokenLevel = velk::kVelkReportingHierarchyTokenLevel.data();
const char* const kVelkReportingLogDataData = velk::kVelkReportingLogDataData.data();
const char* const kVelkReportingLogDataStartTime = velk::kVelkReportingLogDataStartTime.data();
const char* const kVelkReportingLogDataEndTime = velk::kVelkReportingLogDataEndTime.data();
const char* const kVelkReportingBackendDashboard = velk::kVelkReportingBackendDashboard.data();
const char* const kVelkReportingBackendUploadServer = velk::kVelkReportingBackendUploadServer.data();
const char* const kVelkReportingBackendHTTPPost = velk::kVelkReportingBackendHTTPPost.data();
const char* const kVelkReportingBackendHTTPPost2 = velk::kVelkReportingBackendHTTPPost2.data();
const char* const kVelkReportingBackendPowerlog = velk::kVelkReportingBackendPowerlog.data();
const char* const kVelkReportingBackendQRS = velk::kVelkReportingBackendQRS.data();
const char* const kVelkReportingBackendQuill = velk::kVelkReportingBackendQuill.data();
const char* const kVelkReportingMessageBlobClientData = velk::kVelkReportingMessageBlobClientData.data();
const char* const kVelkReportingMessageBlobSharedData = velk::kVelkReportingMessageBlobSharedData.data();
const char* const kVelkReportingErrorDomain = velk::kVelkReportingErrorDomain.data();
