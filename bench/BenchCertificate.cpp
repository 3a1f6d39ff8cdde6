#include "bench/BenchCertificate.h"

#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <cstdio>
#include <cstdlib>

namespace velk::bench {

namespace {

template <class Type, void (*Free)(Type*)>
struct Freer {
  void operator()(Type* object) const { Free(object); }
};
using Key = std::unique_ptr<EVP_PKEY, Freer<EVP_PKEY, EVP_PKEY_free>>;
using Certificate = std::unique_ptr<X509, Freer<X509, X509_free>>;

void require(bool condition, const char* what) {
  if (condition) return;
  std::fprintf(stderr, "bench: %s failed\n", what);
  std::exit(71);
}

void addExtension(X509* certificate, int kind, const char* value) {
  X509V3_CTX context;
  X509V3_set_ctx_nodb(&context);
  X509V3_set_ctx(&context, certificate, certificate, nullptr, nullptr, 0);
  X509_EXTENSION* extension = X509V3_EXT_conf_nid(nullptr, &context, kind, value);
  require(extension != nullptr && X509_add_ext(certificate, extension, -1) == 1, "a certificate's extension");
  X509_EXTENSION_free(extension);
}

/// Valid for a day, with its subject and key, not yet signed.
Certificate newCertificate(const char* name, EVP_PKEY* key, long serial) {
  Certificate certificate(X509_new());
  X509_set_version(certificate.get(), 2);
  ASN1_INTEGER_set(X509_get_serialNumber(certificate.get()), serial);
  X509_gmtime_adj(X509_getm_notBefore(certificate.get()), -3600);
  X509_gmtime_adj(X509_getm_notAfter(certificate.get()), 86400);
  X509_set_pubkey(certificate.get(), key);
  X509_NAME_add_entry_by_txt(X509_get_subject_name(certificate.get()), "CN", MBSTRING_ASC,
                             reinterpret_cast<const unsigned char*>(name), -1, -1, 0);
  return certificate;
}

}  // namespace

ServerContext makeServerContext(const std::string& caFile) {
  const Key caKey(EVP_EC_gen("P-256"));
  const Certificate ca = newCertificate("Bench CA", caKey.get(), 1);
  X509_set_issuer_name(ca.get(), X509_get_subject_name(ca.get()));
  addExtension(ca.get(), NID_basic_constraints, "critical,CA:TRUE");
  addExtension(ca.get(), NID_key_usage, "critical,keyCertSign,cRLSign");
  require(X509_sign(ca.get(), caKey.get(), EVP_sha256()) > 0, "signing the authority");

  const Key key(EVP_EC_gen("P-256"));
  const Certificate certificate = newCertificate("localhost", key.get(), 2);
  X509_set_issuer_name(certificate.get(), X509_get_subject_name(ca.get()));
  addExtension(certificate.get(), NID_subject_alt_name, "DNS:localhost,IP:127.0.0.1");
  require(X509_sign(certificate.get(), caKey.get(), EVP_sha256()) > 0, "signing the certificate");

  std::FILE* file = std::fopen(caFile.c_str(), "w");
  require(file != nullptr && PEM_write_X509(file, ca.get()) == 1 && std::fclose(file) == 0, "writing the authority");
  ServerContext context(SSL_CTX_new(TLS_server_method()));
  require(SSL_CTX_use_certificate(context.get(), certificate.get()) == 1 &&
              SSL_CTX_use_PrivateKey(context.get(), key.get()) == 1,
          "making the server's context");
  return context;
}

}  // namespace velk::bench
