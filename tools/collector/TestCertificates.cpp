#include "tools/collector/TestCertificates.h"

#include <openssl/bio.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rand.h>
#include <openssl/x509v3.h>

#include <array>
#include <memory>
#include <span>

#include "platform/Files.h"

namespace velk::collector {
namespace {

constexpr std::int64_t kDay = 86400;
constexpr std::int64_t kAuthorityDays = 3650;
constexpr std::int64_t kServerDays = 397;
constexpr std::int64_t kRenewalDays = 7;
constexpr std::size_t kMaximumPemBytes = 64 * 1024;

struct Free {
  void operator()(EVP_PKEY* key) const noexcept { EVP_PKEY_free(key); }
  void operator()(X509* certificate) const noexcept { X509_free(certificate); }
  void operator()(X509_EXTENSION* extension) const noexcept { X509_EXTENSION_free(extension); }
  void operator()(BIO* bio) const noexcept { BIO_free_all(bio); }
};
using Key = std::unique_ptr<EVP_PKEY, Free>;
using Certificate = std::unique_ptr<X509, Free>;
using Extension = std::unique_ptr<X509_EXTENSION, Free>;
using Bio = std::unique_ptr<BIO, Free>;

struct Extensions {
  int identifier;
  const char* value;
};
constexpr std::array<Extensions, 4> kAuthorityExtensions = {{
    {NID_basic_constraints, "critical,CA:TRUE,pathlen:0"},
    {NID_key_usage, "critical,keyCertSign,cRLSign"},
    {NID_subject_key_identifier, "hash"},
    {NID_name_constraints,
     "critical,permitted;DNS:localhost,permitted;IP:127.0.0.1/255.255.255.255,"
     "permitted;IP:::1/ffff:ffff:ffff:ffff:ffff:ffff:ffff:ffff"},
}};
constexpr std::array<Extensions, 5> kServerExtensions = {{
    {NID_basic_constraints, "critical,CA:FALSE"},
    {NID_key_usage, "critical,digitalSignature"},
    {NID_ext_key_usage, "serverAuth"},
    {NID_authority_key_identifier, "keyid"},
    {NID_subject_alt_name, "DNS:localhost,IP:127.0.0.1,IP:::1"},
}};

Failure problem(const std::string& doing) {
  std::array<char, 256> cause{};
  ERR_error_string_n(ERR_get_error(), cause.data(), cause.size());
  ERR_clear_error();
  return failure("certificate", 1, "cannot " + doing + ": " + cause.data());
}

std::string textOf(BIO* bio) {
  char* bytes = nullptr;
  const long length = BIO_get_mem_data(bio, &bytes);
  return {bytes, static_cast<std::size_t>(length)};
}

std::string pemOf(X509* certificate) {
  const Bio bio(BIO_new(BIO_s_mem()));
  PEM_write_bio_X509(bio.get(), certificate);
  return textOf(bio.get());
}

std::string pemOf(EVP_PKEY* key) {
  const Bio bio(BIO_new(BIO_s_mem()));
  PEM_write_bio_PKCS8PrivateKey(bio.get(), key, nullptr, nullptr, 0, nullptr, nullptr);
  return textOf(bio.get());
}

Bio bioOfFile(const std::string& path) {
  const Result<ByteData> bytes = files::read(path, kMaximumPemBytes);
  if (!bytes) return nullptr;
  Bio bio(BIO_new(BIO_s_mem()));
  BIO_write(bio.get(), bytes->data(), static_cast<int>(bytes->size()));
  return bio;
}

Certificate readCertificate(const std::string& path) {
  const Bio bio = bioOfFile(path);
  return Certificate(bio == nullptr ? nullptr : PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr));
}

Key readKey(const std::string& path) {
  const Bio bio = bioOfFile(path);
  // An empty pass phrase: a key that wants one is not ours, and nobody is asked.
  char none[] = "";
  return Key(bio == nullptr ? nullptr : PEM_read_bio_PrivateKey(bio.get(), nullptr, nullptr, none));
}

Result<void> writePem(const std::string& path, const std::string& pem) {
  return files::writeAtomically(path, {reinterpret_cast<const std::uint8_t*>(pem.data()), pem.size()}, 0600);
}

bool isValidUntil(const X509* certificate, std::int64_t time) {
  time_t when = static_cast<time_t>(time);
  return X509_cmp_time(X509_get0_notAfter(certificate), &when) > 0;
}

bool setTimes(X509* certificate, std::int64_t now, std::int64_t lifeInDays) {
  // A day early, for machines whose clocks disagree.
  return ASN1_TIME_set(X509_getm_notBefore(certificate), static_cast<time_t>(now - kDay)) != nullptr &&
         ASN1_TIME_set(X509_getm_notAfter(certificate), static_cast<time_t>(now + lifeInDays * kDay)) != nullptr;
}

bool setRandomSerial(X509* certificate) {
  std::array<unsigned char, 16> bytes{};
  if (RAND_bytes(bytes.data(), bytes.size()) != 1) return false;
  bytes[0] = static_cast<unsigned char>((bytes[0] & 0x7f) | 0x40);
  const std::unique_ptr<BIGNUM, decltype(&BN_free)> number(
      BN_bin2bn(bytes.data(), static_cast<int>(bytes.size()), nullptr), &BN_free);
  return number != nullptr && BN_to_ASN1_INTEGER(number.get(), X509_get_serialNumber(certificate)) != nullptr;
}

bool addExtensions(X509* certificate, X509* issuer, std::span<const Extensions> extensions) {
  X509V3_CTX context;
  X509V3_set_ctx_nodb(&context);
  X509V3_set_ctx(&context, issuer, certificate, nullptr, nullptr, 0);
  for (const Extensions& wanted : extensions) {
    const Extension extension(X509V3_EXT_conf_nid(nullptr, &context, wanted.identifier, wanted.value));
    if (extension == nullptr || X509_add_ext(certificate, extension.get(), -1) != 1) return false;
  }
  return true;
}

/// Who signs: null pointers when the certificate signs itself.
struct Issuer {
  X509* certificate = nullptr;
  EVP_PKEY* key = nullptr;
};

Result<Certificate> makeCertificate(EVP_PKEY* key, const char* name, std::int64_t now, std::int64_t lifeInDays,
                                    Issuer issuer, std::span<const Extensions> extensions) {
  Certificate certificate(X509_new());
  X509* issuerCertificate = issuer.certificate != nullptr ? issuer.certificate : certificate.get();
  X509_NAME* subject = X509_get_subject_name(certificate.get());
  const bool made = X509_set_version(certificate.get(), X509_VERSION_3) == 1 && setRandomSerial(certificate.get()) &&
                    setTimes(certificate.get(), now, lifeInDays) && X509_set_pubkey(certificate.get(), key) == 1 &&
                    X509_NAME_add_entry_by_txt(subject, "CN", MBSTRING_UTF8,
                                               reinterpret_cast<const unsigned char*>(name), -1, -1, 0) == 1 &&
                    X509_set_issuer_name(certificate.get(), X509_get_subject_name(issuerCertificate)) == 1 &&
                    addExtensions(certificate.get(), issuerCertificate, extensions) &&
                    X509_sign(certificate.get(), issuer.key != nullptr ? issuer.key : key, EVP_sha256()) != 0;
  if (!made) return problem("make a certificate");
  return certificate;
}

struct Authority {
  Certificate certificate;
  Key key;
};

Result<Authority> readOrMakeAuthority(const CertificateFiles& names, std::int64_t now) {
  Authority kept{readCertificate(names.caPath), readKey(names.caKeyPath)};
  if (kept.certificate != nullptr && kept.key != nullptr &&
      X509_check_private_key(kept.certificate.get(), kept.key.get()) == 1 &&
      isValidUntil(kept.certificate.get(), now + kServerDays * kDay)) {
    return kept;
  }
  ERR_clear_error();
  Key key(EVP_EC_gen("P-256"));
  if (key == nullptr) return problem("make a key");
  Result<Certificate> certificate =
      makeCertificate(key.get(), "velkcollector test authority", now, kAuthorityDays, {}, kAuthorityExtensions);
  if (!certificate) return Failure(std::move(certificate).error());
  if (Result<void> written = writePem(names.caKeyPath, pemOf(key.get())); !written) {
    return Failure(std::move(written).error());
  }
  if (Result<void> written = writePem(names.caPath, pemOf(certificate->get())); !written) {
    return Failure(std::move(written).error());
  }
  return Authority{std::move(*certificate), std::move(key)};
}

bool isServerUsable(const CertificateFiles& names, const Authority& authority, std::int64_t now) {
  const Certificate certificate = readCertificate(names.serverPath);
  const Key key = readKey(names.serverKeyPath);
  const bool usable = certificate != nullptr && key != nullptr &&
                      X509_check_private_key(certificate.get(), key.get()) == 1 &&
                      X509_verify(certificate.get(), authority.key.get()) == 1 &&
                      isValidUntil(certificate.get(), now + kRenewalDays * kDay);
  ERR_clear_error();
  return usable;
}

Result<void> makeServer(const CertificateFiles& names, const Authority& authority, std::int64_t now) {
  const Key key(EVP_EC_gen("P-256"));
  if (key == nullptr) return problem("make a key");
  const Issuer issuer{authority.certificate.get(), authority.key.get()};
  Result<Certificate> certificate =
      makeCertificate(key.get(), "localhost", now, kServerDays, issuer, kServerExtensions);
  if (!certificate) return Failure(std::move(certificate).error());
  if (Result<void> written = writePem(names.serverKeyPath, pemOf(key.get())); !written) return written;
  return writePem(names.serverPath, pemOf(certificate->get()) + pemOf(authority.certificate.get()));
}

}  // namespace

CertificateFiles certificateFilesIn(const std::string& directory) {
  return {directory + "/ca.pem", directory + "/ca-key.pem", directory + "/server.pem", directory + "/server-key.pem"};
}

Result<CertificateFiles> ensureTestCertificates(const std::string& directory, std::int64_t now) {
  if (Result<void> made = files::createDirectories(directory, 0700); !made) return Failure(std::move(made).error());
  CertificateFiles names = certificateFilesIn(directory);
  const Result<Authority> authority = readOrMakeAuthority(names, now);
  if (!authority) return Failure(authority.error());
  if (!isServerUsable(names, *authority, now)) {
    if (Result<void> made = makeServer(names, *authority, now); !made) return Failure(std::move(made).error());
  }
  return names;
}

}  // namespace velk::collector
