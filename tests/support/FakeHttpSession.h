// An HTTP session service in memory: it records sessions, configurations, tasks and requests, and the test answers
// each task by hand or through a responder. Nothing leaves the process.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "foundation/PropertyValue.h"
#include "platform/HttpSession.h"
#include "platform/Lock.h"

namespace velk::test {

class FakeHttpSession;
class FakeHttpSessionService;

/// What a responder says to a request.
struct FakeAnswer {
  int statusCode = 200;
  std::string body;
  std::vector<std::pair<std::string, std::string>> headers;
  /// Set: no response and no body, only this failure.
  std::optional<Error> error;
};

/// One recorded task. The answering methods post to the session's delegate queue and return at once; any thread.
class FakeHttpTask : public HttpTask, public std::enable_shared_from_this<FakeHttpTask> {
 public:
  FakeHttpTask(std::shared_ptr<FakeHttpSession> session, HttpRequest request);

  void setTaskDescription(std::string description) override;
  [[nodiscard]] std::string taskDescription() const override;
  void resume() override;
  [[nodiscard]] std::shared_ptr<const HttpResponse> response() const override;

  [[nodiscard]] const HttpRequest& request() const { return _request; }
  /// The request's body as text; empty when there is none.
  [[nodiscard]] std::string body() const { return _request.body ? *_request.body : std::string(); }
  [[nodiscard]] bool isResumed() const;
  [[nodiscard]] bool isCompleted() const;

  void announceResponse(HttpResponse response);
  void deliverData(std::string_view data);
  void reportBodyDataSent(std::int64_t sent, std::int64_t expected);
  void becomeDownloadTask();
  void waitForConnectivity();
  /// The last event of a task: later ones are ignored.
  void complete(std::optional<Error> error = std::nullopt);

  /// Response, data (unless empty) and completion in one.
  void respond(int statusCode, std::string_view body = {},
               std::vector<std::pair<std::string, std::string>> headers = {});
  void fail(int code, std::string description) { complete(Error{"HttpErrorDomain", code, std::move(description)}); }

 private:
  void post(std::function<void(HttpSessionDelegate&, HttpSession&, HttpTask&)> call);

  // Constant after construction.
  const std::shared_ptr<FakeHttpSession> _session;
  const HttpRequest _request;
  // Guarded by _lock.
  mutable Lock _lock;
  std::string _description VELK_GUARDED_BY(_lock);
  std::shared_ptr<const HttpResponse> _response VELK_GUARDED_BY(_lock);
  bool _resumed VELK_GUARDED_BY(_lock) = false;
  bool _completed VELK_GUARDED_BY(_lock) = false;
};

/// One recorded session. It owns its delegate until it has become invalid, as real ones do.
class FakeHttpSession : public HttpSession, public std::enable_shared_from_this<FakeHttpSession> {
 public:
  FakeHttpSession(FakeHttpSessionService& service, HttpSessionConfiguration configuration,
                  std::shared_ptr<HttpSessionDelegate> delegate, std::shared_ptr<Queue> delegateQueue);

  void setSessionDescription(std::string description) override;
  [[nodiscard]] std::string sessionDescription() const override;
  [[nodiscard]] Result<std::shared_ptr<HttpTask>> makeDataTask(HttpRequest request) override;
  [[nodiscard]] Result<std::shared_ptr<HttpTask>> makeUploadTask(HttpRequest request,
                                                                 const std::string& bodyFilePath) override;
  void finishTasksAndInvalidate() override;

  [[nodiscard]] const HttpSessionConfiguration& configuration() const { return _configuration; }
  [[nodiscard]] const std::shared_ptr<Queue>& delegateQueue() const { return _delegateQueue; }
  /// In the order in which they were made.
  [[nodiscard]] std::vector<std::shared_ptr<FakeHttpTask>> tasks() const;
  /// `finishTasksAndInvalidate` was called: no new tasks.
  [[nodiscard]] bool isInvalidated() const;
  [[nodiscard]] std::size_t runningTaskCount() const;
  /// Whether it still owns its delegate.
  [[nodiscard]] bool hasDelegate() const;
  /// Tells the delegate that the session is invalid, whatever its tasks do.
  void becomeInvalid(std::optional<Error> error = std::nullopt);

 private:
  friend class FakeHttpTask;
  friend class FakeHttpSessionService;
  /// Tasks and sessions refer to each other while they are recorded.
  void forget();
  Result<std::shared_ptr<HttpTask>> make(HttpRequest request);
  void taskStarted(FakeHttpTask& task);
  void taskEnded();
  [[nodiscard]] std::shared_ptr<HttpSessionDelegate> delegate() const;

  // Constant after construction.
  FakeHttpSessionService& _service;
  const HttpSessionConfiguration _configuration;
  const std::shared_ptr<Queue> _delegateQueue;
  // Guarded by _lock.
  mutable Lock _lock;
  std::string _description VELK_GUARDED_BY(_lock);
  std::shared_ptr<HttpSessionDelegate> _delegate VELK_GUARDED_BY(_lock);
  std::vector<std::shared_ptr<FakeHttpTask>> _tasks VELK_GUARDED_BY(_lock);
  std::size_t _running VELK_GUARDED_BY(_lock) = 0;
  bool _invalidated VELK_GUARDED_BY(_lock) = false;
};

/// Outlives the sessions that it made. The settings may be changed at any time, by any thread.
class FakeHttpSessionService : public HttpSessionService {
 public:
  ~FakeHttpSessionService() override;

  [[nodiscard]] std::shared_ptr<HttpSession> makeSession(HttpSessionConfiguration configuration,
                                                         std::shared_ptr<HttpSessionDelegate> delegate,
                                                         std::shared_ptr<Queue> delegateQueue) override;

  /// In the order in which they were made.
  [[nodiscard]] std::vector<std::shared_ptr<FakeHttpSession>> sessions() const;
  /// The last session that was made, or null.
  [[nodiscard]] std::shared_ptr<FakeHttpSession> lastSession() const;
  /// Every started task of all sessions, in the order in which they were started.
  [[nodiscard]] std::vector<std::shared_ptr<FakeHttpTask>> startedTasks() const;
  /// The started task of that number (from 0); waits for it in tests on real queues. Null when it does not come.
  [[nodiscard]] std::shared_ptr<FakeHttpTask> waitForTask(std::size_t number,
                                                          Duration limit = std::chrono::seconds(20));

  /// Asked for each task when it is started; an answer completes the task, none leaves it to the test.
  /// It runs on the thread that starts the task, under no lock.
  void setResponder(std::function<std::optional<FakeAnswer>(const HttpRequest&)> responder);
  /// From now on making a task fails with this error (none: it works again).
  void failTaskCreation(std::optional<Error> error);
  /// From now on making a task gives neither a task nor an error.
  void makeNoTasks(bool none);
  /// False: a session that finished its tasks waits for `becomeInvalid`. True at the start.
  void setBecomesInvalidByItself(bool byItself);

 private:
  friend class FakeHttpSession;

  [[nodiscard]] bool becomesInvalidByItself() const;

  mutable Lock _lock;
  Condition _started;
  std::vector<std::shared_ptr<FakeHttpSession>> _sessions VELK_GUARDED_BY(_lock);
  std::vector<std::shared_ptr<FakeHttpTask>> _startedTasks VELK_GUARDED_BY(_lock);
  std::function<std::optional<FakeAnswer>(const HttpRequest&)> _responder VELK_GUARDED_BY(_lock);
  std::optional<Error> _creationError VELK_GUARDED_BY(_lock);
  bool _makesNoTasks VELK_GUARDED_BY(_lock) = false;
  bool _becomesInvalidByItself VELK_GUARDED_BY(_lock) = true;
};

}  // namespace velk::test
