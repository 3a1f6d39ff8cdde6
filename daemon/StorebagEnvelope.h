// The signed form in which storebags come from the server and lie in the disk cache: a property list with the bag
// and a signature over the bag's bytes. Bytes from anywhere may be given; nothing in them can do harm.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>

#include "foundation/PropertyValue.h"
#include "platform/Cryptography.h"

namespace velk {

inline constexpr std::string_view kEnvelopeSignature = "signature";
inline constexpr std::string_view kEnvelopeBag = "bag";

/// Reads the public key at each verification, so that a key that was replaced counts from the next one on. Null when
/// there is none that can be used.
using StorebagPublicKeySource = std::function<std::unique_ptr<RsaPublicKey>()>;

/// `publicKey.der` of the configuration directory when there is one (a file that others can write is refused and
/// leaves the daemon without a key), else that of the data directory.
[[nodiscard]] StorebagPublicKeySource storebagPublicKeyFromDirectories(std::string configurationDirectory,
                                                                       std::string dataDirectory);

struct VerifiedBag {
  enum class Verdict { verified, noPublicKey, rejected };
  Verdict verdict = Verdict::rejected;
  /// The signed bytes; empty unless verified.
  ByteData bag;
};

/// Tells whether the envelope's bag was signed with the key's private half. Why it was not has been logged.
[[nodiscard]] VerifiedBag verifyStorebagEnvelope(std::span<const std::uint8_t> envelope,
                                                 const StorebagPublicKeySource& publicKey);

/// The storebag of a verified bag: parsed, its macros expanded from its "shared_values". Nothing, and a log line, when
/// it is not a dictionary.
[[nodiscard]] std::optional<PropertyDictionary> unpackStorebag(const std::string& name,
                                                               std::span<const std::uint8_t> bag);

/// The envelope that stands in for the conferencing client's storebag when the server cannot be reached. It carries
/// no signature, so verification turns it down like any other unsigned one.
[[nodiscard]] ByteData fallbackStorebag();

}  // namespace velk
