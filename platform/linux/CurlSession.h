// Sessions and tasks of the HTTP session service on libcurl: what their users see, without libcurl.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <span>
#include <string>

#include "platform/Clock.h"
#include "platform/HttpSession.h"
#include "platform/Lock.h"

namespace velk {

class CurlEngine;
class CurlSession;

/// The parts of an address that the transport needs.
struct HttpAddress {
  std::string scheme;
  /// Without brackets.
  std::string host;
  /// Whom it names: scheme, host and port.
  std::string server;
  [[nodiscard]] bool isLoopback() const;
};
/// Fails for anything but an absolute http or https address with a host.
[[nodiscard]] Result<HttpAddress> parseHttpAddress(const std::string& url);

/// One request. The first group of methods is its user's, the second the engine's, on the engine's thread; each of
/// those hands an event to the delegate queue and returns.
class CurlTask : public HttpTask, public std::enable_shared_from_this<CurlTask> {
 public:
  CurlTask(std::shared_ptr<CurlSession> session, HttpRequest request, HttpAddress address);
  ~CurlTask() override;

  void setTaskDescription(std::string description) override;
  [[nodiscard]] std::string taskDescription() const override;
  void resume() override;
  [[nodiscard]] std::shared_ptr<const HttpResponse> response() const override;

  void announceResponse(HttpResponse response);
  /// False when the delegate is too far behind: the engine holds the data back and hears `unpause` later.
  [[nodiscard]] bool deliverData(std::span<const std::uint8_t> data);
  void announceWaiting();
  void reportBodyDataSent(std::int64_t sent, std::int64_t expected);
  /// The first call counts.
  void complete(std::optional<Error> error);

  [[nodiscard]] const HttpRequest& request() const noexcept { return _request; }
  [[nodiscard]] const HttpAddress& address() const noexcept { return _address; }
  [[nodiscard]] const HttpSessionConfiguration& configuration() const noexcept;
  /// -1 when the request has no file as its body.
  [[nodiscard]] int bodyFile() const noexcept;
  [[nodiscard]] std::int64_t bodyFileSize() const noexcept;
  [[nodiscard]] std::size_t maximumResponseBytes() const noexcept;
  /// When an urgent task ends wherever it is; of others the attempts are bounded, not the waiting.
  [[nodiscard]] SteadyTime deadline() const noexcept { return _deadline; }
  /// For an attempt that begins now.
  [[nodiscard]] Duration timeLeft(SteadyTime now) const noexcept;

  /// Where the engine has the task. The engine's thread alone.
  struct Place {
    /// The smaller, the earlier it came.
    std::uint64_t number = 0;
    /// What was known of the routes when the last attempt began.
    std::uint64_t routeGeneration = 0;
    /// The delegate has heard that it waits for a route.
    bool hasWaited = false;
    /// It waits for a look-up of the routes, not for another route.
    bool awaitsLookup = false;
    /// How the last attempt failed, until the routes tell whether that was for want of one.
    std::optional<Error> failure;
  };
  [[nodiscard]] Place& place() noexcept { return _place; }
  [[nodiscard]] const Place& place() const noexcept { return _place; }

 private:
  void post(std::function<void(HttpSessionDelegate&, HttpSession&, HttpTask&)> call);
  void dataWasConsumed(std::size_t size);

  // Constant after construction; the deadline from `resume` on.
  const std::shared_ptr<CurlSession> _session;
  const HttpRequest _request;
  const HttpAddress _address;
  SteadyTime _deadline = SteadyTime::max();
  // The engine's.
  Place _place;
  // Self-synchronised.
  std::atomic<bool> _resumed{false};
  std::atomic<bool> _completed{false};
  // Guarded by _lock.
  mutable Lock _lock;
  std::string _description VELK_GUARDED_BY(_lock);
  std::shared_ptr<const HttpResponse> _response VELK_GUARDED_BY(_lock);
  std::size_t _undelivered VELK_GUARDED_BY(_lock) = 0;
  bool _paused VELK_GUARDED_BY(_lock) = false;
};

class CurlSession : public HttpSession, public std::enable_shared_from_this<CurlSession> {
 public:
  CurlSession(std::shared_ptr<CurlEngine> engine, HttpSessionConfiguration configuration,
              std::shared_ptr<HttpSessionDelegate> delegate, std::shared_ptr<Queue> delegateQueue);
  ~CurlSession() override;

  void setSessionDescription(std::string description) override;
  [[nodiscard]] std::string sessionDescription() const override;
  [[nodiscard]] Result<std::shared_ptr<HttpTask>> makeDataTask(HttpRequest request) override;
  [[nodiscard]] Result<std::shared_ptr<HttpTask>> makeUploadTask(HttpRequest request,
                                                                 const std::string& bodyFilePath) override;
  void finishTasksAndInvalidate() override;

 private:
  friend class CurlTask;
  [[nodiscard]] Result<std::shared_ptr<HttpTask>> makeTask(HttpRequest request);
  /// Null once the session is invalid.
  [[nodiscard]] std::shared_ptr<HttpSessionDelegate> delegate() const;
  void taskEnded();
  void announceInvalid();

  // Constant after construction.
  const std::shared_ptr<CurlEngine> _engine;
  const HttpSessionConfiguration _configuration;
  const std::shared_ptr<Queue> _delegateQueue;
  // Guarded by _lock.
  mutable Lock _lock;
  std::string _description VELK_GUARDED_BY(_lock);
  std::shared_ptr<HttpSessionDelegate> _delegate VELK_GUARDED_BY(_lock);
  std::size_t _tasks VELK_GUARDED_BY(_lock) = 0;
  bool _invalidated VELK_GUARDED_BY(_lock) = false;
};

}  // namespace velk
