// What each step on an event's way costs by itself. README.md says how to run it.
#include <benchmark/benchmark.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "backends/Compression.h"
#include "backends/EventBuilder.h"
#include "backends/EventFilter.h"
#include "backends/MacroExpansion.h"
#include "bench/SampleEvents.h"
#include "daemon/StorebagEnvelope.h"
#include "foundation/Base64.h"
#include "foundation/Json.h"
#include "ipc/CborReader.h"
#include "ipc/CborWriter.h"
#include "ipc/Limits.h"
#include "ipc/MethodTable.h"
#include "platform/Cryptography.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"

namespace velk::bench {
namespace {

constexpr double kStart = 1'795'000'000.25;
constexpr std::size_t kBatch = 51;

void encodeEvent(std::vector<std::uint8_t>& bytes, const PropertyDictionary& message) {
  CborWriter writer(bytes, ipc::kMaximumFrameBytes);
  writer.beginArray(2);
  writer.unsignedInteger(static_cast<std::uint32_t>(Method::sendMessageWithDictionary));
  writer.value(message);
}

void CborEncode(benchmark::State& state) {
  const auto message = sampleMessage(1, 4711, 1234.5);
  std::vector<std::uint8_t> bytes;
  for (auto _ : state) {
    bytes.clear();
    encodeEvent(bytes, message);
    benchmark::DoNotOptimize(bytes.data());
  }
  state.counters["bytes"] = static_cast<double>(bytes.size());
}
BENCHMARK(CborEncode);

void CborDecode(benchmark::State& state) {
  std::vector<std::uint8_t> bytes;
  encodeEvent(bytes, sampleMessage(1, 4711, 1234.5));
  for (auto _ : state) {
    CborReader reader(bytes);
    std::size_t count = 0;
    std::uint64_t method = 0;
    PropertyValue message;
    const bool read = reader.readArrayHead(count) && reader.readUnsigned(method) && reader.readValue(message);
    if (!read || !reader.readEnd()) state.SkipWithError("the event cannot be read back");
    benchmark::DoNotOptimize(message);
  }
}
BENCHMARK(CborDecode);

/// What the host process does before it calls: for comparison.
void MakeMessage(benchmark::State& state) {
  std::uint64_t number = 0;
  for (auto _ : state) benchmark::DoNotOptimize(sampleMessage(1, ++number, 1234.5));
}
BENCHMARK(MakeMessage);

/// What a backend knows of its session.
struct Session {
  std::optional<std::string> productFamily = "Server";
  std::optional<std::string> hardwareType = "Server1,1";
  std::optional<std::string> productVersion = "12.4";
  std::optional<std::string> buildVersion = "B77";
  std::string reportVersion = "8.0";
  PropertyDictionary userInfo = sampleUserInfo();

  [[nodiscard]] PropertyDictionary build(const PropertyDictionary& payload, std::uint16_t number) const {
    EventAttributes attributes{.startTimestamp = kStart,
                               .compType = 30,
                               .sessionID = 1001,
                               .clientVersion = 3,
                               .combinedSessionID = std::nullopt,
                               .productFamily = productFamily,
                               .hardwareType = hardwareType,
                               .productVersion = productVersion,
                               .buildVersion = buildVersion,
                               .reportVersion = reportVersion};
    const EventStamp stamp{{1'795'000'100, 123'456}, kEventCategory, kEventType, number};
    PropertyDictionary event = newEventDict(payload, std::move(attributes), stamp, userInfo.size());
    event.merge(userInfo);
    return event;
  }
};

void EventBuilding(benchmark::State& state) {
  const Session session;
  const auto payload = samplePayload(1, 4711, 1234.5);
  for (auto _ : state) benchmark::DoNotOptimize(session.build(payload, 17));
}
BENCHMARK(EventBuilding);

/// Includes making the copy that is sanitised, a pointer's cost.
void Sanitising(benchmark::State& state) {
  const auto event = Session().build(samplePayload(1, 4711, 1234.5), 17);
  for (auto _ : state) {
    PropertyDictionary copy = event;
    makeEventRepresentableInJson(copy, false);
    benchmark::DoNotOptimize(copy);
  }
}
BENCHMARK(Sanitising);

/// By the number of filter records, of which one removes a key and one hashes.
void Filtering(benchmark::State& state) {
  PropertyArray records;
  for (std::int64_t number = 2; number < state.range(0); ++number) {
    records.append(PropertyDictionary{{"key", "absent" + std::to_string(number)}, {"action", "remove"}});
  }
  if (state.range(0) > 0) {
    records.append(PropertyDictionary{{"key", "zone"}, {"action", "remove"}});
    records.append(PropertyDictionary{{"key", "host"}, {"action", "sha256"}});
  }
  EventFilter filter;
  filter.createFiltersFromArray(records);
  const auto event = Session().build(samplePayload(1, 4711, 1234.5), 17);
  for (auto _ : state) {
    PropertyDictionary copy = event;
    filter.apply(copy);
    benchmark::DoNotOptimize(copy);
  }
}
BENCHMARK(Filtering)->Arg(0)->Arg(2)->Arg(10);

PropertyDictionary batch() {
  const Session session;
  PropertyArray events;
  for (std::uint16_t number = 0; number < kBatch; ++number) {
    events.append(session.build(samplePayload(1, number, 1234.5 + number / 1024.0), number));
  }
  return {{"postTime", kStart}, {"clientId", "b3c0a0f2-6a2e-4f0e-9d53-0a8f4f7f9b11"}, {"events", events}};
}

void JsonOfBatch(benchmark::State& state) {
  const auto message = batch();
  std::string json;
  for (auto _ : state) {
    json.clear();
    if (!json::write(message, json)) state.SkipWithError("the batch cannot be written");
    benchmark::DoNotOptimize(json.data());
  }
  state.counters["bytesAnEvent"] = static_cast<double>(json.size()) / kBatch;
}
BENCHMARK(JsonOfBatch)->Unit(benchmark::kMicrosecond);

void GzipOfBatch(benchmark::State& state) {
  std::string json;
  if (!json::write(batch(), json)) state.SkipWithError("the batch cannot be written");
  std::size_t compressed = 0;
  for (auto _ : state) {
    const auto body = gzipDeflate(std::string_view(json));
    compressed = body->size();
    benchmark::DoNotOptimize(body);
  }
  state.counters["bytesAnEvent"] = static_cast<double>(compressed) / kBatch;
}
BENCHMARK(GzipOfBatch)->Unit(benchmark::kMicrosecond);

/// A storebag's section with that many client entries, each with two macros.
PropertyDictionary section(std::int64_t entries) {
  PropertyArray clients;
  for (std::int64_t number = 0; number < entries; ++number) {
    clients.append(PropertyDictionary{{"client", "Client" + std::to_string(number)},
                                      {"service", "main"},
                                      {"locale_whitelist", "==everywhere"},
                                      {"filters", "==filters"},
                                      {"sampling_threshold", 1.0},
                                      {"post_url", "https://collector.test/post"}});
  }
  return {{"splunk", PropertyDictionary{{"clients", clients}}}};
}

PropertyDictionary macros() {
  return {{"==everywhere", PropertyArray{"AT", "BE", "CH", "DE", "FR", "GB", "IT", "NL", "SE", "US"}},
          {"==filters", PropertyArray{PropertyDictionary{{"key", "host"}, {"action", "sha256"}}}}};
}

void MacroExpansion(benchmark::State& state) {
  const PropertyDictionary bag{{"release", section(state.range(0))}};
  const auto values = macros();
  for (auto _ : state) {
    PropertyDictionary copy = bag;
    expandMacroForDataSet(copy, "release", values);
    benchmark::DoNotOptimize(copy);
  }
}
BENCHMARK(MacroExpansion)->Arg(1)->Arg(20)->Unit(benchmark::kMicrosecond);

/// From the bytes of an envelope to the verdict; with `Unpacking`, to the storebag with its macros expanded.
template <bool Unpacking>
void StorebagVerification(benchmark::State& state) {
  const auto keys = generateRsaKeyPair(3072);
  const auto bag = propertylist::serialize(
      PropertyDictionary{{"release", section(20)}, {"seed", section(20)}, {"shared_values", macros()}},
      propertylist::Form::binary);
  const auto signature = signSha1Digest(keys->privateKeyPem, sha1(*bag));
  const auto envelope = propertylist::serialize(
      PropertyDictionary{{kEnvelopeSignature, base64Encoded(*signature)}, {kEnvelopeBag, base64Encoded(*bag)}},
      propertylist::Form::xml);
  const auto publicKey = [&keys] { return rsaPublicKeyFromDer(keys->publicKeyDer); };
  for (auto _ : state) {
    const auto verified = verifyStorebagEnvelope(*envelope, publicKey);
    if (verified.verdict != VerifiedBag::Verdict::verified) state.SkipWithError("the storebag does not verify");
    if constexpr (Unpacking) benchmark::DoNotOptimize(unpackStorebag("bench", verified.bag));
  }
}
BENCHMARK(StorebagVerification<false>)->Unit(benchmark::kMicrosecond)->Name("StorebagVerification");
BENCHMARK(StorebagVerification<true>)->Unit(benchmark::kMicrosecond)->Name("StorebagVerificationAndUnpacking");

}  // namespace
}  // namespace velk::bench

int main(int argumentCount, char** arguments) {
  velk::log::setSink(nullptr, velk::log::Level::error);
  benchmark::Initialize(&argumentCount, arguments);
  if (benchmark::ReportUnrecognizedArguments(argumentCount, arguments)) return 64;
  benchmark::RunSpecifiedBenchmarks();
  return 0;
}
