// Files and log data that clients hand over, and where their reports can be seen. The backends do the work.
#include "foundation/Format.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"
#include "session/ClientSession.h"
#include "session/FileUrl.h"
#include "session/LogTexts.h"

namespace velk {

namespace {

/// The first whose name contains "splunk" and that has an address, then "korrin" if it has one, then "dashboard".
std::optional<std::string> chooseDisplayURL(const SessionBackends& backends) {
  for (const auto& entry : backends) {
    if (entry.name.find(kVelkReportingBackendHTTPPost) == std::string::npos) continue;
    if (auto url = entry.backend->displayURL()) return url;
  }
  if (const auto* backend = backends.find(kVelkReportingBackendHTTPPost2)) {
    if (auto url = backend->displayURL()) return url;
  }
  const auto* dashboard = backends.find(kVelkReportingBackendDashboard);
  return dashboard != nullptr ? dashboard->displayURL() : std::nullopt;
}

}  // namespace

void ClientSession::fetchDisplayURL(TextReply reply) {
  log::standard(session_texts::kFetchingDisplayURL, sessionID());
  const auto& backends = ownBackends();
  auto url = backends ? chooseDisplayURL(*backends) : std::nullopt;
  reply(url ? std::move(*url) : std::string(session_texts::kReplyNoDisplayURL));
}

void ClientSession::uploadFileAtPath(std::string url, std::string extensionToken, FileDescriptor file,
                                     UploadReply reply) {
  log::standard(session_texts::kUploadingFile, sessionID());
  // Stays open while the backends are asked; a backend that takes the upload finds it by the token.
  const FileDescriptor heldOpen = std::move(file);
  uploadFileWithURL(url, extensionToken, std::move(reply));
}

void ClientSession::uploadFileWithURL(const std::string& url, const std::string& extensionToken, UploadReply reply) {
  const std::string path = fileSystemPath(url);
  bool taken = false;
  if (const auto& backends = ownBackends()) {
    for (const auto& entry : *backends) taken = entry.backend->uploadFileAtPath(path, extensionToken) || taken;
  }
  if (taken) {
    log::standard(session_texts::kUploadSuccessful, path);
  } else {
    log::error(session_texts::kUploadFailed, path);
  }
  _services.messageLog.writeToLogFile(
      formatText(session_texts::kMessageLogUpload, {taken ? "succeeded" : "failed", withoutControlCharacters(url)}));
  reply(taken);
}

void ClientSession::uploadLogData(PropertyArray logData, LogDataReply reply) {
  bool taken = false;
  if (const auto& backends = ownBackends()) {
    for (const auto& entry : *backends) taken = entry.backend->uploadLogData(logData) || taken;
  }
  if (taken) {
    log::standard(session_texts::kLogDataSuccessful);
  } else {
    log::error(session_texts::kLogDataFailed);
  }
  reply(taken, std::nullopt);
}

}  // namespace velk
