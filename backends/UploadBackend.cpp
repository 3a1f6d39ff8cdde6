#include "backends/UploadBackend.h"

#include <algorithm>
#include <utility>

#include "backends/LogTexts.h"
#include "foundation/Format.h"
#include "foundation/Text.h"
#include "platform/BlockingScope.h"
#include "platform/HandedFile.h"
#include "platform/Log.h"
#include "platform/Semaphore.h"

namespace velk {

namespace {

constexpr const char* kRequestFormat =
    "%@?uuid=%s&sequence=%u&description=%@%%20(Uploaded%%20by%%20Fenn)&filename=%@&raw=true";
constexpr std::string_view kDescription = "Vistra AFRC log";
constexpr std::string_view kTaken = "success";

/// What RFC 3986 allows in a query as it stands: the ampersand as well, which therefore ends a file's name for a server
/// that splits the query at it. The names have always been sent so.
bool isAllowedInQuery(char character) noexcept {
  const bool isLetter = (character >= 'a' && character <= 'z') || (character >= 'A' && character <= 'Z');
  const bool isDigit = character >= '0' && character <= '9';
  return isLetter || isDigit || std::string_view("-._~!$&'()*+,;=:@/?").find(character) != std::string_view::npos;
}

std::string escapedForQuery(std::string_view text) {
  constexpr std::string_view kDigits = "0123456789ABCDEF";
  std::string escaped;
  for (const char character : text) {
    if (isAllowedInQuery(character)) {
      escaped += character;
      continue;
    }
    const auto byte = static_cast<unsigned char>(character);
    escaped += '%';
    escaped += kDigits[byte >> 4];
    escaped += kDigits[byte & 15];
  }
  return escaped;
}

/// Without slashes at its end, what stands behind the last one; the root keeps its own.
std::string_view lastPathComponent(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  const auto slash = path.rfind('/');
  return slash == std::string_view::npos || path.size() == 1 ? path : path.substr(slash + 1);
}

/// The answer to one post. Shared with its completion, which may come when nobody waits any more.
struct Answer {
  Semaphore arrived;
  ByteData data;
  std::optional<Error> error = Error{kHttpErrorDomain, -1, "the transport has dropped the request"};
};

}  // namespace

std::shared_ptr<UploadBackend> UploadBackend::initWithName(const BackendContext& context, const std::string& name,
                                                           const PropertyValue& profile,
                                                           const std::optional<std::string>& productFamily) {
  const PropertyDictionary* section = profile.dictionary();
  const std::string* postURL = section != nullptr ? section->string("post_url") : nullptr;
  if (postURL == nullptr) {
    log::error(backend_texts::kNoUploadPostURL);
    return nullptr;
  }
  std::shared_ptr<UploadBackend> backend(new UploadBackend(context, name, profile, productFamily));
  backend->setUploadURL(*postURL);
  if (const std::string* displayURL = section->string("display_url")) backend->_displayURL = *displayURL;
  return backend;
}

std::optional<std::string> UploadBackend::uploadURL() const {
  Guard guard(_lock);
  return _uploadURL;
}

void UploadBackend::setUploadURL(std::optional<std::string> uploadURL) {
  Guard guard(_lock);
  _uploadURL.swap(uploadURL);
}

bool UploadBackend::uploadFileAtPath(FileUpload& upload) {
  log::standard(backend_texts::kUploadingFile, upload.path);
  const auto address = uploadURL();
  if (!address) return false;
  CompressedFile body;
  {
    // Reading may wait for a disk or a network, and compressing takes seconds: others need not wait for it.
    BlockingScope blocking;
    const auto size = sizeOfRegularFile(upload.file);
    if (!size) {
      log::standard(backend_texts::kNotARegularFile);
      return false;
    }
    if (*size > kMaximumFileBytes) {
      log::error(backend_texts::kUploadTooLarge, *size, kMaximumFileBytes);
      return false;
    }
    body = gzipFile(upload, *size, _context.largeFilesDirectory, _context.uploads);
  }
  if (body.outcome == CompressedFile::Outcome::nothingToRead) log::standard(backend_texts::kInputFileIsEmpty);
  if (body.outcome != CompressedFile::Outcome::compressed) return false;
  std::string requestURL = requestAddress(*address, upload.path);
  if (!isHttpAddress(requestURL)) {
    log::standard(backend_texts::kNoUploadRequest);
    return false;
  }
  if (const auto sender = transport()) {
    upload.isDelivered = postAndWait(*sender, makeRequest(std::move(requestURL), body), *address);
  }
  return true;
}

std::string UploadBackend::requestAddress(const std::string& uploadURL, const std::string& path) const {
  const std::string name = std::string(lastPathComponent(path)) + ".gz";
  return formatText(kRequestFormat,
                    {uploadURL, _udid, _sessionID, escapedForQuery(kDescription), escapedForQuery(name)});
}

HttpRequest UploadBackend::makeRequest(std::string address, const CompressedFile& body) const {
  HttpRequest request;
  request.url = std::move(address);
  request.method = "POST";
  request.body = body.inMemory;
  request.bodyFile = body.onDisk;
  request.timeout = timeoutFor(body.size());
  request.maximumResponseBytes = kMaximumAnswerBytes;
  request.isBulk = true;
  // The address as the signed storebag has it.
  request.requiresHttps = false;
  request.setHeader("Content-Type", "application/octet-stream");
  request.setHeader("Content-Encoding", "gzip");
  return request;
}

Duration UploadBackend::timeoutFor(std::uint64_t bodyBytes) {
  constexpr std::uint64_t kOrdinarySeconds = 60;
  constexpr std::uint64_t kLongestSeconds = 3600;
  constexpr std::uint64_t kSlowestBytesASecond = 128 * 1024;
  return std::chrono::seconds(std::min(kOrdinarySeconds + bodyBytes / kSlowestBytesASecond, kLongestSeconds));
}

bool UploadBackend::postAndWait(ReportingSessionConnectivityInterface& transport, HttpRequest request,
                                const std::string& uploadURL) {
  const auto answer = std::make_shared<Answer>();
  transport.postURLRequestWithCompletionHandler(
      std::move(request),
      HttpCompletion(
          [answer](ByteData data, const std::shared_ptr<const HttpResponse>&, std::optional<Error> error) {
            answer->data = std::move(data);
            answer->error = std::move(error);
            answer->arrived.signal();
          },
          [answer] { answer->arrived.signal(); }));
  // Without a limit of its own: the transport ends every request, at the latest by its timeout.
  answer->arrived.wait();
  if (answer->error && answer->data.empty()) {
    log::error(backend_texts::kUploadPostFailed, *answer->error);
    return false;
  }
  std::optional<std::string> text(std::in_place, answer->data.begin(), answer->data.end());
  if (!isUtf8(*text)) text.reset();
  const bool isTaken = text && text->find(kTaken) != std::string::npos;
  log::standard(backend_texts::kUploadAnswered, uploadURL, text);
  return isTaken;
}

}  // namespace velk
