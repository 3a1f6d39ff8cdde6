// Whether the process at the other end of the service's socket may be told what this process has to say.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

namespace velk {

/// Nothing when the peer is root, this process's own user, or the owner of the directory that the socket stands in
/// (the daemon's user, whom the system gave it). Otherwise a sentence that says why not.
[[nodiscard]] std::optional<std::string> reasonToDistrustService(const std::string& socketPath, uid_t peer);

}  // namespace velk
