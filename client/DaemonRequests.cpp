// The calls that ask the daemon for something, each with its own words for a daemon that cannot be reached.

#include <cerrno>

#include "client/DaemonConnection.h"
#include "client/LogTexts.h"
#include "client/VelkReportingImplementation.h"
#include "foundation/Uuid.h"
#include "platform/Log.h"

namespace velk {

namespace {

const Error& noDaemon() {
  // Never destroyed: the library's thread is at work while the process ends.
  static const Error& error = *new Error(connectionError(ConnectionError::notConnected, "no daemon answers"));
  return error;
}

/// With this process's own rights, and before its user hears of the upload. Not on the library's thread: a file system
/// may take its time.
void removeUploaded(const FileToHandOver& file) {
  const auto removed = file.removeIfUnchanged();
  if (!removed) log::standard(texts::kUploadedFileStays, removed.error());
}

}  // namespace

ConfigurationReply VelkReportingImplementation::statesReply(const StatesCallback& callback) {
  return [self = weak_from_this(), callback](const std::optional<PropertyArray>& enabled,
                                             const std::optional<PropertyArray>& whitelist,
                                             const std::optional<PropertyArray>& blacklist) {
    if (const auto strong = self.lock()) {
      strong->_reporting->async([lists = strong->_lists, enabled, whitelist, blacklist] {
        lists->replace(std::make_shared<const EventLists>(enabled, whitelist, blacklist));
        log::standard(texts::kCachedLists, enabled ? enabled->size() : 0, whitelist, blacklist);
      });
    }
    callback(enabled);
  };
}

void VelkReportingImplementation::startConfiguration(const StatesCallback& completionHandler) {
  const auto connection = _link->connect();
  _link->description().isConfigured = true;
  const auto failed = [completionHandler](const Error& error) {
    log::standard(texts::kStartConfigurationProxyFailure, error);
    completionHandler(std::optional<PropertyArray>());
  };
  if (!connection) return failed(noDaemon());
  SessionInterfaceProxy(connection, failed).startConfigWithCompletionHandler(statesReply(completionHandler));
  fetchDisplayURL(connection);
}

void VelkReportingImplementation::fetchDisplayURL(const std::shared_ptr<Connection>& connection) {
  SessionInterfaceProxy(connection, loggingHandler(texts::kStartConfigurationProxyFailure))
      .fetchDisplayURL([self = weak_from_this()](const std::optional<std::string>& url) {
        const auto strong = self.lock();
        if (!strong || !url) return;
        strong->logText(*url == texts::kUrlNotAvailable ? *url : formatText(texts::kUrlForTheSession, {*url}));
      });
}

void VelkReportingImplementation::fetchReportingStates(const std::optional<PropertyDictionary>& userInfo,
                                                       const StatesCallback& fetchComplete) {
  const auto connection = _link->connect();
  _link->description().receiveUserInfo(userInfo);
  const auto failed = [fetchComplete](const Error& error) {
    log::standard(texts::kFetchStatesProxyFailure, error);
    fetchComplete(std::optional<PropertyArray>());
  };
  if (!connection) return failed(noDaemon());
  SessionInterfaceProxy(connection, failed).fetchStatesWithUserInfo(userInfo, statesReply(fetchComplete));
}

void VelkReportingImplementation::flush(const FlushCallback& completion) {
  const auto failed = [completion](const Error& error) {
    log::standard(texts::kFlushProxyFailure, error);
    completion(std::optional<Error>(error));
  };
  const auto connection = _link->connect();
  if (!connection) return failed(noDaemon());
  SessionInterfaceProxy(connection, failed)
      .flushMessagesWithCompletion([self = weak_from_this(), completion](const std::optional<std::string>& text,
                                                                         const std::optional<Error>& error) {
        if (error) {
          log::standard(texts::kFlushFailed, *error);
        } else {
          log::standard(texts::kFlushedSuccessfully, text);
          if (const auto strong = self.lock(); strong && text) strong->logText(*text);
        }
        completion(error);
      });
}

void VelkReportingImplementation::updateSharedDataWithDictionary(const PropertyDictionary& dictionary) {
  const auto failed = loggingHandler(texts::kUpdateSharedDataWithDictionaryProxyFailure);
  const auto connection = _link->connect();
  if (!connection) return failed(noDaemon());
  SessionInterfaceProxy(connection, failed).updateSharedDataWithDictionary(dictionary);
}

void VelkReportingImplementation::updateSharedDataForKey(const std::string& key,
                                                         const std::optional<PropertyValue>& value) {
  const auto failed = loggingHandler(texts::kUpdateSharedDataForKeyProxyFailure);
  const auto connection = _link->connect();
  if (!connection) return failed(noDaemon());
  SessionInterfaceProxy(connection, failed).updateSharedDataForKey(key, value);
}

void VelkReportingImplementation::setDigestKey(const ByteData& key, std::int32_t algorithm) {
  // The text of another operation, shared with it.
  const auto failed = loggingHandler(texts::kUploadDataArrayProxyFailure);
  const auto connection = _link->connect();
  _link->description().digestKey = key;
  _link->description().digestAlgorithm = algorithm;
  if (!connection) return failed(noDaemon());
  SessionInterfaceProxy(connection, failed).setDigestKey(key, algorithm);
}

Result<std::shared_ptr<const FileToHandOver>> VelkReportingImplementation::openForUpload(const std::string& path) {
  std::shared_ptr<void> place(nullptr, [held = _filesHeld](void*) { --*held; });
  if (++*_filesHeld > kMaximumFilesHeld) return failure("HandedFile", EMFILE, path + ": too many uploads wait");
  auto file = FileToHandOver::open(path);
  if (!file) return Failure(file.error());
  struct Held {
    FileToHandOver file;
    std::shared_ptr<void> place;
  };
  const auto held = std::make_shared<const Held>(Held{std::move(*file), std::move(place)});
  return std::shared_ptr<const FileToHandOver>(held, &held->file);
}

void VelkReportingImplementation::uploadFile(const std::string& url, const std::shared_ptr<const FileToHandOver>& file,
                                             const UploadCallback& completionHandler) {
  const auto failed = loggingHandler(texts::kUploadFileProxyFailure);
  const auto connection = _link->connect();
  if (!connection) return failed(noDaemon());
  auto descriptor = file->descriptor();
  if (!descriptor) return failed(descriptor.error());
  SessionInterfaceProxy(connection, failed)
      .uploadFileAtPath(url, randomUuidText(), std::move(*descriptor),
                        [runtime = &_runtime, file, completionHandler](bool uploaded, bool isDelivered) {
                          runtime->runCallback([file, completionHandler, uploaded, isDelivered] {
                            if (isDelivered) removeUploaded(*file);
                            completionHandler.callHere(uploaded, std::optional<Error>());
                          });
                        });
}

void VelkReportingImplementation::uploadLogData(const PropertyArray& logData, const UploadCallback& completionHandler) {
  const auto failed = loggingHandler(texts::kUploadDataArrayProxyFailure);
  const auto connection = _link->connect();
  if (!connection) return failed(noDaemon());
  SessionInterfaceProxy(connection, failed)
      .uploadLogData(logData, [completionHandler](bool uploaded, const std::optional<Error>& error) {
        completionHandler(uploaded, error);
      });
}

}  // namespace velk
