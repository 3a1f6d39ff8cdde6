// The HTTP session service: sessions of tasks whose events reach a delegate on a queue of its choice.
// The connectivity helper is its one user; libcurl stands behind it, and a hand-written fake in the tests.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "foundation/Error.h"
#include "foundation/TimeValue.h"
#include "platform/Queue.h"

namespace velk {

class UnnamedFile;

/// A request as its maker describes it. Bodies are shared, never copied, on their way to the socket.
struct HttpRequest {
  std::string url;
  std::string method = "GET";
  /// In the order in which they are sent. Control characters in values are removed; an empty value is sent as empty.
  std::vector<std::pair<std::string, std::string>> headers;
  std::shared_ptr<const std::string> body;
  /// A body that is too large for memory, read piece by piece while it is sent. At most one of the two is given.
  std::shared_ptr<const UnnamedFile> bodyFile;
  /// From the start of an attempt to the end of the answer: time in a line or without a route does not count. For an
  /// urgent request: from `resume`, waiting included.
  Duration timeout = std::chrono::seconds(60);
  bool ignoresLocalCache = false;
  /// False: the request never leaves over a metered mobile interface.
  bool allowsCellularAccess = true;
  /// True: only https is spoken, whatever the address says.
  bool requiresHttps = true;
  /// Large and patient: it stands in a line of its own, so that small requests to the same server go on beside it.
  bool isBulk = false;
  /// Stands in no line, and waits for a route within its timeout only: a thread waits for the answer.
  bool isUrgent = false;
  /// The session that sends it. Requests of different senders to one server take turns. 0: no particular sender.
  std::uint64_t sender = 0;
  /// Where this is less than what the session's configuration says, it is the bound for the answer.
  std::optional<std::size_t> maximumResponseBytes;
  /// The status is all that matters. No data is delivered, and once the status is there the task has succeeded: after
  /// 64 KiB the rest is not even read.
  bool discardsResponseBody = false;

  void setHeader(std::string_view name, std::string_view value);
};

struct HttpResponse {
  int statusCode = 0;
  std::vector<std::pair<std::string, std::string>> headers;

  /// The value of the last header of that name (in any case), or null.
  [[nodiscard]] const std::string* header(std::string_view name) const noexcept;
};

/// One request on its way. Thread-safe.
class HttpTask {
 public:
  virtual ~HttpTask() = default;
  virtual void setTaskDescription(std::string description) = 0;
  [[nodiscard]] virtual std::string taskDescription() const = 0;
  /// Starts the task; once.
  virtual void resume() = 0;
  /// The response, from the moment it was announced; null before, and when none came.
  [[nodiscard]] virtual std::shared_ptr<const HttpResponse> response() const = 0;
};

class HttpSession;

/// Hears what becomes of a session's tasks, on the session's delegate queue, one call at a time. For one task:
/// perhaps that it waits, response, data (any number of times), completion (exactly once, always).
class HttpSessionDelegate {
 public:
  virtual ~HttpSessionDelegate() = default;
  virtual void didReceiveResponse(HttpSession& session, HttpTask& task) = 0;
  virtual void didReceiveData(HttpSession& session, HttpTask& task, std::span<const std::uint8_t> data) = 0;
  virtual void didSendBodyData(HttpSession& session, HttpTask& task, std::int64_t sent, std::int64_t expected) = 0;
  virtual void didBecomeDownloadTask(HttpSession& session, HttpTask& task) = 0;
  virtual void didCompleteWithError(HttpSession& session, HttpTask& task, const std::optional<Error>& error) = 0;
  /// No route is there that the task may use: it waits for one. Once a task; attempts in vain do not end the waiting.
  virtual void taskIsWaitingForConnectivity(HttpSession& /*session*/, HttpTask& /*task*/) {}
  /// The last call of a session. It holds no reference to its delegate from then on.
  virtual void didBecomeInvalidWithError(HttpSession& session, const std::optional<Error>& error) = 0;
};

struct HttpSessionConfiguration {
  /// Background sessions have an identifier, may wait for a quiet time and may want external power.
  std::optional<std::string> backgroundIdentifier;
  int networkServiceType = 0;
  bool discretionary = false;
  bool requiresExternalPower = false;
  std::string sourceApplicationBundleIdentifier;
  std::string sourceApplicationSecondaryIdentifier;
  /// A request made without a route that it may use waits for one as long as the service runs. All that wait, in lines
  /// or for a route, share 16 MiB of bodies: beyond, the oldest ends with an error.
  bool waitsForConnectivity = false;
  /// Answers longer than this end the task with an error.
  std::size_t maximumResponseBytes = 16 * 1024 * 1024;
};

/// A group of tasks with one delegate, which the session owns until it has become invalid. Thread-safe.
class HttpSession {
 public:
  virtual ~HttpSession() = default;
  virtual void setSessionDescription(std::string description) = 0;
  [[nodiscard]] virtual std::string sessionDescription() const = 0;
  /// Makes a task, not yet started. Fails when the session was invalidated or the request cannot be made (an address
  /// that is none, a scheme that is not spoken).
  [[nodiscard]] virtual Result<std::shared_ptr<HttpTask>> makeDataTask(HttpRequest request) = 0;
  /// The same with a file as body. The file is opened here: it may be removed as soon as this returns.
  [[nodiscard]] virtual Result<std::shared_ptr<HttpTask>> makeUploadTask(HttpRequest request,
                                                                         const std::string& bodyFilePath) = 0;
  /// No new tasks; running ones end as they would have; then the delegate hears that the session is invalid.
  virtual void finishTasksAndInvalidate() = 0;
};

/// Whether a request can be made for the address: an absolute one, of http or https, with a host.
[[nodiscard]] bool isHttpAddress(const std::string& url);

class HttpSessionService {
 public:
  virtual ~HttpSessionService() = default;
  /// Ends all tasks, whose delegates hear an error, and makes no more. Blocks until that is under way; idempotent.
  virtual void stop() {}
  /// Ends the tasks of all bulk requests, wherever they are, and those that are still to come: their delegates hear an
  /// error. All others go on. For the end of the process, which waits for no more of them. Only posts.
  virtual void endBulk() {}
  [[nodiscard]] virtual std::shared_ptr<HttpSession> makeSession(HttpSessionConfiguration configuration,
                                                                 std::shared_ptr<HttpSessionDelegate> delegate,
                                                                 std::shared_ptr<Queue> delegateQueue) = 0;
};

/// Which certificate authorities are believed. An empty path: the system's own.
struct HttpTrust {
  /// A PEM file. The system's directory of authorities stays in force beside it unless that is replaced as well.
  std::string caFile;
  /// A directory with hashed names.
  std::string caDirectory;
};
/// SSL_CERT_FILE and SSL_CERT_DIR, read with secure_getenv.
[[nodiscard]] HttpTrust httpTrustFromEnvironment();

/// The service on libcurl's multi interface: one thread for the whole process, started with the first task.
/// TLS 1.2 and up, certificates always verified; redirects never followed; http and https only. The destructor
/// ends all tasks (their delegates hear an error) and joins the thread; no task's delegate may call it.
/// Failures are in the domain "HttpErrorDomain" with libcurl's code; their text names host and cause.
[[nodiscard]] std::unique_ptr<HttpSessionService> makeHttpSessionService(HttpTrust trust = httpTrustFromEnvironment());

inline constexpr const char* kHttpErrorDomain = "HttpErrorDomain";
/// The code with which an invalidated session refuses to make a task. With any other the request is at fault.
inline constexpr int kHttpSessionInvalidatedCode = 42;

}  // namespace velk
