// Who may do what: the peer's entitlements, granted by files of the configuration directory.
// The daemon loads the rules at its start (and again when it is told to) and asks them for every new connection, before
// the first byte of it is read.
//
// A file `entitlements.d/NAME.conf`:
//   # comment
//   [com.tavrin.private.velkreportingd]
//   users = alice, 1001
//   groups = media
//   executables = /usr/libexec/media-agent
// One section may stand several times; each is a grant of its own. Who is named by `users` or `groups` has the
// entitlement; with `executables` in the same section only while running one of these programs. Executables alone
// grant nothing. Root and the daemon's own user have every entitlement. Names become numbers when the rules are loaded:
// a user or group that is made later counts after the next load.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "foundation/Error.h"

namespace velk {

/// The other end of a local connection, as the kernel gives it.
struct PeerCredentials {
  std::uint32_t uid = UINT32_MAX;
  std::uint32_t gid = UINT32_MAX;
  std::int32_t pid = 0;
  /// The program that it runs; empty while nobody has looked, and when it could not be told for certain.
  std::string executable;
  /// The supplementary groups that the process had when it connected.
  std::vector<std::uint32_t> groups;
};

struct LoadedEntitlements;

/// Immutable after loading. Any thread; the questions are answered from memory.
class EntitlementRules {
 public:
  /// No rules: root and the daemon's user only.
  EntitlementRules() = default;

  /// All `*.conf` files of `<configurationDirectory>/entitlements.d`, by name. Files that others can write (or whose
  /// directory others can) are refused with an error line; so are lines that cannot be understood, one by one. A name
  /// that the system does not know grants nothing and gets a line as well. Blocks for file work, and in the system's
  /// user database when a rule names a user or a group.
  [[nodiscard]] static LoadedEntitlements load(const std::string& configurationDirectory);

  /// Whether the peer has the entitlement. Groups count supplementary ones.
  [[nodiscard]] bool valueOfEntitlement(std::string_view name, const PeerCredentials& peer) const;
  /// Whether an answer about this peer may depend on its program, so that somebody has to look which one it is.
  [[nodiscard]] bool dependOnExecutable(const PeerCredentials& peer) const;

  [[nodiscard]] int grantCount() const noexcept { return static_cast<int>(_grants.size()); }

 private:
  struct Grant {
    std::string entitlement;
    std::vector<std::uint32_t> users;
    std::vector<std::uint32_t> groups;
    std::vector<std::string> executables;
  };
  class Parser;

  static bool hasEverything(const PeerCredentials& peer);
  static bool names(const Grant& grant, const PeerCredentials& peer);
  static bool holds(const Grant& grant, const PeerCredentials& peer);

  std::vector<Grant> _grants;
};

/// What could be read, and why the rest could not: a directory or file that cannot be read, a user database that cannot
/// be asked. With such an error the rules are not all that the administrator wrote. The caller logs it.
struct LoadedEntitlements {
  EntitlementRules rules;
  std::vector<Error> unreadable;
};

/// The program that a process runs, as a path of this process's file system. Blocks for as long as the file system that
/// holds the program likes: never on the event loop's thread. Nothing when the process has ended, runs
/// as another user than `uid`, when its program was replaced or removed, or when the path means another file here than
/// there (another mount namespace). The process identifier of a peer names whoever called connect(): it may have died
/// since and its number may have been taken by another process of the same user; and a process may load another
/// program, or hand its connection on, after we looked. So an executable narrows a grant to a user; it is none.
[[nodiscard]] std::optional<std::string> executableOfProcess(std::int32_t pid, std::uint32_t uid);

/// The credentials of the process at the other end of a connected Unix socket, without its program: the kernel gives
/// them with the socket, and nobody else is asked. Nothing when the system does not say.
[[nodiscard]] std::optional<PeerCredentials> credentialsOfPeer(int socketDescriptor);

}  // namespace velk
