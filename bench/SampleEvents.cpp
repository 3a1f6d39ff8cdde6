#include "bench/SampleEvents.h"

#include <array>
#include <chrono>

namespace velk::bench {

namespace {

/// Spreads a sequence number over 64 bits, so that the values of neighbouring events differ as measured ones do.
std::uint64_t spread(std::uint64_t number) {
  number += 0x9e3779b97f4a7c15U;
  number = (number ^ (number >> 30)) * 0xbf58476d1ce4e5b9U;
  number = (number ^ (number >> 27)) * 0x94d049bb133111ebU;
  return number ^ (number >> 31);
}

constexpr std::array<const char*, 4> kRoutes{"/v1/items", "/v1/item", "/v1/cart", "/health"};
constexpr std::array<int, 4> kCodes{200, 200, 304, 404};

}  // namespace

double steadySeconds() {
  return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

PropertyDictionary samplePayload(std::uint32_t client, std::uint64_t sequence, double sentAt) {
  const std::uint64_t random = spread(sequence * 64 + client);
  PropertyDictionary payload;
  payload.reserve(12);
  payload.appendUnique("client", client);
  payload.appendUnique("sequence", sequence);
  payload.appendUnique("sentAt", sentAt);
  payload.appendUnique("route", kRoutes[random & 3]);
  payload.appendUnique("code", kCodes[(random >> 2) & 3]);
  payload.appendUnique("hit", ((random >> 4) & 7) == 0);
  payload.appendUnique("ms", static_cast<double>((random >> 8) % 100'000) / 64.0);
  payload.appendUnique("bytes", (random >> 25) % 65'536);
  payload.appendUnique("queue", (random >> 41) % 40);
  payload.appendUnique("load", static_cast<double>((random >> 46) % 512) / 128.0);
  payload.appendUnique("host", "n417");
  payload.appendUnique("zone", "eu");
  return payload;
}

PropertyDictionary sampleMessage(std::uint32_t client, std::uint64_t sequence, double sentAt) {
  PropertyDictionary message;
  message.reserve(4);
  message.appendUnique("ParametersCategory", kEventCategory);
  message.appendUnique("ParametersType", kEventType);
  message.appendUnique("ParametersPayload", samplePayload(client, sequence, sentAt));
  message.appendUnique("ParametersFlag", 0);
  return message;
}

PropertyDictionary sampleSessionInfo(std::uint32_t client) {
  constexpr std::uint32_t kFirstType = 20;
  constexpr std::uint32_t kTypes = 11;
  return {{"ComponentType", kFirstType + client % kTypes},
          {"ClientVersion", 3},
          {"SessionID", 1000 + client},
          {"BatchEvents", true}};
}

PropertyDictionary sampleUserInfo() { return {{"_clientName", "Bench"}, {"_serviceName", "pipeline"}}; }

}  // namespace velk::bench
