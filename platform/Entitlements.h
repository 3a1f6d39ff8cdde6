// Who may do what: the peer's entitlements, granted by files of the configuration directory.
// The agent loads the rules at its start (and again when it is told to) and asks them for every new connection, before
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
// grant nothing. Root and the daemon's own user have every entitlement.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace velk {

/// The other end of a local connection, as the kernel gives it.
struct PeerCredentials {
  std::uint32_t uid = UINT32_MAX;
  std::uint32_t gid = UINT32_MAX;
  std::int32_t pid = 0;
  /// The program that it runs; empty when it could not be told for certain.
  std::string executable;
};

/// Immutable after loading. Any thread; `valueOfEntitlement` may block in the system's user database.
class EntitlementRules {
 public:
  /// No rules: root and the daemon's user only.
  EntitlementRules() = default;

  /// All `*.conf` files of `<configurationDirectory>/entitlements.d`, by name. Files that others can write (or whose
  /// directory others can) are refused with an error line; so are lines that cannot be understood, one by one.
  [[nodiscard]] static EntitlementRules load(const std::string& configurationDirectory);

  /// Whether the peer has the entitlement. Groups count supplementary ones.
  [[nodiscard]] bool valueOfEntitlement(std::string_view name, const PeerCredentials& peer) const;

  [[nodiscard]] std::size_t grantCount() const noexcept { return _grants.size(); }

 private:
  struct Grant {
    std::string entitlement;
    std::vector<std::string> users;
    std::vector<std::string> groups;
    std::vector<std::string> executables;
  };
  class Parser;

  static bool holds(const Grant& grant, const PeerCredentials& peer);

  std::vector<Grant> _grants;
};

/// The program that a process runs, as a path of this process's file system. Nothing when the process has ended, runs
/// as another user than `uid`, when its program was replaced or removed, or when the path means another file here than
/// there (another mount namespace). The process identifier of a peer names whoever called connect(): it may have died
/// since and its number may have been taken by another process of the same user; and a process may load another
/// program, or hand its connection on, after we looked. So an executable narrows a grant to a user; it is none.
[[nodiscard]] std::optional<std::string> executableOfProcess(std::int32_t pid, std::uint32_t uid);

/// The credentials of the process at the other end of a connected Unix socket. Nothing when the system does not say.
[[nodiscard]] std::optional<PeerCredentials> credentialsOfPeer(int socketDescriptor);

}  // namespace velk
