#include "platform/Entitlements.h"

#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <pwd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <climits>
#include <system_error>

#include "foundation/Text.h"
#include "platform/FileDescriptor.h"
#include "platform/Files.h"
#include "platform/Log.h"
#include "platform/linux/KeyValueFile.h"

namespace velk {
namespace {

constexpr std::size_t kMaximumFileBytes = 256 * 1024;
constexpr std::size_t kNameBufferBytes = 64 * 1024;
constexpr std::size_t kUsualGroups = 32;
constexpr std::size_t kMaximumGroups = 65536;
static_assert(sizeof(gid_t) == sizeof(std::uint32_t));

std::optional<std::uint32_t> number(std::string_view text) {
  std::uint32_t result = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), result);
  if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return result;
}

/// What the user database says of a name. An error: it could not be asked.
using NamedNumber = Result<std::optional<std::uint32_t>>;

NamedNumber answerOfDatabase(int error, const char* kind, const std::string& name, std::optional<std::uint32_t> found) {
  // Several numbers stand for a name that is not there.
  const bool wasAsked = error == 0 || error == ENOENT || error == ESRCH || error == EBADF || error == EPERM;
  if (wasAsked) return found;
  return failure("Entitlements", error,
                 std::string("cannot look up ") + kind + " " + name + ": " + std::generic_category().message(error));
}

NamedNumber userNumber(const std::string& user) {
  if (const auto numbered = number(user)) return numbered;
  std::vector<char> buffer(kNameBufferBytes);
  passwd entry{};
  passwd* found = nullptr;
  const int error = ::getpwnam_r(user.c_str(), &entry, buffer.data(), buffer.size(), &found);
  return answerOfDatabase(error, "user", user, found != nullptr ? std::optional(entry.pw_uid) : std::nullopt);
}

NamedNumber groupNumber(const std::string& group) {
  if (const auto numbered = number(group)) return numbered;
  std::vector<char> buffer(kNameBufferBytes);
  ::group entry{};
  ::group* found = nullptr;
  const int error = ::getgrnam_r(group.c_str(), &entry, buffer.data(), buffer.size(), &found);
  return answerOfDatabase(error, "group", group, found != nullptr ? std::optional(entry.gr_gid) : std::nullopt);
}

/// Without them a grant to a group counts for the primary one alone: the safe side.
std::vector<std::uint32_t> supplementaryGroups(int socket) {
  std::vector<std::uint32_t> groups(kUsualGroups);
  for (;;) {
    auto bytes = static_cast<socklen_t>(groups.size() * sizeof(gid_t));
    if (::getsockopt(socket, SOL_SOCKET, SO_PEERGROUPS, groups.data(), &bytes) == 0) {
      groups.resize(bytes / sizeof(gid_t));
      return groups;
    }
    const std::size_t needed = bytes / sizeof(gid_t);
    if (errno != ERANGE || needed <= groups.size() || needed > kMaximumGroups) return {};
    groups.resize(needed);
  }
}

bool contains(const std::vector<std::uint32_t>& numbers, std::uint32_t sought) {
  return std::find(numbers.begin(), numbers.end(), sought) != numbers.end();
}

bool endsWith(std::string_view text, std::string_view end) {
  return text.size() >= end.size() && text.substr(text.size() - end.size()) == end;
}

}  // namespace

/// Reads one file into grants. Lives for that file.
class EntitlementRules::Parser {
 public:
  Parser(std::string path, LoadedEntitlements& loaded) : _path(std::move(path)), _loaded(loaded) {}

  void run(std::string_view text) {
    for (const auto line : split(text, '\n')) {
      ++_line;
      readLine(trimmed(line));
    }
    endSection();
  }

 private:
  void complain(const char* problem) const { log::error("Entitlements: %s:%d: %s", _path, _line, problem); }

  void readLine(std::string_view line) {
    if (line.empty() || line.front() == '#' || line.front() == ';') return;
    if (line.front() == '[') return beginSection(line);
    const auto equals = line.find('=');
    if (equals == std::string_view::npos) return complain("neither a section nor a setting");
    if (!_hasSection) return complain("a setting outside of a section");
    readSetting(trimmed(line.substr(0, equals)), line.substr(equals + 1));
  }

  void beginSection(std::string_view line) {
    endSection();
    const auto name = line.back() == ']' ? trimmed(line.substr(1, line.size() - 2)) : std::string_view();
    // What follows a section that cannot be understood belongs to nobody.
    _hasSection = !name.empty() && isUtf8(name);
    if (!_hasSection) return complain("a section without a name");
    _sectionLine = _line;
    _current = Grant{std::string(name), {}, {}, {}};
    _hasUnknownNames = false;
  }

  void readSetting(std::string_view key, std::string_view values) {
    const bool isKnown = key == "users" || key == "groups" || key == "executables";
    if (!isKnown) return complain("an unknown setting");
    _restrictsExecutables = _restrictsExecutables || key == "executables";
    for (const auto part : split(values, ',')) {
      const std::string value(trimmed(part));
      if (value.empty()) continue;
      if (key == "users") addNumber(_current.users, userNumber(value), "user", value);
      if (key == "groups") addNumber(_current.groups, groupNumber(value), "group", value);
      if (key == "executables") addExecutable(value);
    }
  }

  void addNumber(std::vector<std::uint32_t>& list, const NamedNumber& found, const char* kind,
                 const std::string& name) {
    if (!found) {
      _hasUnknownNames = true;
      _loaded.unreadable.push_back({found.error().domain, found.error().code,
                                    _path + ":" + std::to_string(_line) + ": " + found.error().description});
    } else if (!*found) {
      _hasUnknownNames = true;
      log::error("Entitlements: %s:%d: there is no %s %s", _path, _line, kind, name);
    } else {
      list.push_back(**found);
    }
  }

  void addExecutable(const std::string& path) {
    if (path.front() != '/') return complain("an executable that is not an absolute path");
    _current.executables.push_back(path);
  }

  void endSection() {
    if (!_hasSection) return;
    _hasSection = false;
    const bool namesSomebody = !_current.users.empty() || !_current.groups.empty();
    // A restriction of which nothing usable is left must not turn into a grant without it.
    const bool restrictionIsLost = std::exchange(_restrictsExecutables, false) && _current.executables.empty();
    if (namesSomebody && !restrictionIsLost) {
      _loaded.rules._grants.push_back(std::move(_current));
      return;
    }
    // Unknown names have had a line of their own.
    if (_hasUnknownNames && !restrictionIsLost) return;
    log::error("Entitlements: %s:%d: the section grants nothing: %s", _path, _sectionLine,
               restrictionIsLost ? "no usable executable" : "no user and no group");
  }

  const std::string _path;
  LoadedEntitlements& _loaded;
  Grant _current;
  bool _hasSection = false;
  bool _restrictsExecutables = false;
  bool _hasUnknownNames = false;
  int _line = 0;
  int _sectionLine = 0;
};

LoadedEntitlements EntitlementRules::load(const std::string& configurationDirectory) {
  LoadedEntitlements loaded;
  const std::string directory = configurationDirectory + "/entitlements.d";
  const auto names = files::list(directory);
  if (!names) {
    const bool isAbsent = names.error().code == static_cast<int>(files::Code::notFound) && !files::exists(directory);
    if (!isAbsent) loaded.unreadable.push_back(names.error());
    return loaded;
  }
  for (const auto& name : *names) {
    if (!endsWith(name, ".conf") || name.front() == '.') continue;
    const std::string path = directory + "/" + name;
    if (files::exists(path) && !files::isTrustworthy(path)) {
      log::error("Entitlements: Ignoring %s: others can write it or its directory", path);
      continue;
    }
    const auto bytes = files::read(path, kMaximumFileBytes);
    if (!bytes) {
      loaded.unreadable.push_back(bytes.error());
      continue;
    }
    Parser(path, loaded).run({reinterpret_cast<const char*>(bytes->data()), bytes->size()});
  }
  return loaded;
}

bool EntitlementRules::hasEverything(const PeerCredentials& peer) { return peer.uid == 0 || peer.uid == ::geteuid(); }

bool EntitlementRules::names(const Grant& grant, const PeerCredentials& peer) {
  if (contains(grant.users, peer.uid) || contains(grant.groups, peer.gid)) return true;
  return std::any_of(peer.groups.begin(), peer.groups.end(),
                     [&](std::uint32_t group) { return contains(grant.groups, group); });
}

bool EntitlementRules::holds(const Grant& grant, const PeerCredentials& peer) {
  const bool runsIt = grant.executables.empty() ||
                      (!peer.executable.empty() && std::find(grant.executables.begin(), grant.executables.end(),
                                                             peer.executable) != grant.executables.end());
  return runsIt && names(grant, peer);
}

bool EntitlementRules::valueOfEntitlement(std::string_view name, const PeerCredentials& peer) const {
  if (peer.uid == UINT32_MAX) return false;
  if (hasEverything(peer)) return true;
  return std::any_of(_grants.begin(), _grants.end(),
                     [&](const Grant& grant) { return grant.entitlement == name && holds(grant, peer); });
}

bool EntitlementRules::dependOnExecutable(const PeerCredentials& peer) const {
  if (peer.uid == UINT32_MAX || hasEverything(peer)) return false;
  return std::any_of(_grants.begin(), _grants.end(),
                     [&](const Grant& grant) { return !grant.executables.empty() && names(grant, peer); });
}

std::optional<std::string> executableOfProcess(std::int32_t pid, std::uint32_t uid) {
  if (pid <= 0) return std::nullopt;
  // While the descriptor says that this process lives, its number belongs to nobody else.
  const FileDescriptor process(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
  if (!process) return std::nullopt;
  const std::string directory = "/proc/" + std::to_string(pid);
  struct stat owner {};
  struct stat running {};
  struct stat named {};
  if (::stat(directory.c_str(), &owner) != 0 || owner.st_uid != uid) return std::nullopt;
  std::array<char, PATH_MAX> target{};
  const ssize_t length = ::readlink((directory + "/exe").c_str(), target.data(), target.size());
  if (length <= 0 || static_cast<std::size_t>(length) >= target.size()) return std::nullopt;
  std::string path(target.data(), static_cast<std::size_t>(length));
  // A process may see other files under this name than we do.
  if (::stat((directory + "/exe").c_str(), &running) != 0 || ::stat(path.c_str(), &named) != 0) return std::nullopt;
  if (running.st_dev != named.st_dev || running.st_ino != named.st_ino) return std::nullopt;
  pollfd ended{process.get(), POLLIN, 0};
  if (::poll(&ended, 1, 0) != 0) return std::nullopt;
  return path;
}

std::optional<PeerCredentials> credentialsOfPeer(int socketDescriptor) {
  ucred credentials{};
  socklen_t length = sizeof credentials;
  if (::getsockopt(socketDescriptor, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) return std::nullopt;
  return PeerCredentials{credentials.uid, credentials.gid, credentials.pid, {}, supplementaryGroups(socketDescriptor)};
}

}  // namespace velk
