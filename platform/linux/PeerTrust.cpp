#include "platform/PeerTrust.h"

#include <sys/stat.h>
#include <unistd.h>

namespace velk {

std::optional<std::string> reasonToDistrustService(const std::string& socketPath, uid_t peer) {
  if (peer == 0 || peer == geteuid()) return std::nullopt;
  const std::size_t slash = socketPath.rfind('/');
  const std::string directory = slash == std::string::npos ? "." : socketPath.substr(0, slash == 0 ? 1 : slash);
  struct stat information {};
  if (stat(directory.c_str(), &information) == 0 && information.st_uid == peer) return std::nullopt;
  return "the process that answers at " + socketPath + " runs as user " + std::to_string(peer) +
         ", who is neither root, nor this user, nor the owner of that directory: it is told nothing";
}

}  // namespace velk
