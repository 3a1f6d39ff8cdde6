#include "platform/Cryptography.h"

#include <openssl/bio.h>
#include <openssl/crypto.h>
#include <openssl/decoder.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <climits>

namespace velk {
namespace {

template <auto function>
struct Releaser {
  template <class Object>
  void operator()(Object* object) const noexcept {
    function(object);
  }
};
using Key = std::unique_ptr<EVP_PKEY, Releaser<EVP_PKEY_free>>;
using KeyContext = std::unique_ptr<EVP_PKEY_CTX, Releaser<EVP_PKEY_CTX_free>>;
using Bio = std::unique_ptr<BIO, Releaser<BIO_free_all>>;

constexpr int kSmallestKeyBits = 1024;
constexpr int kLargestKeyBits = 16384;
/// The largest keys we accept take about 2 KiB; anything much longer is no key.
constexpr std::size_t kLargestDer = 16 * 1024;

/// The oldest of the library's errors as text; the thread's error queue is empty afterwards.
Failure cryptographyFailure(const char* what) {
  const unsigned long code = ERR_get_error();
  ERR_clear_error();
  const char* reason = code != 0 ? ERR_reason_error_string(code) : nullptr;
  return failure("cryptography", 1, std::string(what) + ": " + (reason != nullptr ? reason : "unknown reason"));
}

template <std::size_t Size>
std::array<std::uint8_t, Size> digest(std::span<const std::uint8_t> bytes, const EVP_MD* algorithm) {
  std::array<std::uint8_t, Size> result{};
  EVP_Digest(bytes.data(), bytes.size(), result.data(), nullptr, algorithm, nullptr);
  return result;
}

/// A context for signing or verifying a SHA-1 digest with the key, or null.
KeyContext sha1Context(EVP_PKEY* key, int (*initialise)(EVP_PKEY_CTX*)) {
  KeyContext context(EVP_PKEY_CTX_new(key, nullptr));
  if (!context || initialise(context.get()) <= 0) return nullptr;
  if (EVP_PKEY_CTX_set_rsa_padding(context.get(), RSA_PKCS1_PADDING) <= 0) return nullptr;
  if (EVP_PKEY_CTX_set_signature_md(context.get(), EVP_sha1()) <= 0) return nullptr;
  return context;
}

class OpenSslPublicKey : public RsaPublicKey {
 public:
  explicit OpenSslPublicKey(Key key) : _key(std::move(key)) {}

  bool verifiesSha1Digest(std::span<const std::uint8_t, 20> digest,
                          std::span<const std::uint8_t> signature) const override {
    const auto context = sha1Context(_key.get(), EVP_PKEY_verify_init);
    const bool verified = context && EVP_PKEY_verify(context.get(), signature.data(), signature.size(), digest.data(),
                                                     digest.size()) == 1;
    ERR_clear_error();
    return verified;
  }

 private:
  const Key _key;
};

bool isUsableRsaKey(const EVP_PKEY* key) {
  if (key == nullptr || EVP_PKEY_is_a(key, "RSA") != 1) return false;
  const int bits = EVP_PKEY_get_bits(key);
  return bits >= kSmallestKeyBits && bits <= kLargestKeyBits;
}

Key privateKeyFromPem(std::string_view pem) {
  if (pem.size() > static_cast<std::size_t>(INT_MAX)) return nullptr;
  const Bio bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
  if (!bio) return nullptr;
  // A key with a passphrase is refused: without a callback the library would ask at the terminal.
  const auto noPassphrase = [](char*, int, int, void*) { return -1; };
  Key key(PEM_read_bio_PrivateKey(bio.get(), nullptr, noPassphrase, nullptr));
  return isUsableRsaKey(key.get()) ? std::move(key) : nullptr;
}

Result<ByteData> publicDer(const EVP_PKEY* key) {
  unsigned char* bytes = nullptr;
  const int length = i2d_PUBKEY(key, &bytes);
  if (length <= 0) return cryptographyFailure("cannot encode the public key");
  ByteData der(bytes, bytes + length);
  OPENSSL_free(bytes);
  return der;
}

Result<std::string> privatePem(const EVP_PKEY* key) {
  const Bio bio(BIO_new(BIO_s_mem()));
  if (!bio || PEM_write_bio_PKCS8PrivateKey(bio.get(), key, nullptr, nullptr, 0, nullptr, nullptr) != 1) {
    return cryptographyFailure("cannot encode the private key");
  }
  char* text = nullptr;
  const long length = BIO_get_mem_data(bio.get(), &text);
  std::string pem(text, static_cast<std::size_t>(length));
  OPENSSL_cleanse(text, static_cast<std::size_t>(length));
  return pem;
}

}  // namespace

std::array<std::uint8_t, 20> sha1(std::span<const std::uint8_t> bytes) { return digest<20>(bytes, EVP_sha1()); }

std::array<std::uint8_t, 32> sha256(std::span<const std::uint8_t> bytes) { return digest<32>(bytes, EVP_sha256()); }

std::array<std::uint8_t, 20> hmacSha1(std::span<const std::uint8_t> key, std::span<const std::uint8_t> bytes) {
  std::array<std::uint8_t, 20> result{};
  static constexpr std::uint8_t kNoKey = 0;
  // A null key pointer would mean "the key of last time" to the library.
  const auto* keyBytes = key.empty() ? &kNoKey : key.data();
  unsigned length = 0;
  HMAC(EVP_sha1(), keyBytes, static_cast<int>(key.size()), bytes.data(), bytes.size(), result.data(), &length);
  return result;
}

std::unique_ptr<RsaPublicKey> rsaPublicKeyFromDer(std::span<const std::uint8_t> der) {
  if (der.empty() || der.size() > kLargestDer) return nullptr;
  const unsigned char* bytes = der.data();
  Key key(d2i_PUBKEY(nullptr, &bytes, static_cast<long>(der.size())));
  if (!key) {
    bytes = der.data();
    key.reset(d2i_PublicKey(EVP_PKEY_RSA, nullptr, &bytes, static_cast<long>(der.size())));
  }
  ERR_clear_error();
  const bool wholeInput = bytes == der.data() + der.size();
  if (!wholeInput || !isUsableRsaKey(key.get())) return nullptr;
  return std::make_unique<OpenSslPublicKey>(std::move(key));
}

Result<RsaKeyPair> generateRsaKeyPair(int bits) {
  if (bits < kSmallestKeyBits || bits > kLargestKeyBits) {
    return failure("cryptography", 2, "a key of " + std::to_string(bits) + " bits is not supported");
  }
  const Key key(EVP_RSA_gen(static_cast<unsigned>(bits)));
  if (!key) return cryptographyFailure("cannot make a key");
  auto pem = privatePem(key.get());
  if (!pem) return Failure(pem.error());
  auto der = publicDer(key.get());
  if (!der) return Failure(der.error());
  return RsaKeyPair{std::move(*pem), std::move(*der)};
}

Result<ByteData> rsaPublicKeyDerFromPrivatePem(std::string_view privateKeyPem) {
  const Key key = privateKeyFromPem(privateKeyPem);
  if (!key) return cryptographyFailure("not an RSA private key in PEM form without passphrase");
  return publicDer(key.get());
}

Result<ByteData> signSha1Digest(std::string_view privateKeyPem, std::span<const std::uint8_t, 20> digest) {
  const Key key = privateKeyFromPem(privateKeyPem);
  if (!key) return cryptographyFailure("not an RSA private key in PEM form without passphrase");
  const auto context = sha1Context(key.get(), EVP_PKEY_sign_init);
  std::size_t length = 0;
  if (!context || EVP_PKEY_sign(context.get(), nullptr, &length, digest.data(), digest.size()) <= 0) {
    return cryptographyFailure("cannot sign");
  }
  ByteData signature(length);
  if (EVP_PKEY_sign(context.get(), signature.data(), &length, digest.data(), digest.size()) <= 0) {
    return cryptographyFailure("cannot sign");
  }
  signature.resize(length);
  return signature;
}

}  // namespace velk
