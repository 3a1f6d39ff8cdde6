#include "platform/Directories.h"

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <string_view>
#include <vector>

#ifndef VELK_DATA_DIRECTORY
#define VELK_DATA_DIRECTORY "/usr/share/velkreporting"
#endif

namespace velk {
namespace {

constexpr const char* kName = "/velkreporting";
constexpr const char* kLibraryName = "/velkreporting-client";
constexpr const char* kStateBelowHome = "/.local/state";
constexpr const char* kSocketName = "/com.tavrin.velkreportingd";
constexpr const char* kSystemRuntimeDirectory = "/run/velkreporting";
constexpr const char* kSystemSocket = "/run/velkreporting/com.tavrin.velkreportingd";

/// Nothing for a variable that is unset, empty, or not an absolute path (which the conventions tell to ignore). A
/// list of paths, as service managers give for several directories, counts by its first.
std::string pathFromEnvironment(const char* name, bool mayBeList = false) {
  const char* value = ::secure_getenv(name);
  if (value == nullptr || value[0] != '/') return {};
  std::string path(value);
  if (mayBeList) path = path.substr(0, path.find(':'));
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

/// Nothing for a user of whom the user database knows no home.
std::string homeFromUserDatabase() {
  std::vector<char> buffer(16384);
  passwd entry{};
  passwd* found = nullptr;
  if (::getpwuid_r(::geteuid(), &entry, buffer.data(), buffer.size(), &found) == 0 && found != nullptr &&
      found->pw_dir != nullptr && found->pw_dir[0] == '/') {
    return found->pw_dir;
  }
  return {};
}

std::string homeDirectory() {
  if (auto home = pathFromEnvironment("HOME"); !home.empty()) return home;
  auto home = homeFromUserDatabase();
  return home.empty() ? "/nonexistent" : home;
}

std::string baseDirectory(const char* variable, const char* belowHome) {
  auto path = pathFromEnvironment(variable);
  return path.empty() ? homeDirectory() + belowHome : path;
}

std::string userRuntimeDirectory() {
  const auto path = pathFromEnvironment("XDG_RUNTIME_DIR");
  return (path.empty() ? "/run/user/" + std::to_string(::geteuid()) : path) + kName;
}

std::string dataDirectory() {
  const auto path = pathFromEnvironment("VELKREPORTING_DATA_DIRECTORY");
  return path.empty() ? VELK_DATA_DIRECTORY : path;
}

Directories systemDirectories() {
  return {kSystemRuntimeDirectory,  "/var/lib/velkreporting", "/var/cache/velkreporting",
          "/var/log/velkreporting", "/etc/velkreporting",     dataDirectory()};
}

Directories userDirectories() {
  const std::string state = baseDirectory("XDG_STATE_HOME", kStateBelowHome) + kName;
  return {userRuntimeDirectory(),
          state,
          baseDirectory("XDG_CACHE_HOME", "/.cache") + kName,
          state + "/log",
          baseDirectory("XDG_CONFIG_HOME", "/.config") + kName,
          dataDirectory()};
}

void replaceBy(std::string& directory, const char* variable) {
  if (auto path = pathFromEnvironment(variable, true); !path.empty()) directory = std::move(path);
}

/// Whether the caller may keep something below `directory`. For others than root the system decides that. Root is kept
/// out of homes that others own, where it would follow anybody's links, and makes no home that is not there.
bool isForCaller(const std::string& directory) {
  if (directory.empty() || ::geteuid() != 0) return !directory.empty();
  struct stat status {};
  return ::stat(directory.c_str(), &status) == 0 && S_ISDIR(status.st_mode) && status.st_uid == 0;
}

bool isSocket(const std::string& path) {
  struct stat status {};
  return ::stat(path.c_str(), &status) == 0 && S_ISSOCK(status.st_mode);
}

}  // namespace

Directories daemonDirectories() {
  Directories directories = clientDirectories();
  replaceBy(directories.runtime, "RUNTIME_DIRECTORY");
  replaceBy(directories.state, "STATE_DIRECTORY");
  replaceBy(directories.cache, "CACHE_DIRECTORY");
  replaceBy(directories.logs, "LOGS_DIRECTORY");
  replaceBy(directories.configuration, "CONFIGURATION_DIRECTORY");
  return directories;
}

Directories clientDirectories() { return ::geteuid() == 0 ? systemDirectories() : userDirectories(); }

std::string libraryStateDirectory() {
  if (const auto state = pathFromEnvironment("XDG_STATE_HOME"); isForCaller(state)) return state + kLibraryName;
  auto home = pathFromEnvironment("HOME");
  if (!isForCaller(home)) home = homeFromUserDatabase();
  return isForCaller(home) ? home + kStateBelowHome + kLibraryName : std::string();
}

std::string daemonSocketPath() {
  if (auto path = pathFromEnvironment("VELKREPORTING_SOCKET"); !path.empty()) return path;
  if (::geteuid() != 0) {
    if (auto own = userRuntimeDirectory() + kSocketName; isSocket(own)) return own;
  }
  return kSystemSocket;
}

}  // namespace velk
