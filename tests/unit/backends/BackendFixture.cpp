#include "tests/unit/backends/BackendFixture.h"

#include <zlib.h>

#include <array>

#include "foundation/Json.h"

namespace velk::test {

std::optional<std::string> inflated(std::string_view bytes) {
  z_stream stream{};
  if (inflateInit2(&stream, 15 + 32) != Z_OK) return std::nullopt;
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(bytes.data()));
  stream.avail_in = static_cast<uInt>(bytes.size());
  std::string out;
  std::array<char, 4096> buffer{};
  int result = Z_OK;
  while (result == Z_OK) {
    stream.next_out = reinterpret_cast<Bytef*>(buffer.data());
    stream.avail_out = buffer.size();
    result = inflate(&stream, Z_NO_FLUSH);
    out.append(buffer.data(), buffer.size() - stream.avail_out);
  }
  inflateEnd(&stream);
  return result == Z_STREAM_END ? std::optional(out) : std::nullopt;
}

std::string jsonOf(const HttpRequest& request) {
  if (headerOf(request, "Content-Encoding") != "gzip") return *request.body;
  return inflated(*request.body).value_or("(damaged)");
}

PropertyDictionary bodyOf(const HttpRequest& request) {
  const auto parsed = json::parse(jsonOf(request));
  return parsed && parsed->dictionary() != nullptr ? *parsed->dictionary() : PropertyDictionary();
}

std::vector<PropertyDictionary> eventsOf(const HttpRequest& request) {
  std::vector<PropertyDictionary> events;
  const PropertyDictionary body = bodyOf(request);
  if (const PropertyArray* array = body.array("events")) {
    for (const auto& event : *array) events.push_back(*event.dictionary());
  }
  return events;
}

std::optional<std::string> headerOf(const HttpRequest& request, std::string_view name) {
  for (const auto& header : request.headers) {
    if (header.first == name) return header.second;
  }
  return std::nullopt;
}

BackendTest::BackendTest() = default;
BackendTest::~BackendTest() = default;

PropertyDictionary BackendTest::openEntry() {
  return {{"locale_whitelist", PropertyArray{"US"}},
          {"filters", PropertyArray{}},
          {"sampling_threshold", 1.0},
          {"post_url", "https://collector.example/events"}};
}

PropertyDictionary BackendTest::profileWith(PropertyArray clients) {
  return {{"clients", std::move(clients)}, {"display_url", "https://display.example/"}};
}

PropertyDictionary BackendTest::userInfo(const char* client, const char* service) {
  return {{"_clientName", client}, {"_serviceName", service}};
}

std::shared_ptr<VelkReportingBackend> BackendTest::make(const std::string& name, const PropertyValue& profile) {
  return newBackendWithName(context, name, profile, "Lamp", 20);
}

std::shared_ptr<HTTPSPostBackend> BackendTest::makePost(const PropertyDictionary& entry) {
  return makePostWith(PropertyArray{entry});
}

std::shared_ptr<HTTPSPostBackend> BackendTest::makePostWith(PropertyArray clients) {
  auto backend = HTTPSPostBackend::initWithName(context, "korrin", profileWith(std::move(clients)), "Lamp");
  if (!backend) return nullptr;
  backend->setSessionID(4242);
  backend->setCompType(20);
  backend->setClientVersion(12);
  backend->setUdid("0123456789abcdef0123456789abcdef01234567");
  backend->setProductVersion("10.2");
  backend->setBuildVersion("B77");
  backend->setHardwareType("Lamp9,1");
  backend->setIsInternal(isInternal);
  backend->setRequireUserInfo(true);
  backend->setBatchEvents(false);
  backend->setUserInfoDict(userInfo());
  backend->setSelfVersion("8.0");
  backend->setStartTimestamp(kStart);
  backend->setReportingSessionConnectivityDelegate(transport);
  backend->setCorrelatedSessionID("c2Vzc2lvbg==");
  return backend;
}

std::shared_ptr<HTTPSPostBackend> BackendTest::makeConfigured(const PropertyDictionary& entry) {
  auto backend = makePost(entry);
  backend->updateState();
  return backend;
}

std::shared_ptr<HTTPSPostBackend> BackendTest::makeBatching(const PropertyDictionary& entry) {
  auto backend = makeConfigured(entry);
  backend->setBatchEvents(true);
  return backend;
}

std::optional<std::string> BackendTest::send(VelkReportingBackend& backend, const PropertyDictionary& payload,
                                             std::uint16_t method, std::uint16_t type, std::uint32_t flag) {
  return backend.sendMessage(PropertyDictionary{{"ClientData", payload}}, platform.clock.wallTime(), method, type,
                             flag);
}

void BackendTest::sendMany(VelkReportingBackend& backend, int count, std::uint16_t method) {
  for (int number = 0; number < count; ++number) send(backend, {{"n", number}}, method);
}

PropertyDictionary BackendTest::onlyEvent() const {
  EXPECT_EQ(transport->count(), 1U);
  if (transport->count() != 1) return {};
  const auto events = eventsOf(transport->request(0));
  EXPECT_EQ(events.size(), 1U);
  return events.empty() ? PropertyDictionary() : events.front();
}

}  // namespace velk::test
