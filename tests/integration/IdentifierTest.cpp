// The identifiers that the library keeps for its host, beside a daemon whose directories are those that a daemon of the
// same user has.

#include <unistd.h>

#include <array>

#include "tests/integration/HostProcess.h"

namespace velk::test {
namespace {

constexpr uid_t kNobody = 65534;
/// Of whom the user database knows nothing.
constexpr uid_t kUnknownUser = 1'999'999'999;
constexpr const char* kSuite = "/com.tavrin.velkreporting.json";

class IdentifierTest : public HostProcessTest {
 protected:
  IdentifierTest() {
    Daemon::Options options;
    options.starts = false;
    options.environment["STATE_DIRECTORY"] = state;
    daemon = std::make_unique<Daemon>(server, options);
    std::filesystem::create_directories(state);
    std::filesystem::copy_file(daemon->directory() + "/state" + kSuite, state + kSuite);
  }

  [[nodiscard]] HostProcess makeHost(std::optional<uid_t> user) const {
    return HostProcess(*daemon, {{{"HOME", home.path()}, {"XDG_STATE_HOME", ""}}, user});
  }
  /// The identifier that the daemon posts with an event of another host's.
  [[nodiscard]] std::string postedWith(int number) {
    HostProcess reporter(*daemon);
    reporter.open(number);
    EXPECT_EQ(reporter.call("send " + std::to_string(number) + " 1"), "");
    EXPECT_TRUE(reporter.flush());
    EXPECT_TRUE(server.waitForEvents(static_cast<std::size_t>(number), {7}));
    const std::string* const identifier = server.posts().back().body.string("clientId");
    return identifier != nullptr ? *identifier : "none";
  }
  [[nodiscard]] std::map<std::string, std::string> daemonsFiles() const {
    std::map<std::string, std::string> files;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(state)) {
      if (entry.is_regular_file()) files[entry.path()] = contentsOf(entry.path());
    }
    return files;
  }
  void expectThatTheDaemonReadsNothingOf(std::optional<uid_t> user);

  const TemporaryDirectory home;
  const std::string state = home / ".local/state/velkreporting";
};

void IdentifierTest::expectThatTheDaemonReadsNothingOf(std::optional<uid_t> user) {
  daemon->start();
  auto host = makeHost(user);
  const std::string made = host.call("identifier");
  ASSERT_EQ(made.size(), 37U);
  const std::string posted = postedWith(1);
  EXPECT_EQ(posted.size(), 36U);

  ASSERT_EQ(daemon->stop(), 0);  // nobody else writes
  const auto before = daemonsFiles();
  EXPECT_EQ(host.call("regenerate"), "");
  const std::string renewed = host.call("identifier");
  EXPECT_NE(renewed, made);
  EXPECT_EQ(daemonsFiles(), before);
  const std::array<std::string, 2> identifiers{made.substr(1), renewed.substr(1)};
  for (const auto& identifier : identifiers) {
    for (const auto& [path, contents] : before) EXPECT_EQ(contents.find(identifier), std::string::npos) << path;
    EXPECT_EQ(contentsOf(std::string("/var/lib/velkreporting") + kSuite).find(identifier), std::string::npos);
    EXPECT_NE(posted, identifier);
  }
  EXPECT_NE(contentsOf(home / ".local/state/velkreporting-client" + kSuite).find(identifiers[1]), std::string::npos);

  daemon->start();
  EXPECT_EQ(postedWith(2), posted);
  EXPECT_EQ(host.call("identifier"), renewed);
  EXPECT_EQ(host.end("return"), 0);
}

TEST_F(IdentifierTest, NeverReachTheDaemonOfTheSameUser) { expectThatTheDaemonReadsNothingOf(std::nullopt); }

TEST_F(IdentifierTest, NeverReachTheDaemonWhoseFilesTheHostMayWrite) {
  if (geteuid() != 0) GTEST_SKIP() << "only root may be somebody else";
  std::vector<std::filesystem::path> paths{home.path()};
  for (const auto& entry : std::filesystem::recursive_directory_iterator(home.path())) paths.push_back(entry.path());
  for (const auto& path : paths) ASSERT_EQ(chown(path.c_str(), kNobody, kNobody), 0);
  expectThatTheDaemonReadsNothingOf(kNobody);
}

TEST_F(IdentifierTest, AreNotKeptForAUserWithoutAHome) {
  if (geteuid() != 0) GTEST_SKIP() << "only root may be somebody else";
  HostProcess host(*daemon, {{{"HOME", ""}, {"XDG_STATE_HOME", ""}}, kUnknownUser});
  const std::string first = host.call("identifier");
  EXPECT_EQ(first.size(), 37U);
  EXPECT_EQ(host.call("regenerate"), "");
  EXPECT_NE(host.call("identifier"), first);
  EXPECT_EQ(host.log().countOnceThereAre(3, "Cannot store uuidRespectDNU: the user has no home directory"), 3U);
  EXPECT_EQ(host.end("return"), 0);
}

}  // namespace
}  // namespace velk::test
