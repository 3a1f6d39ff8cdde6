// What runs out: descriptors of the daemon, descriptors on a connection, room for replies. Whoever uses it up is felt
// by himself alone, and what was scarce is used again when it is there.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <sstream>
#include <thread>

#include "tests/integration/HandWrittenCalls.h"
#include "tests/integration/RawConnection.h"
#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

using namespace cbor;

const PropertyValue kSplunk = PropertyArray{"splunk"};

constexpr std::uint64_t kSetSessionInfo = 1;
constexpr std::uint64_t kStartConfig = 2;
constexpr std::uint64_t kSendMessage = 5;
constexpr std::uint64_t kFlush = 6;
constexpr std::uint64_t kUploadFile = 8;

// The check of objects' types that goes with the address sanitizer asks a pipe of its own whether memory is there, and
// takes a sound object for a broken one where no pipe can be had.
#ifdef __SANITIZE_ADDRESS__
constexpr bool kSanitizerNeedsDescriptors = true;
#else
constexpr bool kSanitizerNeedsDescriptors = false;
#endif

class Scarcity : public testing::Test {
 protected:
  Scarcity() {
    server.setStorebag("heather", storebagWith(server));
    server.setStorebag("clover", storebagWith(server));
    daemon = std::make_unique<Daemon>(server);
    honest = std::make_unique<ControlledSession>(*daemon);
    EXPECT_EQ(honest->open(9, 1)[0], kSplunk);
  }
  ~Scarcity() override {
    honest->sendEvent(777, 1, PropertyDictionary{{"still", "here"}});
    EXPECT_TRUE(server.waitForEvents(1, {777})) << "the honest session is served to the end";
    EXPECT_EQ(honest->finish(), 0);
    EXPECT_EQ(daemon->stop(), 0);
  }

  [[nodiscard]] std::string procPath(const char* name) const {
    return "/proc/" + std::to_string(daemon->process().pid()) + "/" + name;
  }
  [[nodiscard]] std::size_t openDescriptors() const {
    const std::filesystem::directory_iterator entries(procPath("fd"));
    return static_cast<std::size_t>(std::distance(begin(entries), end(entries)));
  }
  /// False when they did not become so few in time.
  [[nodiscard]] bool waitForDescriptors(std::size_t most) const {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (openDescriptors() > most) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::yield();
    }
    return true;
  }
  /// Processor time of the daemon so far.
  [[nodiscard]] std::chrono::milliseconds processorTime() const {
    std::ifstream file(procPath("stat"));
    std::string text((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
    std::istringstream fields(text.substr(text.rfind(')') + 1));
    std::string skipped;
    for (int field = 3; field < 14; ++field) fields >> skipped;
    long user = 0;
    long system = 0;
    fields >> user >> system;
    return std::chrono::milliseconds((user + system) * 1000 / ::sysconf(_SC_CLK_TCK));
  }
  void limitDescriptors(std::size_t most) const {
    rlimit limit{};
    ASSERT_EQ(::prlimit(daemon->process().pid(), RLIMIT_NOFILE, nullptr, &limit), 0);
    limit.rlim_cur = most;
    ASSERT_EQ(::prlimit(daemon->process().pid(), RLIMIT_NOFILE, &limit, nullptr), 0);
  }
  [[nodiscard]] rlim_t descriptorLimit() const {
    rlimit limit{};
    EXPECT_EQ(::prlimit(daemon->process().pid(), RLIMIT_NOFILE, nullptr, &limit), 0);
    return limit.rlim_cur;
  }
  /// A session that is opened and ended, until one is served.
  [[nodiscard]] bool waitUntilServed(int clientType) {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (std::chrono::steady_clock::now() < deadline) {
      ControlledSession session(*daemon);
      const auto lists = session.open(clientType, 2);
      if (lists.size() == 3 && lists[0] == kSplunk) return true;
    }
    return false;
  }
  /// Opens a session of that kind over a bare connection, without waiting for the configuration.
  static void sendOpening(RawConnection& connection, int clientType, bool batches) {
    const auto info = map({{"ComponentType", number(static_cast<std::uint64_t>(clientType))},
                           {"SessionID", number(66)},
                           {"BatchEvents", batches ? kTrue : kFalse}});
    const auto user = map({{"_clientName", text("Test")}, {"_serviceName", text("unit")}});
    EXPECT_TRUE(connection.send(call(0, {number(kSetSessionInfo), info, user, list({}), kFalse})));
    EXPECT_TRUE(connection.send(call(1, {number(kStartConfig)})));
  }

  ReportingServer server;
  std::unique_ptr<Daemon> daemon;
  std::unique_ptr<ControlledSession> honest;
};

TEST_F(Scarcity, OfDescriptorsLetsClientsWaitAndNobodySpin) {
  if (kSanitizerNeedsDescriptors) GTEST_SKIP() << "this daemon's sanitizer needs descriptors";
  const auto usual = descriptorLimit();
  const std::size_t before = openDescriptors();
  limitDescriptors(before + 6);
  std::vector<std::unique_ptr<RawConnection>> connections;
  for (int i = 0; i < 40; ++i) {
    connections.push_back(std::make_unique<RawConnection>(*daemon));
    ASSERT_TRUE(connections.back()->isConnected()) << "it waits in the socket's queue";
  }
  ASSERT_TRUE(daemon->log().waitForPart("<3>listener: cannot take connections for now: "));

  // Who was there before is served; while nothing happens, nothing is done.
  const auto start = std::chrono::steady_clock::now();
  const auto used = processorTime();
  honest->send({{"method", "wait"}, {"seconds", 2}});
  EXPECT_EQ(honest->call({{"method", "flushMessagesWithCompletion"}}).size(), 2U);
  const auto spent = processorTime() - used;
  EXPECT_LT(spent, (std::chrono::steady_clock::now() - start) / 5);
  EXPECT_EQ(linesWith(daemon->log(), "listener: cannot take connections for now: ").size(), 1U) << "told once";

  // A session cannot be configured, for want of a connection to the server, or waits. Neither harms it for later.
  connections.clear();
  EXPECT_TRUE(waitUntilServed(9));
  EXPECT_TRUE(waitUntilServed(6)) << "a storebag that could not be fetched is fetched now";
  limitDescriptors(usual);
}

TEST_F(Scarcity, OfDescriptorsDuringAFetchIsOverWhenTheyAreBack) {
  if (kSanitizerNeedsDescriptors) GTEST_SKIP() << "this daemon's sanitizer needs descriptors";
  const auto usual = descriptorLimit();
  ControlledSession session(*daemon);
  ASSERT_FALSE(session.call({{"method", "fetchDisplayURL"}}).empty()) << "taken, and its descriptors with it";
  limitDescriptors(3);
  EXPECT_EQ(session.open(6, 2).size(), 3U) << "an answer comes, whatever it is";
  limitDescriptors(usual);
  // A storebag whose fetch failed is not asked for again for a while, unless somebody says so.
  const std::size_t lines = daemon->log().lines().size();
  daemon->process().signal(SIGHUP);
  ASSERT_TRUE(daemon->log().waitForPart("storebags are fetched afresh", lines));
  EXPECT_TRUE(waitUntilServed(6));
}

TEST_F(Scarcity, OfRoomForUnclaimedDescriptorsStopsReading) {
  TlsTestServer::Response silent;
  silent.silent = true;
  const auto bag = server.servedStorebag("clover");
  server.setStorebagAnswer("clover", silent);
  // Before the fetch: while it lasts nobody new is taken.
  RawConnection beside(*daemon);
  ASSERT_TRUE(beside.send(call(1, {number(kFlush)})));
  ASSERT_TRUE(beside.receive());
  RawConnection connection(*daemon);
  sendOpening(connection, 6, false);
  // The configuration of this session waits for a server that says nothing: what it sends meanwhile cannot run.
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (server.storebagRequests("clover") == 0 && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::yield();
  }
  ASSERT_GE(server.storebagRequests("clover"), 1U);

  const std::size_t before = openDescriptors();
  constexpr int kCalls = 60;
  const auto body = list({number(kUploadFile), text("/nowhere"), text("token")});
  for (std::uint64_t serial = 2; serial < 2 + kCalls; ++serial) {
    const auto frame = RawConnection::frame(FrameKind::call, serial, body, std::nullopt, 1, 4);
    ASSERT_TRUE(connection.sendWith(frame, {0, 1, 2, 0}));
  }
  // The loop has turned often enough by then to have read everything, if it were to.
  std::size_t most = 0;
  for (std::uint64_t serial = 2; serial <= 50; ++serial) {
    ASSERT_TRUE(beside.send(call(serial, {number(kFlush)})));
    ASSERT_TRUE(beside.receive());
    most = std::max(most, openDescriptors());
  }
  EXPECT_GT(most, before + 8) << "some are taken";
  EXPECT_LT(most, before + 40) << "of 240";
  EXPECT_GT(connection.bytesUntaken(), 0);

  TlsTestServer::Response served;
  served.body = bag;
  server.setStorebagAnswer("clover", served);
  server.tls().closeConnections();
  for (int answers = 0; answers < 1 + kCalls; ++answers) {
    ASSERT_TRUE(connection.receive()) << answers << ": every call is answered in the end";
  }
  EXPECT_TRUE(waitForDescriptors(before + 4)) << "and every descriptor closed";
}

TEST_F(Scarcity, OfDescriptorsInTheDaemonEndsTheConnectionThatSendsSome) {
  if (kSanitizerNeedsDescriptors) GTEST_SKIP() << "this daemon's sanitizer needs descriptors";
  const auto usual = descriptorLimit();
  RawConnection connection(*daemon);
  ASSERT_TRUE(connection.send(call(1, {number(kFlush)})));
  ASSERT_TRUE(connection.receive());
  limitDescriptors(openDescriptors());
  const auto body = list({number(kUploadFile), text("/nowhere"), text("token")});
  ASSERT_TRUE(connection.sendWith(RawConnection::frame(FrameKind::call, 2, body, std::nullopt, 1, 4), {0, 1, 2, 0}));
  EXPECT_TRUE(connection.waitForEnd());
  EXPECT_TRUE(daemon->log().waitForPart(": descriptors were lost"));
  limitDescriptors(usual);
}

TEST_F(Scarcity, OfRoomForRepliesEndsTheConnectionThatDoesNotReadThem) {
  // Flushes whose posts the server leaves unanswered: their replies, each with the text of what was posted, come all at
  // once when the server hangs up.
  constexpr int kFlushes = 8;
  RawConnection connection(*daemon);
  sendOpening(connection, 9, true);
  ASSERT_TRUE(connection.receive()) << "configured";
  // The honest session's start message has been answered: the storebag's answer is the other one.
  std::size_t answers = 0;
  ASSERT_TRUE(daemon->log().waitFor([&](const std::string& line) {
    return line.find("didCompleteWithError: ") != std::string::npos &&
           line.find("with response status 200") != std::string::npos && ++answers == 2;
  }));
  const std::size_t posts = server.posts().size();
  TlsTestServer::Response silent;
  silent.silent = true;
  server.setPostResponse(silent);
  const std::string large(800'000, 'x');
  for (std::uint64_t flush = 0; flush < kFlushes; ++flush) {
    const auto message = map({{"ParametersCategory", number(7)},
                              {"ParametersType", number(1)},
                              {"ParametersPayload", map({{"large", text(large)}})}});
    ASSERT_TRUE(connection.send(call(0, {number(kSendMessage), message})));
    ASSERT_TRUE(connection.send(call(2 + flush, {number(kFlush)})));
  }
  ASSERT_TRUE(server.waitForPosts(posts + kFlushes)) << server.posts().size();

  server.setPostResponse({});
  server.tls().closeConnections();
  EXPECT_TRUE(daemon->log().waitForPart(": it does not read its replies"));
  EXPECT_TRUE(connection.waitForEnd());
}

/// Opens five sessions of each type at once, each with an event, and waits until all are served.
void serveForty(const Daemon& daemon, ReportingServer& server, const std::vector<int>& types) {
  const std::size_t before = server.events().size();
  std::vector<std::unique_ptr<ControlledSession>> sessions;
  std::vector<std::size_t> lines;
  for (const int type : types) {
    for (int number = 0; number < 5; ++number) {
      sessions.push_back(std::make_unique<ControlledSession>(daemon));
      lines.push_back(sessions.back()->sendOpening(type, static_cast<int>(sessions.size())));
      sessions.back()->sendEvent(7, 1, PropertyDictionary{{"number", number}});
    }
  }
  for (std::size_t i = 0; i < sessions.size(); ++i) {
    ASSERT_NE(sessions[i]->reply(lines[i]).array("reply"), nullptr) << "session " << i;
  }
  EXPECT_TRUE(server.waitForEvents(before + sessions.size()));
  for (auto& session : sessions) EXPECT_EQ(session->finish(), 0);
}

TEST(ScarcityOfThreads, DelaysSessionsButServesThemAllAndTheDaemonEnds) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root may choose a user with few threads";
  const std::vector<std::pair<int, const char*>> types{{5, "bramble"},  {6, "clover"},  {8, "fennel"},  {9, "heather"},
                                                       {10, "juniper"}, {14, "mallow"}, {15, "nettle"}, {16, "orchid"}};
  ReportingServer server;
  server.setStorebagDelay(std::chrono::milliseconds(200));
  std::vector<int> numbers;
  for (const auto& [type, name] : types) {
    numbers.push_back(type);
    server.setStorebag(name, storebagWith(server, {{"batchEvents", true}}));
  }
  Daemon::Options options;
  options.user = 30000 + static_cast<uid_t>(::getpid() % 30000);
  options.threads = 24;
  Daemon daemon(server, options);

  serveForty(daemon, server, numbers);
  EXPECT_TRUE(daemon.log().waitForPart("<3>Failed to start a thread: ")) << "or the limit was too high to be felt";
  serveForty(daemon, server, numbers);
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace velk::test
