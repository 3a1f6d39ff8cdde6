// The HTTP session service on libcurl: which authorities are believed, and who owns the engine.
#include <curl/curl.h>
#include <dirent.h>
#include <sys/stat.h>

#include <cstdlib>
#include <cstring>

#include "platform/linux/CurlEngine.h"
#include "platform/linux/CurlSession.h"

namespace velk {
namespace {

std::string environmentPath(const char* name) {
  const char* value = ::secure_getenv(name);
  return value != nullptr ? value : "";
}

/// A directory with at least one certificate under its hashed name.
bool hasHashedCertificates(const char* directory) {
  if (directory == nullptr) return false;
  const std::unique_ptr<DIR, int (*)(DIR*)> entries(::opendir(directory), ::closedir);
  if (!entries) return false;
  while (const dirent* entry = ::readdir(entries.get())) {
    const char* dot = std::strrchr(entry->d_name, '.');
    if (dot == entry->d_name + 8 && std::strcmp(dot, ".0") == 0) return true;
  }
  return false;
}

/// The system's authorities where none are named. A hashed directory is preferred to the bundle of all certificates,
/// which takes megabytes once it is read.
HttpTrust completed(HttpTrust trust) {
  const auto* version = curl_version_info(CURLVERSION_NOW);
  if (!trust.caDirectory.empty()) return trust;
  if (hasHashedCertificates(version->capath)) {
    trust.caDirectory = version->capath;
  } else if (trust.caFile.empty() && version->cainfo != nullptr) {
    trust.caFile = version->cainfo;
  }
  return trust;
}

class CurlHttpSessionService final : public HttpSessionService {
 public:
  explicit CurlHttpSessionService(HttpTrust trust)
      : _engine(std::make_shared<CurlEngine>(completed(std::move(trust)))) {}
  ~CurlHttpSessionService() override { _engine->stop(); }

  void stop() override { _engine->stop(); }
  void endBulk() override { _engine->endBulk(); }

  std::shared_ptr<HttpSession> makeSession(HttpSessionConfiguration configuration,
                                           std::shared_ptr<HttpSessionDelegate> delegate,
                                           std::shared_ptr<Queue> delegateQueue) override {
    return std::make_shared<CurlSession>(_engine, std::move(configuration), std::move(delegate),
                                         std::move(delegateQueue));
  }

 private:
  /// Shared with sessions and tasks, which may outlive the service.
  const std::shared_ptr<CurlEngine> _engine;
};

}  // namespace

HttpTrust httpTrustFromEnvironment() { return {environmentPath("SSL_CERT_FILE"), environmentPath("SSL_CERT_DIR")}; }

std::unique_ptr<HttpSessionService> makeHttpSessionService(HttpTrust trust) {
  return std::make_unique<CurlHttpSessionService>(std::move(trust));
}

}  // namespace velk
