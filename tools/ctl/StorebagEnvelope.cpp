#include "tools/ctl/StorebagEnvelope.h"

#include <algorithm>

#include "foundation/Base64.h"
#include "foundation/Json.h"
#include "platform/Cryptography.h"
#include "platform/PropertyList.h"

namespace velk::ctl {
namespace {

constexpr std::string_view kSignature = "signature";
constexpr std::string_view kBag = "bag";

Failure refused(std::string why) { return failure("storebag", 1, std::move(why)); }

std::string_view textOf(std::span<const std::uint8_t> bytes) {
  return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
}

// Property lists begin with "<" or "bplist"; JSON objects with a brace.
bool looksLikeJson(std::string_view text) {
  const std::size_t first = text.find_first_not_of(" \t\r\n");
  return first != std::string_view::npos && text[first] == '{';
}

Result<PropertyDictionary> dictionaryFrom(Result<PropertyValue> value, const std::string& what) {
  if (!value) return refused(what + " cannot be read: " + value.error().description);
  if (value->dictionary() == nullptr) return refused(what + " is not a dictionary");
  return *value->dictionary();
}

Result<ByteData> dataUnder(std::string_view key, const PropertyDictionary& envelope) {
  const std::string* text = envelope.string(key);
  const std::string name(key);
  if (text == nullptr) return refused("the envelope has no \"" + name + "\" string");
  std::optional<ByteData> bytes = base64Decoded(*text);
  if (!bytes) return refused("the envelope's \"" + name + "\" is not base64");
  return std::move(*bytes);
}

}  // namespace

Result<PropertyDictionary> readBag(std::span<const std::uint8_t> bytes) {
  const std::string_view text = textOf(bytes);
  if (looksLikeJson(text)) return dictionaryFrom(json::parse(text, json::Extensions::tagged), "the bag");
  return dictionaryFrom(propertylist::parse(bytes), "the bag");
}

Result<ByteData> signBag(const PropertyDictionary& bag, std::string_view privateKeyPem) {
  const Result<ByteData> bytes = propertylist::serialize(bag, propertylist::Form::binary);
  if (!bytes) return refused("the bag cannot be written: " + bytes.error().description);
  const auto digest = sha1(*bytes);
  const Result<ByteData> signature = signSha1Digest(privateKeyPem, digest);
  if (!signature) return Failure(signature.error());
  const PropertyDictionary envelope{{kSignature, base64Encoded(*signature)}, {kBag, base64Encoded(*bytes)}};
  return propertylist::serialize(envelope, propertylist::Form::xml);
}

Result<OpenedEnvelope> openEnvelope(std::span<const std::uint8_t> bytes) {
  const Result<PropertyDictionary> envelope = dictionaryFrom(propertylist::parse(bytes), "the envelope");
  if (!envelope) return Failure(envelope.error());
  Result<ByteData> signature = dataUnder(kSignature, *envelope);
  if (!signature) return Failure(std::move(signature).error());
  Result<ByteData> bagBytes = dataUnder(kBag, *envelope);
  if (!bagBytes) return Failure(std::move(bagBytes).error());
  Result<PropertyDictionary> bag = dictionaryFrom(propertylist::parse(*bagBytes), "the bag in the envelope");
  if (!bag) return Failure(std::move(bag).error());
  return OpenedEnvelope{std::move(*signature), std::move(*bagBytes), std::move(*bag)};
}

Result<void> verifyEnvelope(const OpenedEnvelope& envelope, std::span<const std::uint8_t> publicKeyDer) {
  const auto key = rsaPublicKeyFromDer(publicKeyDer);
  if (key == nullptr) return refused("the public key is no RSA key in DER form");
  const auto digest = sha1(envelope.bagBytes);
  if (!key->verifiesSha1Digest(digest, envelope.signature)) {
    return refused("the signature is not this key's, or the bag was changed after it was signed");
  }
  return {};
}

}  // namespace velk::ctl
