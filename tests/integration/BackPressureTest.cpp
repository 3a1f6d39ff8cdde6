// Who waits for a server that does not answer, and who does not.

#include <gtest/gtest.h>

#include "tests/integration/Scenario.h"
#include "tests/integration/WireSession.h"

namespace velk::test {
namespace {

/// Several times what may be under way of one session.
constexpr int kManyEvents = 300;
const PropertyDictionary kUser{{"_clientName", "Test"}, {"_serviceName", "unit"}};

/// Beside the healthy server, one that takes posts and never answers: "heather" posts there, "clover" does not, and
/// "juniper" posts to both.
struct Servers {
  Servers() {
    TlsTestServer::Response never;
    never.silent = true;
    silent.setResponse(never);
    const PropertyDictionary toSilence{{"post_url", silent.url("/events")}};
    healthy.setStorebag("heather", storebagWith(healthy, toSilence));
    healthy.setStorebag("clover", storebagWith(healthy));
    healthy.setStorebag("juniper",
                        storebagOf({{"splunk", postBackend(healthy)}, {"korrin", postBackend(healthy, toSilence)}}));
  }
  static Daemon::Options options() {
    Daemon::Options options;
    options.deviceConfiguration = kInternalDeviceLines;  // posts without TLS are allowed
    return options;
  }

  TlsTestServer silent{false};
  ReportingServer healthy;
};

struct Wire {
  Wire() : daemon(servers.healthy, Servers::options()) {}
  ~Wire() { daemon.kill(); }  // it would wait for answers that never come
  /// A client of that type, which has sent its events and has been read as far as the daemon reads.
  std::unique_ptr<WireSession> flooding(int clientType, int sessionID) {
    auto session = std::make_unique<WireSession>(daemon, loop);
    session->describe({{"ComponentType", clientType}, {"SessionID", sessionID}}, kUser);
    EXPECT_TRUE(session->configure().has_value());
    for (int n = 0; n < kManyEvents; ++n) session->send(7, 1, {{"n", n}});
    return session;
  }
  [[nodiscard]] std::int64_t activeClients(int clientType) const {
    const auto status = statusOf(daemon);
    const auto* active = status.dictionary("activeClients");
    return active != nullptr ? integerValue(active->find(std::to_string(clientType))) : -1;
  }

  Servers servers;
  Daemon daemon;
  EventLoop loop{"clients"};
};

TEST(BackPressure, OfASilentServerIsNotFeltByAnotherSession) {
  Wire wire;
  const auto held = wire.flooding(9, 1);
  ASSERT_TRUE(wire.servers.silent.waitForRequests(1));
  const auto other = wire.flooding(6, 2);
  EXPECT_TRUE(wire.servers.healthy.waitForEvents(kManyEvents, {7}));
}

TEST(BackPressure, OfASilentServerHoldsUpMessagesAlone) {
  Wire wire;
  const auto held = wire.flooding(10, 1);
  EXPECT_TRUE(wire.servers.healthy.waitForEvents(10, {7})) << "the healthy server of the same session";
  // The client of another session that posts to the same silent server configures, flushes and ends.
  ControlledSession other(wire.daemon);
  EXPECT_EQ(other.open(9, 2, {{"BatchEvents", true}})[0], PropertyValue(PropertyArray{"splunk"}));
  other.sendEvent(7, 1, PropertyDictionary{{"n", 1}});
  other.send({{"method", "flushMessagesWithCompletion"}});
  EXPECT_EQ(other.call({{"method", "fetchDisplayURL"}}).size(), 1U) << "behind the flush";
}

TEST(BackPressure, IsNotWaitedForByTheCallsOfAClientThatHasGone) {
  Wire wire;
  auto session = wire.flooding(10, 1);
  ASSERT_TRUE(session->waitUntilSent());
  session.reset();
  EXPECT_TRUE(wire.servers.healthy.waitForEvents(kManyEvents, {7})) << "they leave without room";
  EXPECT_TRUE(wire.daemon.log().waitForPart("ReportingdSession dealloc: "));
}

TEST(BackPressure, DeadClientsGiveTheirPlacesBackAtOnce) {
  Wire wire;
  for (int round = 0; round < 3; ++round) {
    std::vector<std::unique_ptr<WireSession>> five;
    for (int number = 0; number < 5; ++number) five.push_back(wire.flooding(9, number));
    EXPECT_EQ(wire.activeClients(9), 5);
    five.clear();
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (wire.activeClients(9) > 0 && std::chrono::steady_clock::now() < deadline) {
    }
    EXPECT_EQ(wire.activeClients(9), 0) << round;
  }
}

}  // namespace
}  // namespace velk::test
