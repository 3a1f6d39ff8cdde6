// A certificate authority for trying things out, and the server certificate that it signs: made on first run and
// kept, so that whoever trusts `caPath` trusts every later run as well.
#pragma once

#include <cstdint>
#include <string>

#include "foundation/Error.h"

namespace velk::collector {

/// All in PEM, mode 0600. The server's file holds its certificate and then the authority's.
struct CertificateFiles {
  std::string caPath;
  std::string caKeyPath;
  std::string serverPath;
  std::string serverKeyPath;
};

[[nodiscard]] CertificateFiles certificateFilesIn(const std::string& directory);

/// Makes what is missing, has expired or cannot be read: the authority (ten years) together with a new server
/// certificate, or the server certificate alone (397 days; renewed in its last week). It is good for localhost,
/// 127.0.0.1 and ::1 only, and so is every other that this authority might sign. `now` is in seconds since 1970.
/// Fails with a sentence when the directory cannot be written.
[[nodiscard]] Result<CertificateFiles> ensureTestCertificates(const std::string& directory, std::int64_t now);

}  // namespace velk::collector
