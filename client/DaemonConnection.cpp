#include "client/DaemonConnection.h"

#include "client/ClientRuntime.h"
#include "platform/Directories.h"
#include "platform/Log.h"
#include "platform/PeerTrust.h"

namespace velk {

Result<std::shared_ptr<Connection>> connectToDaemon(ClientRuntime& runtime, std::shared_ptr<Queue> deliveryQueue) {
  const std::string path = daemonSocketPath();
  auto made = Connection::connect(path, runtime.loop(), std::move(deliveryQueue));
  if (!made) return made;
  const auto distrust = reasonToDistrustService(path, (*made)->peer().uid);
  if (!distrust) return made;
  (*made)->invalidate();
  return failure(std::string(kTrustErrorDomain), kDistrustedService, *distrust);
}

bool isLasting(const Error& error) {
  if (error.domain == kTrustErrorDomain) return error.code == kDistrustedService;
  return error.domain == kConnectionErrorDomain && error.code == static_cast<int>(ConnectionError::notAllowed);
}

ProxyErrorHandler loggingHandler(std::string_view text) {
  return [text](const Error& error) {
    const auto code = static_cast<ConnectionError>(error.code);
    const bool isNeverSent = error.domain == kConnectionErrorDomain &&
                             (code == ConnectionError::tooLarge || code == ConnectionError::notEncodable);
    if (isNeverSent) return log::error(text, error);
    log::standard(text, error);
  };
}

}  // namespace velk
