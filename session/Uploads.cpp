// Files and log data that clients hand over, and where their reports can be seen. The backends do the work.
#include <utility>

#include "foundation/FileUrl.h"
#include "foundation/Format.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"
#include "session/ClientSession.h"
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

/// Every backend is asked, also when one has taken it in hand already.
template <class Ask>
bool offer(const SessionBackends* backends, Ask ask) {
  bool taken = false;
  if (backends == nullptr) return taken;
  for (const auto& entry : *backends) taken = ask(*entry.backend) || taken;
  return taken;
}

void finishFileUpload(MessageLog& messageLog, const std::string& url, const FileUpload& upload, bool taken,
                      UploadReply& reply) {
  if (taken) {
    log::standard(session_texts::kUploadSuccessful, upload.path);
  } else {
    log::error(session_texts::kUploadFailed, upload.path);
  }
  messageLog.writeToLogFile(
      formatText(session_texts::kMessageLogUpload,
                 {taken ? "succeeded" : "failed", withoutControlCharacters(absoluteFileUrl(url))}));
  reply(taken, upload.isDelivered);
}

void finishLogData(bool taken, LogDataReply& reply) {
  if (taken) {
    log::standard(session_texts::kLogDataSuccessful);
  } else {
    log::error(session_texts::kLogDataFailed);
  }
  reply(taken, std::nullopt);
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
  uploadFileWithURL(std::move(url), std::move(extensionToken), std::move(file), std::move(reply));
}

void ClientSession::uploadFileWithURL(std::string url, std::string extensionToken, FileDescriptor file,
                                      UploadReply reply) {
  FileUpload upload{fileSystemPath(url), std::move(extensionToken), std::move(file)};
  upload.user = _uploads.user();
  auto place = _uploads.takePlace();
  if (!place) {
    log::error(session_texts::kTooManyUploads, sessionID(), UploadQueue::kMaximumUploads,
               ProcessUploads::kMaximumUploads);
    finishFileUpload(_services.messageLog, url, upload, false, reply);
    return;
  }
  // Nothing of the session: the upload may outlive it.
  _uploads.run(std::move(place), [backends = ownBackends(), &messageLog = _services.messageLog, url = std::move(url),
                                  upload = std::move(upload), reply = std::move(reply)](bool mayBegin) mutable {
    const bool taken =
        mayBegin && offer(backends.get(), [&](VelkReportingBackend& each) { return each.uploadFileAtPath(upload); });
    finishFileUpload(messageLog, url, upload, taken, reply);
    return upload.isDelivered;
  });
}

void ClientSession::uploadLogData(PropertyArray logData, LogDataReply reply) {
  auto place = _uploads.takePlace();
  if (!place) {
    log::error(session_texts::kTooManyUploads, sessionID(), UploadQueue::kMaximumUploads,
               ProcessUploads::kMaximumUploads);
    finishLogData(false, reply);
    return;
  }
  _uploads.run(std::move(place), [backends = ownBackends(), logData = std::move(logData),
                                  reply = std::move(reply)](bool mayBegin) mutable {
    const bool taken =
        mayBegin && offer(backends.get(), [&](VelkReportingBackend& each) { return each.uploadLogData(logData); });
    finishLogData(taken, reply);
    return taken;
  });
}

}  // namespace velk
