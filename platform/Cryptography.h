// Digests and signatures, on OpenSSL 3. Any thread; nothing is kept between calls.
#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <string_view>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"

namespace velk {

[[nodiscard]] std::array<std::uint8_t, 20> sha1(std::span<const std::uint8_t> bytes);
[[nodiscard]] std::array<std::uint8_t, 32> sha256(std::span<const std::uint8_t> bytes);
[[nodiscard]] std::array<std::uint8_t, 20> hmacSha1(std::span<const std::uint8_t> key,
                                                    std::span<const std::uint8_t> bytes);

/// An RSA public key. Thread-safe.
class RsaPublicKey {
 public:
  virtual ~RsaPublicKey() = default;
  /// RSASSA-PKCS1-v1_5 (RFC 8017) of a SHA-1 digest.
  [[nodiscard]] virtual bool verifiesSha1Digest(std::span<const std::uint8_t, 20> digest,
                                                std::span<const std::uint8_t> signature) const = 0;
};

/// From DER bytes in either usual form (PKCS#1 RSAPublicKey, or SubjectPublicKeyInfo). Null when they are neither.
[[nodiscard]] std::unique_ptr<RsaPublicKey> rsaPublicKeyFromDer(std::span<const std::uint8_t> der);

/// For the tools: a fresh private key as PEM (PKCS#8), its public half as DER, and a signature over a digest.
struct RsaKeyPair {
  std::string privateKeyPem;
  ByteData publicKeyDer;
};
[[nodiscard]] Result<RsaKeyPair> generateRsaKeyPair(int bits = 3072);
[[nodiscard]] Result<ByteData> rsaPublicKeyDerFromPrivatePem(std::string_view privateKeyPem);
[[nodiscard]] Result<ByteData> signSha1Digest(std::string_view privateKeyPem, std::span<const std::uint8_t, 20> digest);

}  // namespace velk
