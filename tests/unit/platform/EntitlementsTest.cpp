#include "platform/Entitlements.h"

#include <grp.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <set>
#include <vector>

#include "platform/FileDescriptor.h"
#include "tests/support/RecordingLog.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

constexpr std::string_view kName = "com.tavrin.private.velkreportingd";
constexpr std::uint32_t kSomebody = 54321;
constexpr std::uint32_t kSomeGroup = 54322;

class EntitlementsTest : public testing::Test {
 protected:
  std::string grant(std::string_view text, std::string_view file = "test.conf") const {
    return directory.write("entitlements.d/" + std::string(file), text);
  }
  [[nodiscard]] LoadedEntitlements loaded() const { return EntitlementRules::load(directory.path()); }
  [[nodiscard]] EntitlementRules rules() const { return loaded().rules; }
  [[nodiscard]] bool holds(const PeerCredentials& peer) const { return rules().valueOfEntitlement(kName, peer); }

  test::RecordingLog log;
  const test::TemporaryDirectory directory;
  const PeerCredentials somebody{kSomebody, kSomeGroup, 1, "/usr/bin/agent", {}};
};

TEST_F(EntitlementsTest, GrantsNobodyByDefault) {
  EXPECT_FALSE(holds(somebody));
  EXPECT_FALSE(EntitlementRules().valueOfEntitlement(kName, somebody));
  EXPECT_FALSE(EntitlementRules().valueOfEntitlement(kName, PeerCredentials{}));
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(EntitlementsTest, GrantsRootAndItself) {
  EXPECT_TRUE(holds({0, 0, 1, "", {}}));
  EXPECT_TRUE(holds({::geteuid(), ::getegid(), 1, "", {}}));
}

TEST_F(EntitlementsTest, GrantsNamedUsers) {
  grant("[com.tavrin.private.velkreportingd]\nusers = 54320, 54321 ,nobody\n");
  EXPECT_TRUE(holds(somebody));
  EXPECT_TRUE(holds({65534, 65534, 1, "", {}}));
  EXPECT_FALSE(holds({54319, kSomeGroup, 1, "", {}}));
}

TEST_F(EntitlementsTest, GrantsNamedGroups) {
  grant("[com.tavrin.private.velkreportingd]\ngroups=54322\n");
  EXPECT_TRUE(holds(somebody));
  EXPECT_FALSE(holds({kSomebody, 1, 1, "", {}}));
}

TEST_F(EntitlementsTest, CountsTheSupplementaryGroupsOfTheProcess) {
  grant("[com.tavrin.private.velkreportingd]\ngroups=54323\n");
  EXPECT_TRUE(holds({kSomebody, kSomeGroup, 1, "", {7, 54323}}));
  EXPECT_FALSE(holds({kSomebody, kSomeGroup, 1, "", {7, 8}}));
}

TEST_F(EntitlementsTest, DoesNotCountGroupsThatTheUserHasAndTheProcessHasNot) {
  // A user whose primary group is known to the system, running with another one.
  grant("[com.tavrin.private.velkreportingd]\ngroups=daemon\n");
  EXPECT_FALSE(holds({1, 4, 1, "", {}}));
}

TEST_F(EntitlementsTest, NamesTheNamesThatNobodyKnows) {
  const auto path = grant("[com.tavrin.private.velkreportingd]\nusers=no-such-user, 54321\ngroups=no-such-group\n");
  EXPECT_TRUE(holds(somebody));
  EXPECT_EQ(log.count(log::Level::error, "Entitlements: " + path + ":2: there is no user no-such-user"), 1);
  EXPECT_EQ(log.count(log::Level::error, "Entitlements: " + path + ":3: there is no group no-such-group"), 1);
  EXPECT_EQ(log.lines().size(), 2U);
}

TEST_F(EntitlementsTest, NeedsAProgramOnlyForThePeersOfGrantsThatNameOne) {
  grant(
      "[com.tavrin.private.velkreportingd]\nusers=54321\n"
      "[com.tavrin.private.velkreportingd]\ngroups=54399\nexecutables=/usr/bin/agent\n");
  EXPECT_FALSE(rules().dependOnExecutable(somebody));
  EXPECT_TRUE(rules().dependOnExecutable({1, 54399, 1, "", {}}));
  EXPECT_FALSE(rules().dependOnExecutable({0, 54399, 1, "", {}})) << "root has everything anyway";
  EXPECT_FALSE(rules().dependOnExecutable(PeerCredentials{}));
}

TEST_F(EntitlementsTest, SaysWhichFileCannotBeRead) {
  grant("[com.tavrin.private.velkreportingd]\nusers=54321\n", "a.conf");
  std::filesystem::create_directory(directory / "entitlements.d/b.conf");
  const auto read = loaded();
  EXPECT_EQ(read.rules.grantCount(), 1);
  ASSERT_EQ(read.unreadable.size(), 1U);
  EXPECT_NE(read.unreadable[0].description.find("entitlements.d/b.conf is not a regular file"), std::string::npos);
}

TEST_F(EntitlementsTest, SaysThatTheDirectoryCannotBeRead) {
  static_cast<void>(directory.write("entitlements.d", "no directory"));
  ASSERT_EQ(loaded().unreadable.size(), 1U);
  EXPECT_NE(loaded().unreadable[0].description.find("entitlements.d"), std::string::npos);
}

TEST_F(EntitlementsTest, IsBoundToTheNameOfTheSection) {
  grant("[com.tavrin.private.other]\nusers=54321\n");
  EXPECT_FALSE(holds(somebody));
  EXPECT_TRUE(rules().valueOfEntitlement("com.tavrin.private.other", somebody));
}

TEST_F(EntitlementsTest, NarrowsAGrantToExecutables) {
  grant("[com.tavrin.private.velkreportingd]\nusers=54321\nexecutables=/usr/bin/agent, /usr/bin/other\n");
  EXPECT_TRUE(holds(somebody));
  EXPECT_FALSE(holds({kSomebody, kSomeGroup, 1, "/tmp/agent", {}}));
  EXPECT_FALSE(holds({kSomebody, kSomeGroup, 1, "", {}}));
  EXPECT_FALSE(holds({54319, kSomeGroup, 1, "/usr/bin/agent", {}}));
}

TEST_F(EntitlementsTest, GrantsNothingToAnExecutableAlone) {
  const auto path = grant("[com.tavrin.private.velkreportingd]\nexecutables=/usr/bin/agent\n");
  EXPECT_FALSE(holds(somebody));
  EXPECT_EQ(
      log.count(log::Level::error, "Entitlements: " + path + ":1: the section grants nothing: no user and no group"),
      1);
}

TEST_F(EntitlementsTest, DoesNotWidenAGrantWhoseExecutablesAreUnusable) {
  grant("[com.tavrin.private.velkreportingd]\nusers=54321\nexecutables=relative/agent\n");
  EXPECT_FALSE(holds(somebody));
  grant("[com.tavrin.private.velkreportingd]\nusers=54321\nexecutables=\n");
  EXPECT_FALSE(holds(somebody));
}

TEST_F(EntitlementsTest, TakesSectionsOfOneNameApart) {
  grant(
      "[com.tavrin.private.velkreportingd]\nusers=54320\n"
      "[com.tavrin.private.velkreportingd]\nexecutables=/usr/bin/agent\ngroups=1\n");
  EXPECT_FALSE(holds(somebody));
  EXPECT_TRUE(holds({54320, kSomeGroup, 1, "", {}}));
}

TEST_F(EntitlementsTest, ReadsEveryConfigurationFile) {
  grant("[com.tavrin.private.velkreportingd]\nusers=54320\n", "a.conf");
  grant("[com.tavrin.private.velkreportingd]\nusers=54321\n", "b.conf");
  grant("[com.tavrin.private.velkreportingd]\nusers=54322\n", "c.conf.bak");
  EXPECT_TRUE(holds(somebody));
  EXPECT_FALSE(holds({54322, 1, 1, "", {}}));
  EXPECT_EQ(rules().grantCount(), 2U);
}

TEST_F(EntitlementsTest, RefusesFilesThatOthersCanWrite) {
  const auto path = grant("[com.tavrin.private.velkreportingd]\nusers=54321\n", "a.conf");
  ASSERT_EQ(::chmod(path.c_str(), 0646), 0);
  EXPECT_FALSE(holds(somebody));
  EXPECT_EQ(log.count(log::Level::error, "Entitlements: Ignoring " + path + ": others can write it or its directory"),
            1);
  ASSERT_EQ(::chmod(path.c_str(), 0644), 0);
  EXPECT_TRUE(holds(somebody));
}

TEST_F(EntitlementsTest, RefusesFilesInADirectoryThatOthersCanWrite) {
  grant("[com.tavrin.private.velkreportingd]\nusers=54321\n");
  ASSERT_EQ(::chmod((directory / "entitlements.d").c_str(), 0777), 0);
  EXPECT_FALSE(holds(somebody));
}

TEST_F(EntitlementsTest, NamesTheLineOfWhatItDoesNotUnderstand) {
  const auto path = grant(
      "users=54320\n"
      "[com.tavrin.private.velkreportingd]\n"
      "nonsense\n"
      "owners=54320\n"
      "users=54321\n"
      "[\n"
      "users=54320\n");
  EXPECT_TRUE(holds(somebody));
  EXPECT_FALSE(holds({54320, 1, 1, "", {}}));
  log.clear();
  (void)rules();
  EXPECT_EQ(log.count("Entitlements: " + path + ":1: a setting outside of a section"), 1);
  EXPECT_EQ(log.count("Entitlements: " + path + ":3: neither a section nor a setting"), 1);
  EXPECT_EQ(log.count("Entitlements: " + path + ":4: an unknown setting"), 1);
  EXPECT_EQ(log.count("Entitlements: " + path + ":6: a section without a name"), 1);
  EXPECT_EQ(log.count("Entitlements: " + path + ":7: a setting outside of a section"), 1);
  EXPECT_EQ(log.lines().size(), 5U);
}

TEST_F(EntitlementsTest, TellsTheExecutableOfAProcess) {
  const auto own = executableOfProcess(::getpid(), ::geteuid());
  ASSERT_TRUE(own);
  EXPECT_EQ(*own, std::filesystem::read_symlink("/proc/self/exe").string());
  EXPECT_EQ(executableOfProcess(::getpid(), ::geteuid() + 1), std::nullopt);
  EXPECT_EQ(executableOfProcess(0, 0), std::nullopt);
  EXPECT_EQ(executableOfProcess(-5, 0), std::nullopt);
}

TEST_F(EntitlementsTest, TellsWhoIsAtTheOtherEnd) {
  int ends[2] = {-1, -1};
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM, 0, ends), 0);
  const FileDescriptor first(ends[0]);
  const FileDescriptor second(ends[1]);
  const auto peer = credentialsOfPeer(first.get());
  ASSERT_TRUE(peer);
  EXPECT_EQ(peer->uid, ::geteuid());
  EXPECT_EQ(peer->gid, ::getegid());
  EXPECT_EQ(peer->pid, ::getpid());
  EXPECT_EQ(peer->executable, "") << "nobody asks the file system for it";
  std::vector<gid_t> groups(static_cast<std::size_t>(::getgroups(0, nullptr)));
  ASSERT_EQ(::getgroups(static_cast<int>(groups.size()), groups.data()), static_cast<int>(groups.size()));
  EXPECT_EQ(std::multiset<gid_t>(peer->groups.begin(), peer->groups.end()),
            std::multiset<gid_t>(groups.begin(), groups.end()));
  EXPECT_EQ(credentialsOfPeer(-1), std::nullopt);
}

}  // namespace
}  // namespace velk
