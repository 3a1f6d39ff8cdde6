// The requests of a connectivity helper: posts, pulls, and the events of their tasks.
#include "connectivity/LogTexts.h"
#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "device/DeviceEnvironment.h"
#include "platform/Files.h"
#include "platform/Log.h"

namespace velk {
namespace {

namespace texts = connectivity_texts;

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

void ReportingSessionConnectivityHelper::waitForRoom(std::uint64_t sender) { _window->waitForRoom(sender); }

void ReportingSessionConnectivityHelper::stopWaiting(std::uint64_t sender) { _window->stopWaiting(sender); }

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
  Place place;
  if (!request.isBulk) place = std::make_shared<PlaceInWindow>(_window, request.sender);
  _stateQueue->async([self = shared_from_this(), request = std::move(request), place = std::move(place),
                      completion = std::move(completion)]() mutable {
    self->post(std::move(request), std::move(completion), std::move(place));
  });
}

void ReportingSessionConnectivityHelper::post(HttpRequest request, HttpCompletion completion, Place place) {
  if (!_isActive) return;
  if (_mode == POSTRequestMode()) {
    postData(std::move(request), std::move(completion), std::move(place));
  } else if (_mode == kBackgroundUploadMode) {
    postFile(std::move(request), std::move(completion), std::move(place));
  } else {
    log::error(texts::kPostWrongMode, _mode);
  }
}

void ReportingSessionConnectivityHelper::postData(HttpRequest request, HttpCompletion completion, Place place) {
  startPost(_privateURLSession->makeDataTask(std::move(request)), std::move(completion), std::move(place));
}

void ReportingSessionConnectivityHelper::postFile(HttpRequest request, HttpCompletion completion, Place place) {
  const auto container = composeUniqueContainerURL();
  const auto body = std::exchange(request.body, nullptr);
  const auto* bytes = body ? reinterpret_cast<const std::uint8_t*>(body->data()) : nullptr;
  if (!files::writeAtomically(container, {bytes, body ? body->size() : 0})) return;
  startPost(_privateURLSession->makeUploadTask(std::move(request), container), std::move(completion), std::move(place));
  deleteContainerAtURL(container);
}

// A request that no session could make fails as one that was sent would: the requester hears why.
void ReportingSessionConnectivityHelper::startPost(const Result<std::shared_ptr<HttpTask>>& task,
                                                   HttpCompletion completion, Place place) {
  if (!task && task.error().code == kHttpSessionInvalidatedCode) {
    log::error(texts::kPostSessionInvalidated, task.error());
  } else if (!task) {
    if (completion) completion({}, nullptr, task.error());
  } else if (*task) {
    createHelperForTask(**task, std::move(completion), std::move(place));
    (*task)->resume();
  }
}

std::optional<std::uint32_t> ReportingSessionConnectivityHelper::getURLRequestWithCompletionHandler(
    HttpRequest request, bool isUrgent, HttpCompletion completion, std::optional<std::uint32_t> delay) {
  if (_mode != GETRequestMode() && _mode != kBackgroundGETMode) {
    log::error(texts::kGetWrongMode, _mode);
    completion({}, nullptr, errorObject(texts::kGetUnrecognizedModeError, _mode));
    return std::nullopt;
  }
  if (!takeRequest(request.url)) {
    log::standard(texts::kGetDuplicate, request.url);
    return std::nullopt;
  }
  if (isUrgent) {
    delay = 0;
  } else if (!delay) {
    delay = _platform.random.below(kPullDelayBound);
  }
  request.isUrgent = isUrgent;
  schedulePull(std::move(request), isUrgent, *delay, std::move(completion));
  return delay;
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

void ReportingSessionConnectivityHelper::schedulePull(HttpRequest request, bool isUrgent, std::uint32_t delay,
                                                      HttpCompletion completion) {
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

void ReportingSessionConnectivityHelper::createHelperForTask(HttpTask& task, HttpCompletion completion, Place place) {
  auto description = nextTaskDescription();
  task.setTaskDescription(description);
  _tasks[description] = std::make_unique<ConnectivityHelperTask>(description, std::move(completion), std::move(place));
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

// Without a network no sender waits for room: the HTTP service bounds the posts that wait for a route.
void ReportingSessionConnectivityHelper::taskIsWaitingForConnectivity(HttpSession&, HttpTask& task) {
  _stateQueue->async([self = shared_from_this(), description = task.taskDescription()] {
    const auto found = self->_tasks.find(description);
    if (found != self->_tasks.end()) found->second->waitsForConnectivity();
  });
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
