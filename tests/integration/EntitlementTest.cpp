// Who may speak to the daemon, and who may read what it keeps.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

constexpr uid_t kNobody = 65534;
const PropertyValue kSplunk = PropertyArray{"splunk"};

/// Only root can play other users.
class Entitlement : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root, to run clients as another user";
    server.setStorebag("heather", storebagWith(server));
    Daemon::Options options;
    options.starts = false;
    daemon = std::make_unique<Daemon>(server, options);
  }
  void grant(const std::string& rule, mode_t mode = 0644) {
    const std::string directory = daemon->directory() + "/config/entitlements.d";
    mkdir(directory.c_str(), 0755);
    const std::string file = directory + "/test.conf";
    writeContents(file, rule);
    ASSERT_EQ(chmod(file.c_str(), mode), 0);
  }
  /// The first list that a session of that user gets; nothing when it was turned away.
  PropertyArray openAs(uid_t user) {
    ControlledSession session(*daemon, user);
    return session.open(9, 1);
  }
  void expectRefused() {
    EXPECT_TRUE(openAs(kNobody).empty());
    EXPECT_TRUE(daemon->log().waitForPart("listener: new IPC connection "));
    EXPECT_TRUE(daemon->log().waitForPart(" does not have required velkreporting entitlement. Closing connection..."));
    EXPECT_EQ(daemon->log().count("createReportingSessionWithDelegate: "), 0U);
  }

  ReportingServer server;
  std::unique_ptr<Daemon> daemon;
};

std::string ruleForNobody(const char* entitlement = "com.tavrin.private.velkreportingd") {
  return "[" + std::string(entitlement) + "]\nusers = 65534\n";
}

TEST_F(Entitlement, IsNobodysByDefault) {
  daemon->start();
  expectRefused();
  EXPECT_EQ(openAs(0)[0], kSplunk) << "but root's";
}

TEST_F(Entitlement, IsGrantedByARule) {
  grant(ruleForNobody());
  daemon->start();
  const auto lists = openAs(kNobody);
  ASSERT_EQ(lists.size(), 3U);
  EXPECT_EQ(lists[0], kSplunk);
  EXPECT_TRUE(daemon->log().waitForPart(" as it has proper entitlement, 0(0) connections."));
}

TEST_F(Entitlement, HoldsOnlyWithTheNamedProgram) {
  grant(ruleForNobody() + "executables = /usr/bin/something-else\n");
  daemon->start();
  expectRefused();
}

TEST_F(Entitlement, IsReadAgainAfterAHangUpSignal) {
  daemon->start();
  EXPECT_TRUE(openAs(kNobody).empty());
  grant(ruleForNobody());
  daemon->process().signal(SIGHUP);
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  PropertyArray lists;
  while (lists.empty() && std::chrono::steady_clock::now() < deadline) lists = openAs(kNobody);
  EXPECT_EQ(lists.size(), 3U);
}

TEST_F(Entitlement, OfAnotherNameDoesNotCount) {
  grant(ruleForNobody("com.tavrin.private.velkreportingd.status"));
  daemon->start();
  expectRefused();
}

TEST_F(Entitlement, FromAFileThatOthersCanWriteIsNone) {
  grant(ruleForNobody(), 0666);
  daemon->start();
  expectRefused();
}

TEST_F(Entitlement, FromAFileOfAnotherUserIsNone) {
  grant(ruleForNobody());
  const std::string file = daemon->directory() + "/config/entitlements.d/test.conf";
  ASSERT_EQ(chown(file.c_str(), kNobody, kNobody), 0);
  daemon->start();
  expectRefused();
}

TEST_F(Entitlement, StatusNeedsOneOfItsOwn) {
  grant(ruleForNobody());
  daemon->start();
  EXPECT_EQ(runControl(*daemon, {"status"}).status, 0);
  EXPECT_NE(runControl(*daemon, {"status"}, kNobody).status, 0);
}

TEST_F(Entitlement, SocketIsForAllAndFilesForNobodyElse) {
  daemon->start();
  ASSERT_EQ(openAs(0)[0], kSplunk);
  const auto modeOf = [](const std::string& path) {
    struct stat status {};
    return stat(path.c_str(), &status) == 0 ? status.st_mode & 0777U : 0U;
  };
  EXPECT_EQ(modeOf(daemon->socketPath()), 0666U);
  for (const char* name : {"/state", "/cache", "/logs"}) {
    std::size_t files = 0;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(daemon->directory() + name)) {
      const auto mode = modeOf(entry.path());
      EXPECT_EQ(mode & 0077U, 0U) << entry.path();
      files += entry.is_regular_file() ? 1 : 0;
      EXPECT_EQ(mode, entry.is_directory() ? 0700U : 0600U) << entry.path();
    }
    EXPECT_GT(files, 0U) << name;
  }
}

TEST_F(Entitlement, ConfigurationThatOthersCanWriteIsRefused) {
  const std::string key = daemon->directory() + "/config/publicKey.der";
  ASSERT_EQ(chmod(key.c_str(), 0666), 0);
  daemon->start();
  EXPECT_EQ(openAs(0), noLists()) << "the key could be anybody's";
}

TEST_F(Entitlement, DeviceFileThatOthersCanWriteIsRefused) {
  const std::string file = daemon->directory() + "/config/device.conf";
  writeContents(file, kInternalDeviceLines);
  ASSERT_EQ(chmod(file.c_str(), 0666), 0);
  daemon->start();
  ASSERT_EQ(openAs(0)[0], kSplunk);
  ASSERT_TRUE(server.waitForEvents(1));
  EXPECT_EQ(integerValue(server.events()[0].find("_internal")), 2);
}

TEST_F(Entitlement, CrowdOfRefusedClientsHurtsNobody) {
  daemon->start();
  for (int i = 0; i < 15; ++i) EXPECT_TRUE(openAs(kNobody).empty());
  EXPECT_EQ(openAs(0)[0], kSplunk);
}

}  // namespace
}  // namespace velk::test
