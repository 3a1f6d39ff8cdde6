#include "platform/Directories.h"

#include <gtest/gtest.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <string>

#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

constexpr uid_t kNobody = 65534;
/// Of whom the user database knows nothing.
constexpr uid_t kUnknownUser = 1'999'999'999;

/// Somebody else for a scope; only root may be.
class AnotherUser {
 public:
  explicit AnotherUser(uid_t user) { EXPECT_EQ(::seteuid(user), 0); }
  ~AnotherUser() { EXPECT_EQ(::seteuid(0), 0); }
  AnotherUser(const AnotherUser&) = delete;
  AnotherUser& operator=(const AnotherUser&) = delete;
};

class DirectoriesTest : public testing::Test {
 protected:
  DirectoriesTest() { clear(); }
  ~DirectoriesTest() override { clear(); }
  static void clear() {
    for (const char* name : {"RUNTIME_DIRECTORY", "STATE_DIRECTORY", "CACHE_DIRECTORY", "LOGS_DIRECTORY",
                             "CONFIGURATION_DIRECTORY", "VELKREPORTING_DATA_DIRECTORY", "VELKREPORTING_SOCKET"}) {
      ::unsetenv(name);
    }
  }
};

TEST_F(DirectoriesTest, FollowsTheServiceManager) {
  ::setenv("RUNTIME_DIRECTORY", "/run/other", 1);
  ::setenv("STATE_DIRECTORY", "/var/lib/one:/var/lib/two", 1);
  ::setenv("CACHE_DIRECTORY", "/var/cache/other/", 1);
  ::setenv("LOGS_DIRECTORY", "/var/log/other", 1);
  ::setenv("CONFIGURATION_DIRECTORY", "/etc/other", 1);
  const auto directories = daemonDirectories();
  EXPECT_EQ(directories.runtime, "/run/other");
  EXPECT_EQ(directories.state, "/var/lib/one");
  EXPECT_EQ(directories.cache, "/var/cache/other");
  EXPECT_EQ(directories.logs, "/var/log/other");
  EXPECT_EQ(directories.configuration, "/etc/other");
}

TEST_F(DirectoriesTest, IgnoresTheVariablesOfTheHostInALibrary) {
  const auto before = clientDirectories();
  ::setenv("STATE_DIRECTORY", "/var/lib/host", 1);
  ::setenv("RUNTIME_DIRECTORY", "/run/host", 1);
  EXPECT_EQ(clientDirectories().state, before.state);
  EXPECT_EQ(clientDirectories().runtime, before.runtime);
  EXPECT_EQ(daemonDirectories().state, "/var/lib/host");
}

TEST_F(DirectoriesTest, IgnoresPathsThatAreNotAbsolute) {
  const auto before = daemonDirectories();
  ::setenv("STATE_DIRECTORY", "relative", 1);
  ::setenv("CACHE_DIRECTORY", "", 1);
  EXPECT_EQ(daemonDirectories().state, before.state);
  EXPECT_EQ(daemonDirectories().cache, before.cache);
}

TEST_F(DirectoriesTest, KeepsRootToTheSystemsDirectories) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root";
  const auto directories = daemonDirectories();
  EXPECT_EQ(directories.runtime, "/run/velkreporting");
  EXPECT_EQ(directories.state, "/var/lib/velkreporting");
  EXPECT_EQ(directories.cache, "/var/cache/velkreporting");
  EXPECT_EQ(directories.logs, "/var/log/velkreporting");
  EXPECT_EQ(directories.configuration, "/etc/velkreporting");
}

TEST_F(DirectoriesTest, FindsTheSocketByItsVariable) {
  EXPECT_NE(daemonSocketPath().find("/velkreporting/com.tavrin.velkreportingd"), std::string::npos);
  ::setenv("VELKREPORTING_SOCKET", "/tmp/socket", 1);
  EXPECT_EQ(daemonSocketPath(), "/tmp/socket");
}

TEST_F(DirectoriesTest, FindsInstalledDataByItsVariable) {
  EXPECT_NE(clientDirectories().data.find("/velkreporting"), std::string::npos);
  ::setenv("VELKREPORTING_DATA_DIRECTORY", "/opt/data", 1);
  EXPECT_EQ(clientDirectories().data, "/opt/data");
}

/// The library's place, for homes and users of the test's choice.
class LibraryDirectoryTest : public DirectoriesTest {
 protected:
  LibraryDirectoryTest() : _home(valueOf("HOME")), _state(valueOf("XDG_STATE_HOME")) { ::unsetenv("XDG_STATE_HOME"); }
  ~LibraryDirectoryTest() override {
    restore("HOME", _home);
    restore("XDG_STATE_HOME", _state);
  }

  [[nodiscard]] static std::string inHomeOfDatabase() {
    const passwd* const entry = ::getpwuid(::geteuid());
    return entry == nullptr ? std::string() : entry->pw_dir + std::string("/.local/state/velkreporting-client");
  }
  [[nodiscard]] static bool isRoot() { return ::geteuid() == 0; }

  const test::TemporaryDirectory home;

 private:
  static std::string valueOf(const char* name) {
    const char* const value = std::getenv(name);
    return value != nullptr ? value : "";
  }
  static void restore(const char* name, const std::string& value) {
    value.empty() ? ::unsetenv(name) : ::setenv(name, value.c_str(), 1);
  }

  const std::string _home;
  const std::string _state;
};

TEST_F(LibraryDirectoryTest, StandsInTheHomeOfTheCaller) {
  ::setenv("HOME", home.path().c_str(), 1);
  EXPECT_EQ(libraryStateDirectory(), home / ".local/state/velkreporting-client");
  ::setenv("XDG_STATE_HOME", (home / "").c_str(), 1);
  EXPECT_EQ(libraryStateDirectory(), home / "velkreporting-client");
  if (!isRoot()) GTEST_SKIP() << "the rest needs root";
  const AnotherUser nobody(kNobody);
  EXPECT_EQ(libraryStateDirectory(), home / "velkreporting-client");
  ::unsetenv("XDG_STATE_HOME");
  EXPECT_EQ(libraryStateDirectory(), home / ".local/state/velkreporting-client");
}

TEST_F(LibraryDirectoryTest, IsNoneOfADaemons) {
  const auto isApart = [] {
    const std::string own = libraryStateDirectory() + "/";
    const auto daemons = daemonDirectories();
    bool apart = true;
    for (const auto& each : {daemons.state, daemons.runtime, daemons.cache, daemons.logs, daemons.configuration}) {
      apart = apart && !own.starts_with(each + "/") && !(each + "/").starts_with(own);
    }
    return apart;
  };
  ::setenv("HOME", home.path().c_str(), 1);
  for (const char* const state : {"", home.path().c_str()}) {
    ::setenv("XDG_STATE_HOME", state, 1);
    EXPECT_TRUE(isApart()) << "of the same user";
    if (!isRoot()) continue;
    const AnotherUser nobody(kNobody);
    EXPECT_TRUE(isApart()) << "of the same user, who is not root";
  }
}

TEST_F(LibraryDirectoryTest, IgnoresTheVariablesOfTheHost) {
  ::setenv("HOME", home.path().c_str(), 1);
  ::setenv("STATE_DIRECTORY", "/var/lib/host", 1);
  ::setenv("CONFIGURATION_DIRECTORY", "/etc/host", 1);
  EXPECT_EQ(libraryStateDirectory(), home / ".local/state/velkreporting-client");
}

TEST_F(LibraryDirectoryTest, StandsInTheHomeOfTheUserDatabaseWhereNoVariableNamesOne) {
  for (const char* const value : {"", "relative", "./here"}) {
    ::setenv("HOME", value, 1);
    ::setenv("XDG_STATE_HOME", value, 1);
    EXPECT_EQ(libraryStateDirectory(), inHomeOfDatabase()) << value;
  }
  ::unsetenv("HOME");
  ::unsetenv("XDG_STATE_HOME");
  EXPECT_EQ(libraryStateDirectory(), inHomeOfDatabase());
}

TEST_F(LibraryDirectoryTest, IsNowhereForAUserWithoutAHome) {
  if (!isRoot()) GTEST_SKIP() << "needs root";
  const AnotherUser unknown(kUnknownUser);
  ::unsetenv("HOME");
  EXPECT_EQ(libraryStateDirectory(), "");
  ::setenv("HOME", "relative", 1);
  EXPECT_EQ(libraryStateDirectory(), "");
}

TEST_F(LibraryDirectoryTest, KeepsRootOutOfTheHomesOfOthers) {
  if (!isRoot()) GTEST_SKIP() << "needs root";
  const std::string foreign = home / "foreign";
  ASSERT_EQ(::mkdir(foreign.c_str(), 0700), 0);
  ASSERT_EQ(::chown(foreign.c_str(), kNobody, kNobody), 0);
  const std::string file = home.write("file", "");
  for (const auto& path : {foreign, file, home / "missing"}) {
    ::unsetenv("XDG_STATE_HOME");
    ::setenv("HOME", path.c_str(), 1);
    EXPECT_EQ(libraryStateDirectory(), inHomeOfDatabase()) << path;
    ::setenv("HOME", home.path().c_str(), 1);
    ::setenv("XDG_STATE_HOME", path.c_str(), 1);
    EXPECT_EQ(libraryStateDirectory(), home / ".local/state/velkreporting-client") << path;
  }
}

}  // namespace
}  // namespace velk
