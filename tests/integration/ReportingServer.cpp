#include <algorithm>
#include <stdexcept>

#include "foundation/Base64.h"
#include "foundation/Json.h"
#include "platform/Cryptography.h"
#include "platform/PropertyList.h"
#include "tests/integration/Daemon.h"

namespace velk::test {

namespace {

constexpr std::string_view kStorebagPath = "/bags/vindle/";

std::string textOf(const ByteData& bytes) { return {bytes.begin(), bytes.end()}; }

}  // namespace

ReportingServer::ReportingServer(bool listens) : _server(true, listens) {
  auto pair = generateRsaKeyPair(2048);
  if (!pair) throw std::runtime_error(pair.error().description);
  _privateKey = pair->privateKeyPem;
  _publicKey = pair->publicKeyDer;
  _server.setHandler([this](const TlsTestServer::Request& request) { return answer(request); });
}

std::string ReportingServer::signedEnvelope(const PropertyDictionary& bag) const {
  const auto bytes = propertylist::serialize(bag, propertylist::Form::binary);
  if (!bytes) throw std::runtime_error(bytes.error().description);
  const auto signature = signSha1Digest(_privateKey, sha1(*bytes));
  if (!signature) throw std::runtime_error(signature.error().description);
  const auto envelope = propertylist::serialize(
      PropertyDictionary{{"signature", base64Encoded(*signature)}, {"bag", base64Encoded(*bytes)}},
      propertylist::Form::xml);
  if (!envelope) throw std::runtime_error(envelope.error().description);
  return textOf(*envelope);
}

void ReportingServer::setStorebag(const std::string& name, const PropertyDictionary& bag,
                                  std::vector<std::pair<std::string, std::string>> headers) {
  TlsTestServer::Response response;
  response.body = signedEnvelope(bag);
  response.headers = std::move(headers);
  Guard guard(_lock);
  _storebags[name] = std::move(response);
}

void ReportingServer::setRawStorebag(const std::string& name, std::string bytes) {
  TlsTestServer::Response response;
  response.body = std::move(bytes);
  setStorebagAnswer(name, std::move(response));
}

void ReportingServer::setStorebagAnswer(const std::string& name, TlsTestServer::Response answer) {
  Guard guard(_lock);
  _storebags[name] = std::move(answer);
}

std::string ReportingServer::servedStorebag(const std::string& name) const {
  Guard guard(_lock);
  const auto found = _storebags.find(name);
  return found == _storebags.end() ? std::string() : found->second.body;
}

void ReportingServer::setStorebagDelay(Duration delay) {
  Guard guard(_lock);
  _storebagDelay = delay;
}

void ReportingServer::setStorebagStatus(int status) {
  Guard guard(_lock);
  _storebagStatus = status;
}

void ReportingServer::setPostResponse(TlsTestServer::Response response) {
  Guard guard(_lock);
  _postResponse = std::move(response);
}

TlsTestServer::Response ReportingServer::answer(const TlsTestServer::Request& request) {
  if (request.method == "GET" && request.target.compare(0, kStorebagPath.size(), kStorebagPath) == 0) {
    const std::string rest = request.target.substr(kStorebagPath.size());
    return answerStorebag(rest.substr(0, rest.find('?')));
  }
  take(request);
  Guard guard(_lock);
  return _postResponse;
}

TlsTestServer::Response ReportingServer::answerStorebag(const std::string& name) {
  Guard guard(_lock);
  ++_storebagRequests[name];
  _changed.notifyAll();
  TlsTestServer::Response response;
  const auto found = _storebags.find(name);
  if (_storebagStatus.value_or(200) != 200) {
    response.status = *_storebagStatus;
  } else if (found == _storebags.end()) {
    response.status = 404;
  } else {
    response = found->second;
  }
  response.delay = _storebagDelay;
  return response;
}

void ReportingServer::take(const TlsTestServer::Request& request) {
  const std::string* encoding = request.header("Content-Encoding");
  const bool isGzip = encoding != nullptr && *encoding == "gzip";
  const auto body = json::parse(isGzip ? TlsTestServer::gunzip(request.body) : request.body);
  Post post{request, {}};
  if (body && body->dictionary() != nullptr) post.body = *body->dictionary();
  Guard guard(_lock);
  _posts.push_back(std::move(post));
  _changed.notifyAll();
}

std::vector<ReportingServer::Post> ReportingServer::posts() const {
  Guard guard(_lock);
  return _posts;
}

std::vector<PropertyDictionary> ReportingServer::events() const {
  std::vector<PropertyDictionary> events;
  for (const auto& post : posts()) {
    const PropertyArray* list = post.body.array("events");
    if (list == nullptr) continue;
    for (const auto& event : *list) {
      if (event.dictionary() != nullptr) events.push_back(*event.dictionary());
    }
  }
  return events;
}

bool ReportingServer::waitForEvents(std::size_t count, const std::vector<int>& methods,
                                    std::chrono::milliseconds patience) const {
  const auto deadline = std::chrono::steady_clock::now() + patience;
  const auto arrived = [&] {
    std::size_t found = 0;
    for (const auto& event : events()) {
      const auto method = integerValue(event.find("_method"));
      found += methods.empty() || std::find(methods.begin(), methods.end(), method) != methods.end() ? 1 : 0;
    }
    return found;
  };
  for (;;) {
    std::size_t before = 0;
    {
      Guard guard(_lock);
      before = _posts.size();
    }
    if (arrived() >= count) return true;
    Guard guard(_lock);
    while (_posts.size() == before) {
      if (!_changed.waitUntil(_lock, deadline) && _posts.size() == before) return false;
    }
  }
}

bool ReportingServer::waitForPosts(std::size_t count, std::chrono::milliseconds patience) const {
  const auto deadline = std::chrono::steady_clock::now() + patience;
  Guard guard(_lock);
  while (_posts.size() < count) {
    if (!_changed.waitUntil(_lock, deadline)) return _posts.size() >= count;
  }
  return true;
}

std::size_t ReportingServer::storebagRequests(const std::string& name) const {
  Guard guard(_lock);
  const auto found = _storebagRequests.find(name);
  return found == _storebagRequests.end() ? 0 : found->second;
}

PropertyDictionary simpleStorebag(const std::string& postUrl) {
  const PropertyDictionary client{{"locale_whitelist", PropertyArray{"US"}},
                                  {"filters", PropertyArray{}},
                                  {"sampling_threshold", 1.0},
                                  {"post_url", postUrl}};
  const PropertyDictionary section{{"splunk", PropertyDictionary{{"clients", PropertyArray{client}}}}};
  return {{"version", "1.0.0-test"}, {"refresh_cycle", 600}, {"seed", section}, {"release", section}};
}

void setInClientEntry(PropertyDictionary& bag, std::string_view key, const PropertyValue& value,
                      std::string_view backend) {
  for (const char* environment : {"seed", "release"}) {
    PropertyDictionary& section = *bag.findMutable(environment)->dictionary();
    PropertyDictionary& profile = *section.findMutable(backend)->dictionary();
    profile.findMutable("clients")->array()->mutableAt(0).dictionary()->set(key, value);
  }
}

}  // namespace velk::test
