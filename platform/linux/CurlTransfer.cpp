#include "platform/linux/CurlTransfer.h"

#include <netinet/in.h>
#include <netinet/ip.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <limits>
#include <system_error>

#include "foundation/Text.h"

namespace velk {
namespace {

constexpr std::size_t kMaximumHeadBytes = 256 * 1024;
constexpr std::size_t kMaximumHeaders = 512;
constexpr long kConnectionAgeSeconds = 60;
constexpr curl_off_t kProgressStep = 1024 * 1024;
constexpr int kBackgroundServiceType = 3;
/// No callback takes this many bytes: the library ends the transfer.
constexpr std::size_t kEndTransfer = std::numeric_limits<std::size_t>::max();
/// The class of traffic that gives way to all other (RFC 8622's predecessor, CS1).
constexpr int kBackgroundTypeOfService = 0x20;

/// So much of an answer that is discarded is read, which keeps its connection for the next request.
constexpr std::size_t kMaximumDiscardedBytes = 64 * 1024;

long milliseconds(Duration duration) {
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(duration).count();
  return static_cast<long>(std::clamp<std::int64_t>(left, 1, std::numeric_limits<int>::max()));
}

/// Without control characters, and without blanks at the ends, which mean nothing.
std::string sanitised(std::string_view value) {
  std::string clean;
  clean.reserve(value.size());
  std::copy_if(value.begin(), value.end(), std::back_inserter(clean),
               [](char c) { return static_cast<unsigned char>(c) >= 0x20 && static_cast<unsigned char>(c) != 0x7f; });
  const auto first = clean.find_first_not_of(' ');
  if (first == std::string::npos) return {};
  return clean.substr(first, clean.find_last_not_of(' ') - first + 1);
}

/// Headers that say where the body ends are the library's own business.
bool isFraming(std::string_view name) {
  return equalsIgnoringCase(name, "Content-Length") || equalsIgnoringCase(name, "Transfer-Encoding") ||
         equalsIgnoringCase(name, "Expect");
}

/// The system has no more to give; a family of addresses that it does not know is another matter.
bool isScarcity(int error) { return error == EMFILE || error == ENFILE || error == ENOMEM || error == ENOBUFS; }

std::string_view trimmed(std::string_view text) {
  constexpr std::string_view kBlanks = " \t\r\n";
  const auto first = text.find_first_not_of(kBlanks);
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(kBlanks) - first + 1);
}

}  // namespace

CurlTransfer::CurlTransfer(std::shared_ptr<CurlTask> task, CURL* easy) : _task(std::move(task)), _easy(easy) {}

CurlTransfer::~CurlTransfer() { curl_slist_free_all(_headers); }

bool CurlTransfer::configure(const HttpTrust& trust, SteadyTime now) {
  configureConnection(trust, now);
  configureCallbacks();
  configureBody();
  configureHeaders();
  return _configured;
}

void CurlTransfer::configureConnection(const HttpTrust& trust, SteadyTime now) {
  const auto& request = _task->request();
  set(CURLOPT_URL, request.url.c_str());
  set(CURLOPT_PRIVATE, static_cast<void*>(this));
  set(CURLOPT_PROTOCOLS_STR, request.requiresHttps ? "https" : "http,https");
  set(CURLOPT_FOLLOWLOCATION, 0L);
  set(CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_2TLS));
  set(CURLOPT_SSLVERSION, static_cast<long>(CURL_SSLVERSION_TLSv1_2));
  set(CURLOPT_SSL_VERIFYPEER, 1L);
  set(CURLOPT_SSL_VERIFYHOST, 2L);
  set(CURLOPT_PROXY_SSLVERSION, static_cast<long>(CURL_SSLVERSION_TLSv1_2));
  // An empty file means that the directory alone is believed: its certificates are read one by one when needed.
  const char* caFile = trust.caFile.empty() ? nullptr : trust.caFile.c_str();
  const char* caDirectory = trust.caDirectory.empty() ? nullptr : trust.caDirectory.c_str();
  set(CURLOPT_CAINFO, caFile);
  set(CURLOPT_CAPATH, caDirectory);
  set(CURLOPT_PROXY_CAINFO, caFile);
  set(CURLOPT_PROXY_CAPATH, caDirectory);
  set(CURLOPT_NOSIGNAL, 1L);
  // A name server that does not answer must not hold the thread up when its request ends.
  set(CURLOPT_QUICK_EXIT, 1L);
  set(CURLOPT_MAXAGE_CONN, kConnectionAgeSeconds);
  const long timeout = milliseconds(_task->timeLeft(now));
  set(CURLOPT_TIMEOUT_MS, timeout);
  set(CURLOPT_CONNECTTIMEOUT_MS, timeout);
  if (!request.discardsResponseBody)
    set(CURLOPT_MAXFILESIZE_LARGE, static_cast<curl_off_t>(_task->maximumResponseBytes()));
}

void CurlTransfer::configureCallbacks() {
  set(CURLOPT_ERRORBUFFER, _errorText);
  set(CURLOPT_SUPPRESS_CONNECT_HEADERS, 1L);
  set(CURLOPT_HEADERFUNCTION, &CurlTransfer::onHeader);
  set(CURLOPT_HEADERDATA, static_cast<void*>(this));
  set(CURLOPT_WRITEFUNCTION, &CurlTransfer::onData);
  set(CURLOPT_WRITEDATA, static_cast<void*>(this));
  set(CURLOPT_OPENSOCKETFUNCTION, &CurlTransfer::onOpenSocket);
  set(CURLOPT_OPENSOCKETDATA, static_cast<void*>(this));
  if (_task->configuration().networkServiceType == kBackgroundServiceType) {
    set(CURLOPT_SOCKOPTFUNCTION, &CurlTransfer::onSocket);
    set(CURLOPT_FRESH_CONNECT, 1L);
    set(CURLOPT_FORBID_REUSE, 1L);
  }
}

void CurlTransfer::configureBody() {
  const auto& request = _task->request();
  const bool hasBody = request.body != nullptr || _task->bodyFile() >= 0;
  if (request.method == "HEAD") {
    set(CURLOPT_NOBODY, 1L);
  } else if (request.method == "POST" || hasBody) {
    set(CURLOPT_POST, 1L);
    if (_task->bodyFile() >= 0) {
      set(CURLOPT_READFUNCTION, &CurlTransfer::onRead);
      set(CURLOPT_READDATA, static_cast<void*>(this));
      set(CURLOPT_SEEKFUNCTION, &CurlTransfer::onSeek);
      set(CURLOPT_SEEKDATA, static_cast<void*>(this));
      set(CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(_task->bodyFileSize()));
    } else {
      set(CURLOPT_POSTFIELDS, hasBody ? request.body->data() : "");
      set(CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(hasBody ? request.body->size() : 0));
    }
    set(CURLOPT_NOPROGRESS, 0L);
    set(CURLOPT_XFERINFOFUNCTION, &CurlTransfer::onProgress);
    set(CURLOPT_XFERINFODATA, static_cast<void*>(this));
    if (request.method != "POST") set(CURLOPT_CUSTOMREQUEST, request.method.c_str());
  } else if (request.method != "GET") {
    set(CURLOPT_CUSTOMREQUEST, request.method.c_str());
  }
}

void CurlTransfer::configureHeaders() {
  bool hasContentType = false;
  for (const auto& [name, value] : _task->request().headers) {
    if (isFraming(name)) continue;
    hasContentType = hasContentType || equalsIgnoringCase(name, "Content-Type");
    const auto clean = sanitised(value);
    addHeader(clean.empty() ? name + ";" : name + ": " + clean);
  }
  // What the library would add by itself and nobody asked for.
  addHeader("Expect:");
  if (!hasContentType) addHeader("Content-Type:");
  set(CURLOPT_HTTPHEADER, _headers);
}

void CurlTransfer::addHeader(const std::string& line) {
  auto* longer = curl_slist_append(_headers, line.c_str());
  if (longer == nullptr) {
    _configured = false;
  } else {
    _headers = longer;
  }
}

std::size_t CurlTransfer::onHeader(char* data, std::size_t size, std::size_t count, void* self) {
  return static_cast<CurlTransfer*>(self)->headerReceived({data, size * count});
}

std::size_t CurlTransfer::onData(char* data, std::size_t size, std::size_t count, void* self) {
  return static_cast<CurlTransfer*>(self)->dataReceived({reinterpret_cast<const std::uint8_t*>(data), size * count});
}

// Returns how much was taken: anything but the line's size ends the transfer.
std::size_t CurlTransfer::headerReceived(std::string_view line) {
  if (_announced) return line.size();
  _headBytes += line.size();
  if (_headBytes > kMaximumHeadBytes || _response.headers.size() >= kMaximumHeaders) {
    return refuse(CURLE_WEIRD_SERVER_REPLY, "the answer's headers are too long");
  }
  if (line.substr(0, 5) == "HTTP/") {
    _response = {};
  } else if (const auto text = trimmed(line); text.empty()) {
    headEnded();
  } else if (const auto colon = text.find(':'); colon != std::string_view::npos) {
    _response.headers.emplace_back(trimmed(text.substr(0, colon)), trimmed(text.substr(colon + 1)));
  }
  return line.size();
}

// Interim answers are not announced.
void CurlTransfer::headEnded() {
  long status = 0;
  curl_easy_getinfo(_easy, CURLINFO_RESPONSE_CODE, &status);
  if (status < 200) return;
  _announced = true;
  _response.statusCode = static_cast<int>(status);
  _task->announceResponse(std::move(_response));
}

std::size_t CurlTransfer::dataReceived(std::span<const std::uint8_t> data) {
  if (_task->request().discardsResponseBody) {
    _bodyBytes += data.size();
    return _bodyBytes <= kMaximumDiscardedBytes ? data.size() : kEndTransfer;
  }
  if (_bodyBytes + data.size() > _task->maximumResponseBytes()) {
    return refuse(CURLE_FILESIZE_EXCEEDED, "the answer is longer than allowed");
  }
  if (!_task->deliverData(data)) return CURL_WRITEFUNC_PAUSE;
  _bodyBytes += data.size();
  return data.size();
}

std::size_t CurlTransfer::refuse(CURLcode code, const char* why) {
  _refusal = Error{kHttpErrorDomain, code, _task->address().host + ": " + why};
  return kEndTransfer;
}

std::size_t CurlTransfer::onRead(char* buffer, std::size_t size, std::size_t count, void* self) {
  auto& transfer = *static_cast<CurlTransfer*>(self);
  const auto left = transfer._task->bodyFileSize() - transfer._bodyFileOffset;
  const auto wanted = std::min<std::size_t>(size * count, static_cast<std::size_t>(std::max<std::int64_t>(left, 0)));
  const auto got = ::pread(transfer._task->bodyFile(), buffer, wanted, transfer._bodyFileOffset);
  // A file that ends before its size would leave the server waiting for the rest.
  if (got < 0 || (got == 0 && wanted > 0)) return CURL_READFUNC_ABORT;
  transfer._bodyFileOffset += got;
  return static_cast<std::size_t>(got);
}

int CurlTransfer::onSeek(void* self, curl_off_t offset, int origin) {
  if (origin != SEEK_SET) return CURL_SEEKFUNC_CANTSEEK;
  static_cast<CurlTransfer*>(self)->_bodyFileOffset = offset;
  return CURL_SEEKFUNC_OK;
}

int CurlTransfer::onProgress(void* self, curl_off_t, curl_off_t, curl_off_t toSend, curl_off_t sent) {
  auto& transfer = *static_cast<CurlTransfer*>(self);
  if (sent <= transfer._reportedSent) return 0;
  if (sent < toSend && sent - transfer._reportedSent < kProgressStep) return 0;
  transfer._reportedSent = sent;
  transfer._task->reportBodyDataSent(sent, toSend);
  return 0;
}

curl_socket_t CurlTransfer::onOpenSocket(void* self, curlsocktype, curl_sockaddr* address) {
  const int socket = ::socket(address->family, address->socktype | SOCK_CLOEXEC, address->protocol);
  if (socket < 0 && isScarcity(errno)) static_cast<CurlTransfer*>(self)->_socketError = errno;
  return socket < 0 ? CURL_SOCKET_BAD : socket;
}

// Best effort: a system that refuses sends with the usual class.
int CurlTransfer::onSocket(void*, curl_socket_t socket, curlsocktype) {
  const int service = kBackgroundTypeOfService;
  ::setsockopt(socket, IPPROTO_IP, IP_TOS, &service, sizeof service);
  ::setsockopt(socket, IPPROTO_IPV6, IPV6_TCLASS, &service, sizeof service);
  return CURL_SOCKOPT_OK;
}

// Of an answer that is discarded nothing matters behind the status.
std::optional<Error> CurlTransfer::error(CURLcode code) const {
  if (_refusal) return _refusal;
  if (code == CURLE_OK || (_announced && _task->request().discardsResponseBody)) return std::nullopt;
  std::string text = _task->address().host + ": " + (_errorText[0] != '\0' ? _errorText : curl_easy_strerror(code));
  if (_socketError != 0 && code == CURLE_COULDNT_CONNECT)
    text += ": no socket: " + std::generic_category().message(_socketError);
  return Error{kHttpErrorDomain, code, std::move(text)};
}

CurlTransfer::LacksRoute CurlTransfer::lacksRoute(CURLcode code) const {
  if (_announced || _socketError != 0 || _task->address().isLoopback()) return LacksRoute::no;
  if (code == CURLE_COULDNT_RESOLVE_HOST || code == CURLE_COULDNT_RESOLVE_PROXY) {
    return LacksRoute::ifThereIsNoDefaultRoute;
  }
  if (code == CURLE_OPERATION_TIMEDOUT) {
    // No name server answered.
    curl_off_t nameTime = 0;
    long sent = 0;
    curl_easy_getinfo(_easy, CURLINFO_NAMELOOKUP_TIME_T, &nameTime);
    curl_easy_getinfo(_easy, CURLINFO_REQUEST_SIZE, &sent);
    return nameTime == 0 && sent == 0 ? LacksRoute::ifThereIsNoDefaultRoute : LacksRoute::no;
  }
  if (code != CURLE_COULDNT_CONNECT) return LacksRoute::no;
  long number = 0;
  curl_easy_getinfo(_easy, CURLINFO_OS_ERRNO, &number);
  if (number == ENETUNREACH || number == ENETDOWN) return LacksRoute::yes;
  return number == EHOSTUNREACH ? LacksRoute::ifThereIsNoDefaultRoute : LacksRoute::no;
}

}  // namespace velk
