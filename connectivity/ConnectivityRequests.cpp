// The requests of a connectivity helper: posts, pulls, and the events of their tasks.
#include "connectivity/LogTexts.h"
#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "device/DeviceEnvironment.h"
#include "platform/Files.h"
#include "platform/Log.h"

namespace velk {
namespace {

namespace texts = connectivity_texts;

constexpr std::uint32_t kPullDelayBound = 7200;

std::optional<std::string> text(const std::optional<Error>& error) {
  if (!error) return std::nullopt;
  return error->description;
}

std::optional<std::string> text(const std::shared_ptr<const HttpResponse>& response) {
  if (!response) return std::nullopt;
  return formatText("status %d", {response->statusCode});
}

/// Process-wide; the first task is number 1.
std::string nextTaskDescription() {
  static std::atomic<std::uint32_t> counter{0};
  return formatText("Task_%08x", {++counter});
}

}  // namespace

Lock ReportingSessionConnectivityHelper::classLock;

void ReportingSessionConnectivityHelper::waitForRoom(std::uint64_t /*sender*/) { _window->waitForRoom(); }

bool ReportingSessionConnectivityHelper::takesPosts() const {
  if (_service != Service::awake) return false;
  const bool isForPosts = _mode == POSTRequestMode() || _mode == kBackgroundUploadMode;
  if (!isForPosts) log::error(texts::kPostWrongMode, _mode);
  return isForPosts;
}

void ReportingSessionConnectivityHelper::postURLRequestWithCompletionHandler(HttpRequest request,
                                                                             HttpCompletion completion) {
  // Called or dropped, and by whatever path, it leaves the window once. Bulk has a line of its own and bounds of its
  // own: events need not wait for it.
  std::shared_ptr<void> underWay;
  if (!request.isBulk) {
    _window->enter();
    underWay = std::shared_ptr<void>(nullptr, [window = _window](void*) { window->leave(); });
  }
  _stateQueue->async([self = shared_from_this(), request = std::move(request), underWay,
                      completion = std::move(completion)]() mutable {
    self->post(std::move(request),
               [underWay, completion = std::move(completion)](
                   ByteData data, std::shared_ptr<const HttpResponse> response, std::optional<Error> error) mutable {
                 completion(std::move(data), std::move(response), std::move(error));
               });
  });
}

void ReportingSessionConnectivityHelper::post(HttpRequest request, HttpCompletion completion) {
  if (!_isActive) return;
  if (_mode == POSTRequestMode()) {
    postData(std::move(request), std::move(completion));
  } else if (_mode == kBackgroundUploadMode) {
    postFile(std::move(request), std::move(completion));
  } else {
    log::error(texts::kPostWrongMode, _mode);
  }
}

void ReportingSessionConnectivityHelper::postData(HttpRequest request, HttpCompletion completion) {
  const auto task = _privateURLSession->makeDataTask(std::move(request));
  if (!task) {
    log::error(texts::kPostSessionInvalidated, task.error());
    return;
  }
  if (!*task) return;
  createHelperForTask(**task, std::move(completion));
  (*task)->resume();
}

void ReportingSessionConnectivityHelper::postFile(HttpRequest request, HttpCompletion completion) {
  const auto container = composeUniqueContainerURL();
  const auto body = std::exchange(request.body, nullptr);
  const auto* bytes = body ? reinterpret_cast<const std::uint8_t*>(body->data()) : nullptr;
  if (!files::writeAtomically(container, {bytes, body ? body->size() : 0})) return;
  const auto task = _privateURLSession->makeUploadTask(std::move(request), container);
  if (!task) {
    log::error(texts::kPostSessionInvalidated, task.error());
  } else if (*task) {
    createHelperForTask(**task, std::move(completion));
    (*task)->resume();
  }
  deleteContainerAtURL(container);
}

void ReportingSessionConnectivityHelper::getURLRequestWithCompletionHandler(HttpRequest request, bool isUrgent,
                                                                            HttpCompletion completion) {
  if (_mode != GETRequestMode() && _mode != kBackgroundGETMode) {
    log::error(texts::kGetWrongMode, _mode);
    completion({}, nullptr, errorObject(texts::kGetUnrecognizedModeError, _mode));
    return;
  }
  if (!takeRequest(request.url)) {
    log::standard(texts::kGetDuplicate, request.url);
    return;
  }
  schedulePull(std::move(request), isUrgent, std::move(completion));
}

// The mere presence of an entry counts: an address is pulled once in a helper's life.
bool ReportingSessionConnectivityHelper::takeRequest(const std::string& url) {
  Guard guard(classLock);
  return _requestInProgress.try_emplace(url, true).second;
}

void ReportingSessionConnectivityHelper::setRequestInProgress(const std::string& url, bool inProgress) {
  Guard guard(classLock);
  _requestInProgress[url] = inProgress;
}

void ReportingSessionConnectivityHelper::schedulePull(HttpRequest request, bool isUrgent, HttpCompletion completion) {
  const std::uint32_t delay = isUrgent ? 0 : _platform.random.below(kPullDelayBound);
  if (isUrgent) {
    log::standard(texts::kGetUrgent, request.url);
  } else {
    const auto now = static_cast<std::uint64_t>(_platform.clock.wallTime().seconds);
    log::standard(texts::kGetDelayed, request.url, delay, now, now + delay);
  }
  Task work = [self = shared_from_this(), request = std::move(request), completion = std::move(completion)]() mutable {
    self->pull(std::move(request), std::move(completion));
  };
  if (isUrgent) {
    _stateQueue->async(std::move(work));
  } else {
    _stateQueue->asyncAfter(std::chrono::seconds(delay), std::move(work));
  }
}

void ReportingSessionConnectivityHelper::pull(HttpRequest request, HttpCompletion completion) {
  const auto url = request.url;
  if (!_isActive) {
    cancelPull(url, std::move(completion), texts::kNotActiveError, texts::kGetCancelledInactive);
    return;
  }
  const auto task = _privateURLSession->makeDataTask(std::move(request));
  if (!task) log::standard(texts::kGetSessionInvalidated, task.error());
  if (!task || !*task) {
    cancelPull(url, std::move(completion), texts::kNoDataTaskError, texts::kGetCancelledNoTask);
    return;
  }
  createHelperForTask(**task, pullWrapper(url, std::move(completion)));
  (*task)->resume();
}

void ReportingSessionConnectivityHelper::cancelPull(const std::string& url, HttpCompletion completion,
                                                    const char* error, const char* logText) {
  completion({}, nullptr, errorObject(error, -1));
  setRequestInProgress(url, false);
  log::standard(logText, url);
}

HttpCompletion ReportingSessionConnectivityHelper::pullWrapper(std::string url, HttpCompletion completion) {
  return [weak = weak_from_this(), url = std::move(url), completion = std::move(completion)](
             ByteData data, std::shared_ptr<const HttpResponse> response, std::optional<Error> error) mutable {
    const auto description = text(error);
    completion(std::move(data), std::move(response), std::move(error));
    if (const auto self = weak.lock()) self->setRequestInProgress(url, false);
    log::standard(texts::kGetCompleted, url, description);
  };
}

void ReportingSessionConnectivityHelper::createHelperForTask(HttpTask& task, HttpCompletion completion) {
  auto description = nextTaskDescription();
  task.setTaskDescription(description);
  _tasks[description] = std::make_unique<ConnectivityHelperTask>(description, std::move(completion));
  _runningTasks = static_cast<std::uint32_t>(_tasks.size());
  log::standard(texts::kHelperTaskCreated, description);
}

void ReportingSessionConnectivityHelper::didReceiveResponse(HttpSession& session, HttpTask& task) {
  log::standard(texts::kDidReceiveResponse, session.sessionDescription(), task.taskDescription());
}

void ReportingSessionConnectivityHelper::didReceiveData(HttpSession& session, HttpTask& task,
                                                        std::span<const std::uint8_t> data) {
  _stateQueue->async([self = shared_from_this(), sessionName = session.sessionDescription(),
                      description = task.taskDescription(), bytes = ByteData(data.begin(), data.end())] {
    log::standard(texts::kDidReceiveData, bytes.size(), sessionName, description);
    const auto found = self->_tasks.find(description);
    if (found != self->_tasks.end()) found->second->appendReceivedData(bytes);
  });
}

void ReportingSessionConnectivityHelper::didCompleteWithError(HttpSession& session, HttpTask& task,
                                                              const std::optional<Error>& error) {
  _stateQueue->async([self = shared_from_this(), sessionName = session.sessionDescription(),
                      description = task.taskDescription(), response = task.response(), failure = error]() mutable {
    log::standard(texts::kDidComplete, sessionName, description, text(response), text(failure));
    const auto found = self->_tasks.find(description);
    if (found == self->_tasks.end()) return;
    found->second->complete(std::move(response), std::move(failure));
    self->_tasks.erase(description);
    self->_runningTasks = static_cast<std::uint32_t>(self->_tasks.size());
  });
}

void ReportingSessionConnectivityHelper::didSendBodyData(HttpSession& session, HttpTask& task, std::int64_t sent,
                                                         std::int64_t expected) {
  log::standard(texts::kDidSendBodyData, session.sessionDescription(), task.taskDescription(), sent, expected);
}

void ReportingSessionConnectivityHelper::didBecomeDownloadTask(HttpSession& session, HttpTask&) {
  log::error(texts::kDidBecomeDownloadTask, session.sessionDescription());
}

void ReportingSessionConnectivityHelper::didBecomeInvalidWithError(HttpSession& session,
                                                                   const std::optional<Error>& error) {
  _stateQueue->async([self = shared_from_this(), sessionName = session.sessionDescription(), error] {
    log::standard(texts::kDidBecomeInvalidRelease, self->_totalSessionsServedCount.load(), sessionName);
    // An earlier session of a transport that has been activated again says nothing about the present one.
    if (!self->_isActive) self->_hasBecomeInvalid = true;
    self->releaseAllIPCTransactions();
    log::standard(texts::kDidBecomeInvalid, sessionName, text(error));
  });
}

}  // namespace velk
