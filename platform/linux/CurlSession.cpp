#include "platform/linux/CurlSession.h"

#include <arpa/inet.h>
#include <curl/curl.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstring>

#include "foundation/PropertyValue.h"
#include "foundation/Text.h"
#include "platform/UnnamedFile.h"
#include "platform/linux/CurlEngine.h"

namespace velk {
namespace {

/// How far a delegate may be behind before its transfer is held up.
constexpr std::size_t kMaximumUndelivered = 256 * 1024;

static_assert(kHttpSessionInvalidatedCode == CURLE_ABORTED_BY_CALLBACK);

Duration boundedTimeout(const HttpRequest& request) {
  constexpr Duration kLongest = std::chrono::hours(24);
  return std::clamp(request.timeout, Duration::zero(), kLongest);
}

std::string urlPart(CURLU* url, CURLUPart part, unsigned flags = 0) {
  char* text = nullptr;
  if (curl_url_get(url, part, &text, flags) != CURLUE_OK) return {};
  std::string copy(text);
  curl_free(text);
  return copy;
}

/// The host as an address that cannot be parsed seems to name it: for messages, which hold neither a password nor a
/// path nor a query.
std::string hostOf(std::string_view url) {
  constexpr std::size_t kLongest = 253;
  constexpr std::string_view kSeparator = "://";
  if (const auto end = url.find(kSeparator); end != std::string_view::npos) url.remove_prefix(end + kSeparator.size());
  url = url.substr(0, url.find_first_of("/?#"));
  if (const auto user = url.rfind('@'); user != std::string_view::npos) url.remove_prefix(user + 1);
  return url.empty() ? "no host" : std::string(url.substr(0, kLongest));
}

/// RFC 9110's token: what methods and header names are made of.
bool isToken(std::string_view text) {
  constexpr std::string_view kOthers = "!#$%&'*+-.^_`|~";
  return !text.empty() && std::all_of(text.begin(), text.end(), [&](char c) {
    return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') ||
           kOthers.find(c) != std::string_view::npos;
  });
}

std::optional<Error> unusable(const HttpRequest& request, const HttpAddress& address) {
  if (request.requiresHttps && address.scheme != "https") {
    return Error{kHttpErrorDomain, CURLE_UNSUPPORTED_PROTOCOL, address.host + ": only https may be used"};
  }
  if (!isToken(request.method)) {
    return Error{kHttpErrorDomain, CURLE_BAD_FUNCTION_ARGUMENT, address.host + ": the method is none"};
  }
  for (const auto& header : request.headers) {
    if (!isToken(header.first)) {
      return Error{kHttpErrorDomain, CURLE_BAD_FUNCTION_ARGUMENT, address.host + ": a header's name is none"};
    }
  }
  return std::nullopt;
}

}  // namespace

bool HttpAddress::isLoopback() const {
  in6_addr ipv6;
  if (::inet_pton(AF_INET6, host.c_str(), &ipv6) == 1) return IN6_IS_ADDR_LOOPBACK(&ipv6);
  in_addr ipv4;
  if (::inet_pton(AF_INET, host.c_str(), &ipv4) == 1) return (ntohl(ipv4.s_addr) >> 24) == 127;
  const auto name = lowerCased(host);
  constexpr std::string_view kSuffix = ".localhost";
  return name == "localhost" ||
         (name.size() > kSuffix.size() && name.compare(name.size() - kSuffix.size(), kSuffix.size(), kSuffix) == 0);
}

Result<HttpAddress> parseHttpAddress(const std::string& url) {
  const std::unique_ptr<CURLU, void (*)(CURLU*)> handle(curl_url(), curl_url_cleanup);
  if (!handle) return failure(kHttpErrorDomain, CURLE_OUT_OF_MEMORY, hostOf(url) + ": no memory for the address");
  if (url.find('\0') != std::string::npos) {
    return failure(kHttpErrorDomain, CURLE_URL_MALFORMAT, hostOf(url) + ": the address is malformed: it holds a zero");
  }
  if (const auto code = curl_url_set(handle.get(), CURLUPART_URL, url.c_str(), CURLU_NON_SUPPORT_SCHEME)) {
    return failure(kHttpErrorDomain, CURLE_URL_MALFORMAT,
                   hostOf(url) + ": the address is malformed: " + curl_url_strerror(code));
  }
  HttpAddress address{lowerCased(urlPart(handle.get(), CURLUPART_SCHEME)), urlPart(handle.get(), CURLUPART_HOST), {}};
  if (address.scheme != "http" && address.scheme != "https") {
    return failure(kHttpErrorDomain, CURLE_UNSUPPORTED_PROTOCOL,
                   hostOf(url) + ": addresses of the form \"" + address.scheme + ":\" are not spoken");
  }
  if (address.host.size() > 2 && address.host.front() == '[') {
    address.host = address.host.substr(1, address.host.size() - 2);
  }
  if (address.host.empty()) return failure(kHttpErrorDomain, CURLE_URL_MALFORMAT, "the address names no host");
  address.server = address.scheme + "://" + lowerCased(address.host) + ":" +
                   urlPart(handle.get(), CURLUPART_PORT, CURLU_DEFAULT_PORT);
  return address;
}

bool isHttpAddress(const std::string& url) { return parseHttpAddress(url).has_value(); }

CurlTask::CurlTask(std::shared_ptr<CurlSession> session, HttpRequest request, HttpAddress address)
    : _session(std::move(session)), _request(std::move(request)), _address(std::move(address)) {}

// A task that was never started must not keep its session from becoming invalid.
CurlTask::~CurlTask() {
  if (!_completed) _session->taskEnded();
}

void CurlTask::setTaskDescription(std::string description) {
  Guard guard(_lock);
  _description = std::move(description);
}

std::string CurlTask::taskDescription() const {
  Guard guard(_lock);
  return _description;
}

void CurlTask::resume() {
  if (_resumed.exchange(true)) return;
  if (_request.isUrgent) _deadline = std::chrono::steady_clock::now() + boundedTimeout(_request);
  _session->_engine->submit(shared_from_this());
}

Duration CurlTask::timeLeft(SteadyTime now) const noexcept {
  return _request.isUrgent ? std::max<Duration>(_deadline - now, Duration::zero()) : boundedTimeout(_request);
}

std::shared_ptr<const HttpResponse> CurlTask::response() const {
  Guard guard(_lock);
  return _response;
}

const HttpSessionConfiguration& CurlTask::configuration() const noexcept { return _session->_configuration; }

int CurlTask::bodyFile() const noexcept { return _request.bodyFile ? _request.bodyFile->file().get() : -1; }

std::int64_t CurlTask::bodyFileSize() const noexcept {
  return _request.bodyFile ? static_cast<std::int64_t>(_request.bodyFile->size()) : 0;
}

std::size_t CurlTask::maximumResponseBytes() const noexcept {
  const std::size_t configured = configuration().maximumResponseBytes;
  return std::min(configured, _request.maximumResponseBytes.value_or(configured));
}

void CurlTask::post(std::function<void(HttpSessionDelegate&, HttpSession&, HttpTask&)> call) {
  auto delegate = _session->delegate();
  if (!delegate) return;
  _session->_delegateQueue->async([self = shared_from_this(), delegate = std::move(delegate), call = std::move(call)] {
    call(*delegate, *self->_session, *self);
  });
}

void CurlTask::announceResponse(HttpResponse response) {
  {
    Guard guard(_lock);
    _response = std::make_shared<const HttpResponse>(std::move(response));
  }
  post([](HttpSessionDelegate& delegate, HttpSession& session, HttpTask& task) {
    delegate.didReceiveResponse(session, task);
  });
}

bool CurlTask::deliverData(std::span<const std::uint8_t> data) {
  {
    Guard guard(_lock);
    if (_undelivered > 0 && _undelivered + data.size() > kMaximumUndelivered) {
      _paused = true;
      return false;
    }
    _undelivered += data.size();
  }
  post([this, bytes = ByteData(data.begin(), data.end())](HttpSessionDelegate& delegate, HttpSession& session,
                                                          HttpTask& task) {
    delegate.didReceiveData(session, task, bytes);
    dataWasConsumed(bytes.size());
  });
  return true;
}

void CurlTask::dataWasConsumed(std::size_t size) {
  {
    Guard guard(_lock);
    _undelivered -= size;
    if (!_paused) return;
    _paused = false;
  }
  _session->_engine->unpause(shared_from_this());
}

void CurlTask::announceWaiting() {
  post([](HttpSessionDelegate& delegate, HttpSession& session, HttpTask& task) {
    delegate.taskIsWaitingForConnectivity(session, task);
  });
}

void CurlTask::reportBodyDataSent(std::int64_t sent, std::int64_t expected) {
  post([sent, expected](HttpSessionDelegate& delegate, HttpSession& session, HttpTask& task) {
    delegate.didSendBodyData(session, task, sent, expected);
  });
}

void CurlTask::complete(std::optional<Error> error) {
  if (_completed.exchange(true)) return;
  post([error = std::move(error)](HttpSessionDelegate& delegate, HttpSession& session, HttpTask& task) {
    delegate.didCompleteWithError(session, task, error);
  });
  _session->taskEnded();
}

CurlSession::CurlSession(std::shared_ptr<CurlEngine> engine, HttpSessionConfiguration configuration,
                         std::shared_ptr<HttpSessionDelegate> delegate, std::shared_ptr<Queue> delegateQueue)
    : _engine(std::move(engine)),
      _configuration(std::move(configuration)),
      _delegateQueue(std::move(delegateQueue)),
      _delegate(std::move(delegate)) {}

// The delegate's last reference never goes on the engine's thread.
CurlSession::~CurlSession() {
  if (_delegate) _delegateQueue->async([delegate = std::move(_delegate)] {});
}

void CurlSession::setSessionDescription(std::string description) {
  Guard guard(_lock);
  _description = std::move(description);
}

std::string CurlSession::sessionDescription() const {
  Guard guard(_lock);
  return _description;
}

Result<std::shared_ptr<HttpTask>> CurlSession::makeDataTask(HttpRequest request) {
  return makeTask(std::move(request));
}

Result<std::shared_ptr<HttpTask>> CurlSession::makeUploadTask(HttpRequest request, const std::string& bodyFilePath) {
  FileDescriptor file(::open(bodyFilePath.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
  struct stat status {};
  if (!file || ::fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) {
    return failure(kHttpErrorDomain, CURLE_READ_ERROR, "cannot read the file " + bodyFilePath);
  }
  request.body.reset();
  request.bodyFile = UnnamedFile::adopt(std::move(file), static_cast<std::uint64_t>(status.st_size));
  return makeTask(std::move(request));
}

Result<std::shared_ptr<HttpTask>> CurlSession::makeTask(HttpRequest request) {
  auto address = parseHttpAddress(request.url);
  if (!address) return Failure(address.error());
  if (auto error = unusable(request, *address)) return Failure(*std::move(error));
  {
    Guard guard(_lock);
    if (_invalidated) {
      return failure(kHttpErrorDomain, kHttpSessionInvalidatedCode, "the HTTP session has been invalidated");
    }
    ++_tasks;
  }
  return std::shared_ptr<HttpTask>(
      std::make_shared<CurlTask>(shared_from_this(), std::move(request), *std::move(address)));
}

void CurlSession::finishTasksAndInvalidate() {
  {
    Guard guard(_lock);
    if (std::exchange(_invalidated, true) || _tasks > 0) return;
  }
  announceInvalid();
}

void CurlSession::taskEnded() {
  {
    Guard guard(_lock);
    if (--_tasks > 0 || !_invalidated) return;
  }
  announceInvalid();
}

void CurlSession::announceInvalid() {
  std::shared_ptr<HttpSessionDelegate> delegate;
  {
    Guard guard(_lock);
    delegate.swap(_delegate);
  }
  if (!delegate) return;
  _delegateQueue->async([self = shared_from_this(), delegate = std::move(delegate)] {
    delegate->didBecomeInvalidWithError(*self, std::nullopt);
  });
}

std::shared_ptr<HttpSessionDelegate> CurlSession::delegate() const {
  Guard guard(_lock);
  return _delegate;
}

}  // namespace velk
