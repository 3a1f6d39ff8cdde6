#include "backends/PostRequest.h"

#include <span>
#include <utility>

#include "device/DeviceEnvironment.h"
#include "foundation/Format.h"
#include "foundation/Text.h"
#include "ipc/Vocabulary.h"
#include "platform/Cryptography.h"

namespace velk {

namespace {

constexpr std::string_view kSchemeSeparator = "://";
constexpr std::size_t kSessionIDLength = 40;
constexpr std::size_t kMostHeaders = 13;

/// The headers in the order in which they are sent. Their names are all different: nothing needs looking up.
class Headers {
 public:
  explicit Headers(HttpRequest& request) : _headers(request.headers) { _headers.reserve(kMostHeaders); }
  void add(const char* name, std::string value) { _headers.emplace_back(name, std::move(value)); }
  void addText(const char* name, const PropertyValue* value) {
    if (value == nullptr) return;
    add(name, value->string() != nullptr ? *value->string() : description(value));
  }

 private:
  std::vector<std::pair<std::string, std::string>>& _headers;
};

std::span<const std::uint8_t> bytesOf(const std::string& text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

std::string userAgent(const PostDescription& post) {
  return formatText("VelkReporting/%d.%d%@ (%@; %@)",
                    {post.selfVersion.major, post.selfVersion.middle, post.selfVersion.minorSuffix(), post.hardwareType,
                     post.productVersion});
}

void addIdentity(const PostDescription& post, Headers& headers) {
  if (post.userInfo != nullptr) {
    headers.addText("X-Velk-Client-Name", post.userInfo->find(kVelkReportingUserInfoClientName));
    headers.addText("X-Velk-Service-Name", post.userInfo->find(kVelkReportingUserInfoServiceName));
  }
  if (post.isInternal) headers.add("X-Velk-Internal-Build", "1");
  headers.add("User-Agent", userAgent(post));
  headers.add("X-Velk-Client-Version", std::to_string(post.clientVersion));
  headers.add("X-Velk-Sender", std::string(componentShortCode(post.compType)));
  if (post.method && post.respCode) {
    headers.add("X-Velk-Event-Map", std::to_string(*post.method) + " " + std::to_string(*post.respCode));
  }
}

void addContent(const PostDescription& post, Headers& headers) {
  headers.add("Accept", "application/json");
  headers.add("Content-Type", "application/json");
  headers.add("Content-Length", std::to_string(post.body->size()));
  if (post.isCompressed) headers.add("Content-Encoding", "gzip");
  if (post.sessionID != nullptr) headers.add("X-Velk-Session-ID", post.sessionID->substr(0, kSessionIDLength));
  if (post.digestKey != nullptr) {
    headers.add("X-Velk-DIGEST", hexadecimal(hmacSha1(*post.digestKey, bytesOf(*post.json))));
  }
}

}  // namespace

std::string addressWithHttps(std::string_view url) {
  const std::size_t end = url.find(kSchemeSeparator);
  if (end == std::string_view::npos || equalsIgnoringCase(url.substr(0, end), "https")) return std::string(url);
  const std::string_view rest = url.substr(end + kSchemeSeparator.size());
  return "https" + std::string(kSchemeSeparator) + std::string(rest.substr(0, rest.find(kSchemeSeparator)));
}

HttpRequest makePostRequest(const PostDescription& post) {
  HttpRequest request;
  request.url = post.isInternal ? post.url : addressWithHttps(post.url);
  request.method = "POST";
  request.body = post.body;
  request.allowsCellularAccess = !post.wifiOnly;
  request.requiresHttps = !post.isInternal;
  request.discardsResponseBody = true;
  Headers headers(request);
  addIdentity(post, headers);
  addContent(post, headers);
  return request;
}

}  // namespace velk
