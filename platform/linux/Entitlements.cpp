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

#include "foundation/Text.h"
#include "platform/FileDescriptor.h"
#include "platform/Files.h"
#include "platform/Log.h"
#include "platform/linux/KeyValueFile.h"

namespace velk {
namespace {

constexpr std::size_t kMaximumFileBytes = 256 * 1024;
constexpr std::size_t kNameBufferBytes = 64 * 1024;
constexpr int kMaximumGroups = 65536;

std::optional<std::uint32_t> number(std::string_view text) {
  std::uint32_t result = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), result);
  if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return result;
}

bool isUser(const std::string& user, std::uint32_t uid) {
  if (const auto named = number(user)) return *named == uid;
  std::vector<char> buffer(kNameBufferBytes);
  passwd entry{};
  passwd* found = nullptr;
  return ::getpwnam_r(user.c_str(), &entry, buffer.data(), buffer.size(), &found) == 0 && found != nullptr &&
         found->pw_uid == uid;
}

std::optional<std::uint32_t> groupNumber(const std::string& group) {
  if (const auto named = number(group)) return named;
  std::vector<char> buffer(kNameBufferBytes);
  ::group entry{};
  ::group* found = nullptr;
  if (::getgrnam_r(group.c_str(), &entry, buffer.data(), buffer.size(), &found) != 0 || found == nullptr) {
    return std::nullopt;
  }
  return found->gr_gid;
}

/// The group that the process runs with, and all that its user belongs to.
std::vector<gid_t> groupsOf(const PeerCredentials& peer) {
  std::vector<gid_t> groups{peer.gid};
  std::vector<char> buffer(kNameBufferBytes);
  passwd entry{};
  passwd* found = nullptr;
  if (::getpwuid_r(peer.uid, &entry, buffer.data(), buffer.size(), &found) != 0 || found == nullptr) return groups;
  int count = 64;
  std::vector<gid_t> listed(static_cast<std::size_t>(count));
  if (::getgrouplist(found->pw_name, found->pw_gid, listed.data(), &count) < 0) {
    count = std::min(count, kMaximumGroups);
    listed.resize(static_cast<std::size_t>(count));
    if (::getgrouplist(found->pw_name, found->pw_gid, listed.data(), &count) < 0) return groups;
  }
  groups.insert(groups.end(), listed.begin(), listed.begin() + count);
  return groups;
}

bool isInAnyGroup(const std::vector<std::string>& granted, const PeerCredentials& peer) {
  if (granted.empty()) return false;
  const auto groups = groupsOf(peer);
  return std::any_of(granted.begin(), granted.end(), [&](const std::string& group) {
    const auto gid = groupNumber(group);
    return gid && std::find(groups.begin(), groups.end(), *gid) != groups.end();
  });
}

bool endsWith(std::string_view text, std::string_view end) {
  return text.size() >= end.size() && text.substr(text.size() - end.size()) == end;
}

}  // namespace

/// Reads one file into grants. Lives for that file.
class EntitlementRules::Parser {
 public:
  Parser(std::string path, std::vector<Grant>& grants) : _path(std::move(path)), _grants(grants) {}

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
  }

  void readSetting(std::string_view key, std::string_view values) {
    std::vector<std::string>* list = nullptr;
    if (key == "users") list = &_current.users;
    if (key == "groups") list = &_current.groups;
    if (key == "executables") list = &_current.executables;
    if (list == nullptr) return complain("an unknown setting");
    _restrictsExecutables = _restrictsExecutables || list == &_current.executables;
    for (const auto part : split(values, ',')) {
      const auto value = trimmed(part);
      if (value.empty()) continue;
      if (list == &_current.executables && value.front() != '/') {
        complain("an executable that is not an absolute path");
        continue;
      }
      list->emplace_back(value);
    }
  }

  void endSection() {
    if (!_hasSection) return;
    _hasSection = false;
    const bool namesSomebody = !_current.users.empty() || !_current.groups.empty();
    // A restriction of which nothing usable is left must not turn into a grant without it.
    const bool restrictionIsLost = std::exchange(_restrictsExecutables, false) && _current.executables.empty();
    if (namesSomebody && !restrictionIsLost) {
      _grants.push_back(std::move(_current));
      return;
    }
    log::error("Entitlements: %s:%d: the section grants nothing: %s", _path, _sectionLine,
               restrictionIsLost ? "no usable executable" : "no user and no group");
  }

  const std::string _path;
  std::vector<Grant>& _grants;
  Grant _current;
  bool _hasSection = false;
  bool _restrictsExecutables = false;
  int _line = 0;
  int _sectionLine = 0;
};

EntitlementRules EntitlementRules::load(const std::string& configurationDirectory) {
  EntitlementRules rules;
  const std::string directory = configurationDirectory + "/entitlements.d";
  const auto names = files::list(directory);
  if (!names) {
    if (names.error().code != static_cast<int>(files::Code::notFound)) {
      log::error("Entitlements: %s", names.error());
    }
    return rules;
  }
  for (const auto& name : *names) {
    if (!endsWith(name, ".conf") || name.front() == '.') continue;
    const std::string path = directory + "/" + name;
    if (!files::isTrustworthy(path)) {
      log::error("Entitlements: Ignoring %s: others can write it or its directory", path);
      continue;
    }
    const auto bytes = files::read(path, kMaximumFileBytes);
    if (!bytes) {
      log::error("Entitlements: Ignoring %s: %s", path, bytes.error());
      continue;
    }
    Parser(path, rules._grants).run({reinterpret_cast<const char*>(bytes->data()), bytes->size()});
  }
  return rules;
}

bool EntitlementRules::holds(const Grant& grant, const PeerCredentials& peer) {
  const bool runsIt = grant.executables.empty() ||
                      (!peer.executable.empty() && std::find(grant.executables.begin(), grant.executables.end(),
                                                             peer.executable) != grant.executables.end());
  if (!runsIt) return false;
  return std::any_of(grant.users.begin(), grant.users.end(),
                     [&](const std::string& user) { return isUser(user, peer.uid); }) ||
         isInAnyGroup(grant.groups, peer);
}

bool EntitlementRules::valueOfEntitlement(std::string_view name, const PeerCredentials& peer) const {
  if (peer.uid == UINT32_MAX) return false;
  if (peer.uid == 0 || peer.uid == ::geteuid()) return true;
  return std::any_of(_grants.begin(), _grants.end(),
                     [&](const Grant& grant) { return grant.entitlement == name && holds(grant, peer); });
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
  PeerCredentials peer{credentials.uid, credentials.gid, credentials.pid, {}};
  peer.executable = executableOfProcess(peer.pid, peer.uid).value_or("");
  return peer;
}

}  // namespace velk
