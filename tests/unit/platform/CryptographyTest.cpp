#include "platform/Cryptography.h"

#include <gtest/gtest.h>

#include "foundation/Base64.h"
#include "foundation/Text.h"

namespace velk {
namespace {

std::span<const std::uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

const RsaKeyPair& pair() {
  static const RsaKeyPair made = generateRsaKeyPair(2048).value();
  return made;
}

/// The bare PKCS#1 key is the content of the bit string that ends a SubjectPublicKeyInfo: for 2048 bits its 24 last
/// header bytes are fixed.
ByteData bareForm(const ByteData& der) { return ByteData(der.begin() + 24, der.end()); }

TEST(Cryptography, ComputesDigests) {
  EXPECT_EQ(hexadecimal(sha1(bytesOf("abc"))), "a9993e364706816aba3e25717850c26c9cd0d89d");
  EXPECT_EQ(hexadecimal(sha1({})), "da39a3ee5e6b4b0d3255bfef95601890afd80709");
  EXPECT_EQ(hexadecimal(sha256(bytesOf("abc"))), "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad");
  EXPECT_EQ(hexadecimal(hmacSha1(bytesOf("Jefe"), bytesOf("what do ya want for nothing?"))),
            "effcdf6ae5eb2fa2d27416d5f184df9c259a7c79");
}

TEST(Cryptography, TakesEmptyKeysForWhatTheyAre) {
  EXPECT_EQ(hexadecimal(hmacSha1({}, {})), "fbdb1d1b18aa6c08324b7d64b71fb76370690e1d");
  (void)hmacSha1(bytesOf("another"), {});
  EXPECT_EQ(hexadecimal(hmacSha1({}, {})), "fbdb1d1b18aa6c08324b7d64b71fb76370690e1d");
}

TEST(Cryptography, VerifiesItsOwnSignatures) {
  const auto digest = sha1(bytesOf("payload"));
  const auto signature = signSha1Digest(pair().privateKeyPem, digest);
  ASSERT_TRUE(signature);
  const auto key = rsaPublicKeyFromDer(pair().publicKeyDer);
  ASSERT_TRUE(key);
  EXPECT_TRUE(key->verifiesSha1Digest(digest, *signature));
  EXPECT_FALSE(key->verifiesSha1Digest(sha1(bytesOf("other")), *signature));
  auto broken = *signature;
  broken[10] ^= 1;
  EXPECT_FALSE(key->verifiesSha1Digest(digest, broken));
  EXPECT_FALSE(key->verifiesSha1Digest(digest, {}));
  broken.push_back(0);
  EXPECT_FALSE(key->verifiesSha1Digest(digest, broken));
}

TEST(Cryptography, ReadsBothDerForms) {
  const auto digest = sha1(bytesOf("payload"));
  const auto signature = signSha1Digest(pair().privateKeyPem, digest).value();
  const auto key = rsaPublicKeyFromDer(bareForm(pair().publicKeyDer));
  ASSERT_TRUE(key);
  EXPECT_TRUE(key->verifiesSha1Digest(digest, signature));
}

TEST(Cryptography, RefusesWhatIsNoRsaKey) {
  EXPECT_EQ(rsaPublicKeyFromDer({}), nullptr);
  EXPECT_EQ(rsaPublicKeyFromDer(bytesOf("not a key at all")), nullptr);
  auto truncated = pair().publicKeyDer;
  truncated.resize(truncated.size() / 2);
  EXPECT_EQ(rsaPublicKeyFromDer(truncated), nullptr);
  auto longer = pair().publicKeyDer;
  longer.push_back(0);
  EXPECT_EQ(rsaPublicKeyFromDer(longer), nullptr);
  // An elliptic curve's key.
  const auto curve = base64Decoded(
      "MFkwEwYHKoZIzj0CAQYIKoZIzj0DAQcDQgAEaxfR8uEsQkf4vOblY6RA8ncDfYEt6zOg9KE5RdiYwpZP40Li/hp/m47n60p8D54WK84zV2sxXs7L"
      "tkBoN79R9Q==");
  EXPECT_EQ(rsaPublicKeyFromDer(*curve), nullptr);
}

TEST(Cryptography, TellsThePublicHalfOfAPrivateKey) {
  EXPECT_EQ(rsaPublicKeyDerFromPrivatePem(pair().privateKeyPem), pair().publicKeyDer);
  const auto failed = rsaPublicKeyDerFromPrivatePem("no key");
  ASSERT_FALSE(failed);
  EXPECT_FALSE(failed.error().description.empty());
  EXPECT_FALSE(signSha1Digest("no key", sha1({})));
}

TEST(Cryptography, RefusesKeySizesThatAreNoUse) {
  EXPECT_FALSE(generateRsaKeyPair(512));
  EXPECT_FALSE(generateRsaKeyPair(1'000'000));
}

}  // namespace
}  // namespace velk
