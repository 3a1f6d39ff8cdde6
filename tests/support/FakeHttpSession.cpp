#include "tests/support/FakeHttpSession.h"

#include <fstream>
#include <sstream>

namespace velk::test {

FakeHttpTask::FakeHttpTask(std::shared_ptr<FakeHttpSession> session, HttpRequest request)
    : _session(std::move(session)), _request(std::move(request)) {}

void FakeHttpTask::setTaskDescription(std::string description) {
  Guard guard(_lock);
  _description = std::move(description);
}

std::string FakeHttpTask::taskDescription() const {
  Guard guard(_lock);
  return _description;
}

void FakeHttpTask::resume() {
  {
    Guard guard(_lock);
    if (_resumed) return;
    _resumed = true;
  }
  _session->taskStarted(*this);
}

std::shared_ptr<const HttpResponse> FakeHttpTask::response() const {
  Guard guard(_lock);
  return _response;
}

bool FakeHttpTask::isResumed() const {
  Guard guard(_lock);
  return _resumed;
}

bool FakeHttpTask::isCompleted() const {
  Guard guard(_lock);
  return _completed;
}

void FakeHttpTask::post(std::function<void(HttpSessionDelegate&, HttpSession&, HttpTask&)> call) {
  if (isCompleted()) return;
  const auto delegate = _session->delegate();
  if (!delegate) return;
  _session->delegateQueue()->async([self = shared_from_this(), session = _session, delegate, call = std::move(call)] {
    call(*delegate, *session, *self);
  });
}

void FakeHttpTask::announceResponse(HttpResponse response) {
  {
    Guard guard(_lock);
    _response = std::make_shared<const HttpResponse>(std::move(response));
  }
  post([](HttpSessionDelegate& delegate, HttpSession& session, HttpTask& task) {
    delegate.didReceiveResponse(session, task);
  });
}

void FakeHttpTask::deliverData(std::string_view data) {
  post([bytes = ByteData(data.begin(), data.end())](HttpSessionDelegate& delegate, HttpSession& session,
                                                    HttpTask& task) { delegate.didReceiveData(session, task, bytes); });
}

void FakeHttpTask::reportBodyDataSent(std::int64_t sent, std::int64_t expected) {
  post([sent, expected](HttpSessionDelegate& delegate, HttpSession& session, HttpTask& task) {
    delegate.didSendBodyData(session, task, sent, expected);
  });
}

void FakeHttpTask::becomeDownloadTask() {
  post([](HttpSessionDelegate& delegate, HttpSession& session, HttpTask& task) {
    delegate.didBecomeDownloadTask(session, task);
  });
}

void FakeHttpTask::waitForConnectivity() {
  post([](HttpSessionDelegate& delegate, HttpSession& session, HttpTask& task) {
    delegate.taskIsWaitingForConnectivity(session, task);
  });
}

void FakeHttpTask::complete(std::optional<Error> error) {
  post([error = std::move(error)](HttpSessionDelegate& delegate, HttpSession& session, HttpTask& task) {
    delegate.didCompleteWithError(session, task, error);
  });
  {
    Guard guard(_lock);
    if (_completed) return;
    _completed = true;
  }
  _session->taskEnded();
}

void FakeHttpTask::respond(int statusCode, std::string_view body,
                           std::vector<std::pair<std::string, std::string>> headers) {
  HttpResponse response;
  response.statusCode = statusCode;
  response.headers = std::move(headers);
  announceResponse(std::move(response));
  if (!body.empty()) deliverData(body);
  complete();
}

FakeHttpSession::FakeHttpSession(FakeHttpSessionService& service, HttpSessionConfiguration configuration,
                                 std::shared_ptr<HttpSessionDelegate> delegate, std::shared_ptr<Queue> delegateQueue)
    : _service(service),
      _configuration(std::move(configuration)),
      _delegateQueue(std::move(delegateQueue)),
      _delegate(std::move(delegate)) {}

void FakeHttpSession::setSessionDescription(std::string description) {
  Guard guard(_lock);
  _description = std::move(description);
}

std::string FakeHttpSession::sessionDescription() const {
  Guard guard(_lock);
  return _description;
}

Result<std::shared_ptr<HttpTask>> FakeHttpSession::makeDataTask(HttpRequest request) {
  return make(std::move(request));
}

Result<std::shared_ptr<HttpTask>> FakeHttpSession::makeUploadTask(HttpRequest request,
                                                                  const std::string& bodyFilePath) {
  std::ifstream file(bodyFilePath, std::ios::binary);
  if (!file) return failure("HttpErrorDomain", 26, "cannot open " + bodyFilePath);
  std::ostringstream contents;
  contents << file.rdbuf();
  request.body = std::make_shared<const std::string>(contents.str());
  return make(std::move(request));
}

Result<std::shared_ptr<HttpTask>> FakeHttpSession::make(HttpRequest request) {
  {
    Guard guard(_service._lock);
    if (_service._creationError) return Failure(*_service._creationError);
    if (_service._makesNoTasks) return std::shared_ptr<HttpTask>();
  }
  Guard guard(_lock);
  if (_invalidated) return failure(kHttpErrorDomain, kHttpSessionInvalidatedCode, "the session has been invalidated");
  auto task = std::make_shared<FakeHttpTask>(shared_from_this(), std::move(request));
  _tasks.push_back(task);
  ++_running;
  return std::shared_ptr<HttpTask>(std::move(task));
}

void FakeHttpSession::taskStarted(FakeHttpTask& task) {
  std::function<std::optional<FakeAnswer>(const HttpRequest&)> responder;
  {
    Guard guard(_service._lock);
    _service._startedTasks.push_back(task.shared_from_this());
    responder = _service._responder;
  }
  _service._started.notifyAll();
  if (!responder) return;
  const auto answer = responder(task.request());
  if (!answer) return;
  if (answer->error) {
    task.complete(answer->error);
  } else {
    task.respond(answer->statusCode, answer->body, answer->headers);
  }
}

void FakeHttpSession::taskEnded() {
  bool last = false;
  {
    Guard guard(_lock);
    last = --_running == 0 && _invalidated;
  }
  if (last && _service.becomesInvalidByItself()) becomeInvalid();
}

void FakeHttpSession::finishTasksAndInvalidate() {
  bool idle = false;
  {
    Guard guard(_lock);
    if (_invalidated) return;
    _invalidated = true;
    idle = _running == 0;
  }
  if (idle && _service.becomesInvalidByItself()) becomeInvalid();
}

void FakeHttpSession::becomeInvalid(std::optional<Error> error) {
  std::shared_ptr<HttpSessionDelegate> delegate;
  {
    Guard guard(_lock);
    _invalidated = true;
    delegate = std::exchange(_delegate, nullptr);
  }
  if (!delegate) return;
  _delegateQueue->async([self = shared_from_this(), delegate = std::move(delegate), error = std::move(error)] {
    delegate->didBecomeInvalidWithError(*self, error);
  });
}

std::vector<std::shared_ptr<FakeHttpTask>> FakeHttpSession::tasks() const {
  Guard guard(_lock);
  return _tasks;
}

bool FakeHttpSession::isInvalidated() const {
  Guard guard(_lock);
  return _invalidated;
}

std::size_t FakeHttpSession::runningTaskCount() const {
  Guard guard(_lock);
  return _running;
}

bool FakeHttpSession::hasDelegate() const { return delegate() != nullptr; }

std::shared_ptr<HttpSessionDelegate> FakeHttpSession::delegate() const {
  Guard guard(_lock);
  return _delegate;
}

void FakeHttpSession::forget() {
  std::vector<std::shared_ptr<FakeHttpTask>> tasks;
  std::shared_ptr<HttpSessionDelegate> delegate;
  Guard guard(_lock);
  tasks.swap(_tasks);
  delegate.swap(_delegate);
}

FakeHttpSessionService::~FakeHttpSessionService() {
  for (const auto& session : sessions()) session->forget();
}

std::shared_ptr<HttpSession> FakeHttpSessionService::makeSession(HttpSessionConfiguration configuration,
                                                                 std::shared_ptr<HttpSessionDelegate> delegate,
                                                                 std::shared_ptr<Queue> delegateQueue) {
  auto session =
      std::make_shared<FakeHttpSession>(*this, std::move(configuration), std::move(delegate), std::move(delegateQueue));
  Guard guard(_lock);
  _sessions.push_back(session);
  return session;
}

std::vector<std::shared_ptr<FakeHttpSession>> FakeHttpSessionService::sessions() const {
  Guard guard(_lock);
  return _sessions;
}

std::shared_ptr<FakeHttpSession> FakeHttpSessionService::lastSession() const {
  Guard guard(_lock);
  return _sessions.empty() ? nullptr : _sessions.back();
}

std::vector<std::shared_ptr<FakeHttpTask>> FakeHttpSessionService::startedTasks() const {
  Guard guard(_lock);
  return _startedTasks;
}

std::shared_ptr<FakeHttpTask> FakeHttpSessionService::waitForTask(std::size_t number, Duration limit) {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  Guard guard(_lock);
  while (_startedTasks.size() <= number) {
    if (!_started.waitUntil(_lock, deadline) && _startedTasks.size() <= number) return nullptr;
  }
  return _startedTasks[number];
}

void FakeHttpSessionService::setResponder(std::function<std::optional<FakeAnswer>(const HttpRequest&)> responder) {
  Guard guard(_lock);
  _responder = std::move(responder);
}

void FakeHttpSessionService::failTaskCreation(std::optional<Error> error) {
  Guard guard(_lock);
  _creationError = std::move(error);
}

void FakeHttpSessionService::makeNoTasks(bool none) {
  Guard guard(_lock);
  _makesNoTasks = none;
}

void FakeHttpSessionService::setBecomesInvalidByItself(bool byItself) {
  Guard guard(_lock);
  _becomesInvalidByItself = byItself;
}

bool FakeHttpSessionService::becomesInvalidByItself() const {
  Guard guard(_lock);
  return _becomesInvalidByItself;
}

}  // namespace velk::test
