// The HTTPS side of the collector: routes requests to it and sends its answers.
#pragma once

#include <memory>
#include <string>

#include "foundation/Error.h"
#include "tools/collector/Collector.h"
#include "tools/collector/Dashboard.h"
#include "tools/collector/Uploads.h"

namespace velk::collector {

/// Lifecycle: make -> bind -> serve (blocks) -> ends after stop. Made, bound and destroyed by one thread.
///   GET  /storebags/vindle/NAME, /bags/vindle/NAME   the signed envelope
///   GET  /stats                                      counts
///   POST /logdata, GET /logdata/NUMBER               log data of sessions
///   POST /upload                                     a file, as the upload backend sends it
///   POST anything                                    an event post
class HttpsServer {
 public:
  /// The certificate's chain and its key in PEM. Fails when they cannot be used. The others outlive
  /// the server.
  [[nodiscard]] static Result<std::unique_ptr<HttpsServer>> make(Collector& collector, Dashboard& dashboard,
                                                                 Uploads& uploads, const std::string& certificatePath,
                                                                 const std::string& keyPath);
  virtual ~HttpsServer() = default;

  /// Answers the port; connections are taken by the kernel from then on. `port` 0: any that is free.
  [[nodiscard]] virtual Result<int> bind(const std::string& address, int port) = 0;
  /// Answers requests until `stop`; then every connection has ended.
  virtual void serve() = 0;
  /// From any thread, once `serve` was called or is about to be. Requests in progress are answered; idle connections
  /// end at once. Does not block on them.
  virtual void stop() = 0;
};

}  // namespace velk::collector
