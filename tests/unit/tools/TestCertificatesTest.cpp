#include "tools/collector/TestCertificates.h"

#include <gtest/gtest.h>
#include <openssl/bio.h>
#include <openssl/pem.h>
#include <openssl/x509v3.h>

#include <filesystem>
#include <memory>

#include "tests/support/TemporaryDirectory.h"

namespace velk::collector {
namespace {

constexpr std::int64_t kNow = 1'800'000'000;
constexpr std::int64_t kDay = 86400;

using Certificate = std::unique_ptr<X509, decltype(&X509_free)>;

Certificate certificateFrom(const std::string& pem) {
  const std::unique_ptr<BIO, decltype(&BIO_free_all)> bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())),
                                                          &BIO_free_all);
  return {PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr), &X509_free};
}

// What a client that trusts the authority would say.
int verify(const std::string& authorityPem, const std::string& serverPem, std::int64_t now) {
  const Certificate authority = certificateFrom(authorityPem);
  const Certificate server = certificateFrom(serverPem);
  const std::unique_ptr<X509_STORE, decltype(&X509_STORE_free)> store(X509_STORE_new(), &X509_STORE_free);
  X509_STORE_add_cert(store.get(), authority.get());
  const std::unique_ptr<X509_STORE_CTX, decltype(&X509_STORE_CTX_free)> context(X509_STORE_CTX_new(),
                                                                                &X509_STORE_CTX_free);
  X509_STORE_CTX_init(context.get(), store.get(), server.get(), nullptr);
  X509_STORE_CTX_set_time(context.get(), 0, static_cast<time_t>(now));
  X509_STORE_CTX_set_purpose(context.get(), X509_PURPOSE_SSL_SERVER);
  return X509_verify_cert(context.get()) == 1 ? X509_V_OK : X509_STORE_CTX_get_error(context.get());
}

class TestCertificates : public ::testing::Test {
 protected:
  void make(std::int64_t now) {
    const auto made = ensureTestCertificates(directory.path(), now);
    ASSERT_TRUE(made) << made.error().description;
    authority = directory.read("ca.pem");
    server = directory.read("server.pem");
  }

  const test::TemporaryDirectory directory;
  std::string authority;
  std::string server;
};

TEST_F(TestCertificates, AuthorityVouchesForTheServer) {
  make(kNow);
  EXPECT_EQ(verify(authority, server, kNow), X509_V_OK);
}

TEST_F(TestCertificates, ServerIsThisMachineByNameAndAddress) {
  make(kNow);
  const Certificate certificate = certificateFrom(server);
  EXPECT_EQ(X509_check_host(certificate.get(), "localhost", 0, 0, nullptr), 1);
  EXPECT_EQ(X509_check_ip_asc(certificate.get(), "127.0.0.1", 0), 1);
  EXPECT_EQ(X509_check_ip_asc(certificate.get(), "::1", 0), 1);
  EXPECT_EQ(X509_check_host(certificate.get(), "example.com", 0, 0, nullptr), 0);
}

TEST_F(TestCertificates, KeepsThemFromRunToRun) {
  make(kNow);
  const std::string firstAuthority = authority;
  const std::string firstServer = server;
  make(kNow + 30 * kDay);
  EXPECT_EQ(authority, firstAuthority);
  EXPECT_EQ(server, firstServer);
}

TEST_F(TestCertificates, RenewsTheServerAloneBeforeItExpires) {
  make(kNow);
  const std::string firstAuthority = authority;
  const std::string firstServer = server;
  make(kNow + 395 * kDay);
  EXPECT_EQ(authority, firstAuthority);
  EXPECT_NE(server, firstServer);
  EXPECT_EQ(verify(authority, server, kNow + 395 * kDay), X509_V_OK);
}

TEST_F(TestCertificates, ReplacesWhatCannotBeRead) {
  make(kNow);
  directory.write("server-key.pem", "nonsense");
  make(kNow);
  EXPECT_EQ(verify(authority, server, kNow), X509_V_OK);
  directory.write("ca-key.pem", "nonsense");
  make(kNow);
  EXPECT_EQ(verify(authority, server, kNow), X509_V_OK);
}

TEST_F(TestCertificates, KeepsItsFilesFromOthers) {
  make(kNow);
  using std::filesystem::perms;
  for (const auto& entry : std::filesystem::directory_iterator(directory.path())) {
    EXPECT_EQ(entry.status().permissions(), perms::owner_read | perms::owner_write) << entry.path();
  }
}

}  // namespace
}  // namespace velk::collector
