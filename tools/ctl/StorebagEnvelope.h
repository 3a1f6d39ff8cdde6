// The signed envelope of a storebag: a property list with "signature" and "bag", both base64. The signature is
// RSASSA-PKCS1-v1_5 with SHA-1 over the bytes of the bag, which is a property list itself. Used by the storebag
// commands; the daemon reads what is written here.
#pragma once

#include <span>
#include <string>
#include <string_view>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"

namespace velk::ctl {

/// Reads a bag from a file's bytes: JSON, or a property list in either form. A bag is a dictionary.
[[nodiscard]] Result<PropertyDictionary> readBag(std::span<const std::uint8_t> bytes);

/// The envelope (an XML property list, for people to read) around the bag (a binary one), signed with the private
/// key in PEM. A bag that a property list cannot hold (a null in it) is refused.
[[nodiscard]] Result<ByteData> signBag(const PropertyDictionary& bag, std::string_view privateKeyPem);

/// What an envelope holds.
struct OpenedEnvelope {
  ByteData signature;
  ByteData bagBytes;
  PropertyDictionary bag;
};
/// Takes the envelope apart without looking at the signature.
[[nodiscard]] Result<OpenedEnvelope> openEnvelope(std::span<const std::uint8_t> bytes);
/// Whether the signature is the bag's under the public key (either usual DER form).
[[nodiscard]] Result<void> verifyEnvelope(const OpenedEnvelope& envelope, std::span<const std::uint8_t> publicKeyDer);

}  // namespace velk::ctl
