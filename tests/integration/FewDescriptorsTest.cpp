// A daemon with few descriptors and many clients.

#include <gtest/gtest.h>
#include <sys/resource.h>

#include "tests/integration/Scenario.h"
#include "tests/integration/WireSession.h"

namespace velk::test {
namespace {

// The check of objects' types that goes with the address sanitizer asks a pipe of its own whether memory is there, and
// takes a sound object for a broken one where no pipe can be had.
#ifdef __SANITIZE_ADDRESS__
constexpr bool kSanitizerNeedsDescriptors = true;
#else
constexpr bool kSanitizerNeedsDescriptors = false;
#endif

const std::vector<std::pair<int, const char*>> kTypes{{5, "bramble"},   {6, "clover"},  {8, "fennel"},  {10, "juniper"},
                                                      {12, "lavender"}, {14, "mallow"}, {15, "nettle"}, {16, "orchid"}};
constexpr int kClientsOfAType = 5;

/// What became of the clients' configurations.
class Answers {
 public:
  enum class Kind { none, configured, refused };

  explicit Answers(std::size_t count) : _kinds(count, Kind::none) {}

  void set(std::size_t client, Kind kind) {
    Guard guard(_lock);
    if (_kinds[client] == Kind::none) _kinds[client] = kind;
    _changed.notifyAll();
  }
  [[nodiscard]] Kind of(std::size_t client) const {
    Guard guard(_lock);
    return _kinds[client];
  }
  /// The clients with an answer, once there are at least so many; fewer when they did not come in time.
  [[nodiscard]] std::vector<std::size_t> waitFor(std::size_t count) const {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    Guard guard(_lock);
    for (;;) {
      std::vector<std::size_t> answered;
      for (std::size_t client = 0; client < _kinds.size(); ++client) {
        if (_kinds[client] != Kind::none) answered.push_back(client);
      }
      if (answered.size() >= count || !_changed.waitUntil(_lock, deadline)) return answered;
    }
  }

 private:
  mutable Lock _lock;
  mutable Condition _changed;
  std::vector<Kind> _kinds VELK_GUARDED_BY(_lock);
};

void limitDescriptors(Daemon& daemon, rlim_t most) {
  rlimit limit{};
  ASSERT_EQ(::prlimit(daemon.process().pid(), RLIMIT_NOFILE, nullptr, &limit), 0);
  limit.rlim_cur = most;
  ASSERT_EQ(::prlimit(daemon.process().pid(), RLIMIT_NOFILE, &limit, nullptr), 0);
}

/// Sends until one arrives: another session's post may have the only connection to the server at that moment.
bool anEventArrives(const ReportingServer& server, ControlledSession& session) {
  const auto before = eventsOf(server, 7).size();
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (std::chrono::steady_clock::now() < deadline) {
    session.sendEvent(7, 1);
    if (server.waitForEvents(before + 1, {7}, std::chrono::milliseconds(500))) return true;
  }
  return false;
}

TEST(FewDescriptors, ServeWhoFitsAndEverybodyInTheEnd) {
  if (kSanitizerNeedsDescriptors) GTEST_SKIP() << "this daemon's sanitizer needs descriptors";
  constexpr rlim_t kFew = 40;
  ReportingServer server;
  for (const auto& type : kTypes) server.setStorebag(type.second, storebagWith(server));
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  // Storebags are in memory, and a connection to the server is there, before descriptors run out.
  for (const auto& type : kTypes) {
    ControlledSession early(daemon);
    ASSERT_EQ(early.open(type.first, 1).size(), 3U);
    ASSERT_EQ(early.finish(), 0);
  }
  ControlledSession honest(daemon);
  ASSERT_EQ(honest.open(9, 2).size(), 3U);
  ASSERT_TRUE(anEventArrives(server, honest));
  limitDescriptors(daemon, kFew);

  EventLoop loop("test-clients");
  {
    std::vector<std::unique_ptr<WireSession>> clients;
    const auto answers = std::make_shared<Answers>(kTypes.size() * kClientsOfAType);
    for (const auto& type : kTypes) {
      for (int each = 0; each < kClientsOfAType; ++each) {
        const std::size_t client = clients.size();
        auto session = std::make_unique<WireSession>(daemon, loop);
        session->describe({{"ComponentType", type.first}, {"SessionID", static_cast<int>(client)}},
                          PropertyDictionary{{"_clientName", "Test"}, {"_serviceName", "unit"}});
        session->proxy().startConfigWithCompletionHandler(ConfigurationReply(
            [answers, client](const auto& enabled, const auto&, const auto&) {
              answers->set(client, enabled && !enabled->empty() ? Answers::Kind::configured : Answers::Kind::refused);
            },
            [answers, client] { answers->set(client, Answers::Kind::refused); }));
        clients.push_back(std::move(session));
      }
    }
    // Some are served, the others wait.
    ASSERT_FALSE(answers->waitFor(5).empty());
    EXPECT_TRUE(daemon.log().waitForPart("<3>listener: cannot take connections for now: "));
    EXPECT_TRUE(anEventArrives(server, honest)) << "who was there before goes on";
    // Those who were served make room for others, until all have been.
    std::size_t ended = 0;
    std::size_t configured = 0;
    while (ended < clients.size()) {
      const auto answered = answers->waitFor(ended + 1);
      ASSERT_GT(answered.size(), ended) << "nobody else is served";
      for (const auto client : answered) {
        if (!clients[client]) continue;
        configured += answers->of(client) == Answers::Kind::configured ? 1 : 0;
        clients[client].reset();
        ++ended;
      }
    }
    EXPECT_GE(configured, clients.size() / 2) << "the others were refused";
    EXPECT_LE(daemon.log().count("listener: cannot take connections for now: "), clients.size()) << "told, not drummed";
  }
  loop.stop();
  ControlledSession late(daemon);
  EXPECT_EQ(late.open(5, 3)[0], PropertyValue(PropertyArray{"splunk"}));
  EXPECT_EQ(late.finish(), 0);
  EXPECT_TRUE(anEventArrives(server, honest));
  EXPECT_EQ(honest.finish(), 0);
  EXPECT_EQ(daemon.stop(), 0);
}

}  // namespace
}  // namespace velk::test
