#include "daemon/StorebagEnvelope.h"

#include "backends/MacroExpansion.h"
#include "daemon/LogTexts.h"
#include "foundation/Base64.h"
#include "foundation/Text.h"
#include "platform/Files.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"

namespace velk {

namespace {

constexpr std::string_view kSharedValues = "shared_values";
constexpr std::string_view kSections[] = {"tavrin_internal", "development", "seed", "release"};
constexpr std::size_t kMaximumKeyBytes = 64 * 1024;

std::unique_ptr<RsaPublicKey> readPublicKey(const std::string& path) {
  const auto der = files::read(path, kMaximumKeyBytes);
  return der ? rsaPublicKeyFromDer(*der) : nullptr;
}

// Something to tell one bad bag from another by in the log; addresses of this process are nobody's business.
const void* fingerprint(const std::array<std::uint8_t, 20>& digest) {
  std::uintptr_t bits = 0;
  for (std::size_t index = 0; index < sizeof(bits); ++index) bits = (bits << 8) | digest[index];
  return reinterpret_cast<const void*>(bits);
}

// Each text becomes the list of its comma-separated parts; other values stay.
PropertyDictionary splitSharedValues(const PropertyDictionary& sharedValues) {
  PropertyDictionary lists;
  lists.reserve(sharedValues.size());
  for (const auto& entry : sharedValues) {
    const auto* text = entry.value.string();
    if (text == nullptr) {
      lists.set(entry.key, entry.value);
      continue;
    }
    PropertyArray parts;
    for (const auto part : split(*text, ',')) parts.append(part);
    lists.set(entry.key, std::move(parts));
  }
  return lists;
}

}  // namespace

StorebagPublicKeySource storebagPublicKeyFromDirectories(std::string configurationDirectory,
                                                         std::string dataDirectory) {
  return [configured = configurationDirectory + "/publicKey.der",
          installed = dataDirectory + "/publicKey.der"]() -> std::unique_ptr<RsaPublicKey> {
    if (!files::exists(configured)) return readPublicKey(installed);
    if (files::isTrustworthy(configured)) return readPublicKey(configured);
    log::error(
        "StorebagEnvelope: '%@' is refused because others can write it or its directory; no storebag can be "
        "verified until only root or the daemon's user can",
        configured);
    return nullptr;
  };
}

VerifiedBag verifyStorebagEnvelope(std::span<const std::uint8_t> envelope, const StorebagPublicKeySource& publicKey) {
  const auto parsed = propertylist::parse(envelope);
  if (!parsed) log::standard(daemontexts::kEnvelopeParseError, parsed.error());
  const auto* dictionary = parsed ? parsed->dictionary() : nullptr;
  const auto* signatureText = dictionary != nullptr ? dictionary->string(kEnvelopeSignature) : nullptr;
  if (signatureText == nullptr) {
    log::error(daemontexts::kSignatureMissing);
    return {};
  }
  const auto key = publicKey();
  if (!key) return {VerifiedBag::Verdict::noPublicKey, {}};
  const auto signature = base64Decoded(*signatureText);
  if (!signature) return {};
  const auto* bagText = dictionary->string(kEnvelopeBag);
  auto bag = bagText != nullptr ? base64Decoded(*bagText) : std::nullopt;
  if (!bag) return {};
  const auto digest = sha1(*bag);
  if (!key->verifiesSha1Digest(digest, *signature)) {
    log::error(daemontexts::kSignatureInvalid, fingerprint(digest));
    return {};
  }
  return {VerifiedBag::Verdict::verified, std::move(*bag)};
}

std::optional<PropertyDictionary> unpackStorebag(const std::string& name, std::span<const std::uint8_t> bag) {
  const auto parsed = propertylist::parse(bag);
  const auto* storebag = parsed ? parsed->dictionary() : nullptr;
  if (storebag == nullptr) {
    log::error("fetchStorebagWithName: storebag '%@' is signed but not usable: %@", name,
               parsed ? "it is not a dictionary" : parsed.error().description.c_str());
    return std::nullopt;
  }
  const auto* sharedValues = storebag->dictionary(kSharedValues);
  if (sharedValues == nullptr || sharedValues->empty()) return *storebag;
  const auto lists = splitSharedValues(*sharedValues);
  auto expanded = *storebag;
  expanded.remove(kSharedValues);
  for (const auto section : kSections) expandMacroForDataSet(expanded, section, lists);
  return expanded;
}

ByteData fallbackStorebag() {
  const PropertyDictionary active{{"quill", PropertyDictionary{{"active", true}}}};
  const PropertyDictionary storebag{{"tavrin_internal", active},
                                    {"development", active},
                                    {"release", active},
                                    {"version", "1.0.0-Sorrel-Fallback"},
                                    {"refresh_cycle", 3600}};
  auto bytes = propertylist::serialize(storebag, propertylist::Form::binary);
  return bytes ? std::move(*bytes) : ByteData{};
}

}  // namespace velk
