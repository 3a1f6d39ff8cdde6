#include "platform/Directories.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>

namespace velk {
namespace {

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

}  // namespace
}  // namespace velk
