// A daemon that is killed and started again, and the clients of the library that go on with it.

#include <gtest/gtest.h>
#include <stdlib.h>

#include <algorithm>
#include <map>
#include <set>
#include <thread>

#include "client/VelkReporting.h"
#include "platform/Log.h"
#include "platform/Semaphore.h"
#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

/// What the library says, while one lives.
class ClientLog {
 public:
  ClientLog() { log::setSink(_sink); }
  ~ClientLog() { log::setSink(nullptr); }
  ClientLog(const ClientLog&) = delete;
  ClientLog& operator=(const ClientLog&) = delete;

  /// Waits until `count` lines hold `part`.
  [[nodiscard]] bool waitForCount(const std::string& part, std::size_t count) const {
    std::size_t seen = 0;
    return _sink->lines
        .waitFor([&](const std::string& line) { return line.find(part) != std::string::npos && ++seen == count; })
        .has_value();
  }

 private:
  struct Sink : log::Sink {
    void write(log::Level, std::string_view line) override { lines.add(std::string(line)); }
    LineCollector lines;
  };
  const std::shared_ptr<Sink> _sink = std::make_shared<Sink>();
};

/// A client object, and how often its callbacks were called.
class Client {
 public:
  Client(int clientType, const PropertyDictionary& more = {}) {
    PropertyDictionary info{{"ComponentType", clientType}, {"ClientVersion", 3}, {"SessionID", clientType}};
    info.merge(more);
    _reporting = VelkReporting::initWithSessionInfo(
        info, PropertyDictionary{{"_clientName", "Early"}, {"_serviceName", "restart"}}, {}, nullptr);
    _reporting->startConfigurationWithCompletionHandler([calls = _calls](const auto& enabled) {
      ++calls->configuration;
      if (enabled) calls->configured.signal();
    });
  }

  [[nodiscard]] VelkReporting& reporting() { return *_reporting; }
  [[nodiscard]] bool waitUntilConfigured() { return _calls->configured.waitFor(kPatience); }
  /// Waits for the answer of a flush, whatever it is: everything said before has been handed over.
  [[nodiscard]] bool flush() {
    ++_flushes;
    _reporting->flushMessagesWithCompletion([calls = _calls](const auto&) {
      ++calls->flushes;
      calls->flushed.signal();
    });
    return _calls->flushed.waitFor(kPatience);
  }
  void send(int clientType, int number) {
    _reporting->sendMessageWithCategory(7, 1, PropertyDictionary{{"client", clientType}, {"number", number}});
  }
  [[nodiscard]] bool everyCallbackRanOnce() const { return _calls->configuration == 1 && _calls->flushes == _flushes; }

 private:
  struct Calls {
    std::atomic<int> configuration{0};
    std::atomic<int> flushes{0};
    Semaphore configured;
    Semaphore flushed;
  };
  const std::shared_ptr<Calls> _calls = std::make_shared<Calls>();
  int _flushes = 0;
  std::shared_ptr<VelkReporting> _reporting;
};

void useDaemon(const Daemon& daemon) { setenv("VELKREPORTING_SOCKET", daemon.socketPath().c_str(), 1); }

/// The event of category 7 with that number, once it has come.
PropertyDictionary eventNumber(const ReportingServer& server, std::size_t number) {
  EXPECT_TRUE(server.waitForEvents(number, {7}));
  for (const auto& event : eventsOf(server, 7)) {
    if (integerValue(event.find("number")) == static_cast<std::int64_t>(number)) return event;
  }
  return {};
}

TEST(DaemonRestart, SessionsAreAsTheyWere) {
  ReportingServer server;
  for (const char* name : {"heather", "lavender"}) {
    server.setStorebag(name, storebagOf({{"qrs", postBackend(server)}}));
  }
  Daemon daemon(server);
  useDaemon(daemon);
  const ClientLog log;
  const auto place = [](int level) {
    return PropertyDictionary{{"HierarchyToken", PropertyDictionary{{"token", "tree"}, {"level", level}}}};
  };
  Client parent(9, place(0));
  ASSERT_TRUE(parent.waitUntilConfigured());
  Client child(12, place(1));
  ASSERT_TRUE(child.waitUntilConfigured());
  auto fetched = std::make_shared<Semaphore>();
  child.reporting().fetchReportingStatesWithUserInfo(
      PropertyDictionary{{"_clientName", "Later"}, {"_serviceName", "restart"}},
      [fetched](const auto&) { fetched->signal(); });
  ASSERT_TRUE(fetched->waitFor(kPatience));
  EXPECT_TRUE(child.reporting().setDigestKey(ByteData{1, 2, 3}, 0));

  for (std::size_t number = 1; number <= 2; ++number) {
    child.send(12, static_cast<int>(number));
    const auto event = eventNumber(server, number);
    ASSERT_FALSE(event.empty());
    EXPECT_EQ(*event.string("_clientName"), "Later");
    EXPECT_NE(event.string("_sessionID")->find('.'), std::string::npos) << "its parent is known";
    bool isDigested = false;
    for (const auto& post : server.posts()) {
      const auto* events = post.body.array("events");
      if (events == nullptr || events->empty() || (*events)[0] != PropertyValue(event)) continue;
      isDigested = post.request.header("X-Velk-DIGEST") != nullptr;
    }
    EXPECT_TRUE(isDigested);
    if (number == 2) break;
    daemon.kill();
    daemon.start();
    // Of their own accord: the parent has nothing to say.
    for (const char* session : {"9", "12"}) {
      ASSERT_TRUE(daemon.log().waitForPart(
          std::string("startConfigWithCompletionHandler: Starting configuration for session ") + session));
    }
    ASSERT_TRUE(parent.flush());
    ASSERT_TRUE(child.flush());
  }
  EXPECT_TRUE(parent.everyCallbackRanOnce());
  EXPECT_TRUE(child.everyCallbackRanOnce());
}

/// Sends numbered events from a thread of its own until it is told to stop.
class Sender {
 public:
  Sender(Client& client, int clientType, int& number)
      : _thread([this, &client, clientType, &number] {
          while (!_stops) {
            client.send(clientType, ++number);
            std::this_thread::yield();
            if (number % 20 == 0) std::this_thread::sleep_for(std::chrono::milliseconds(5));
          }
        }) {}
  ~Sender() {
    _stops = true;
    _thread.join();
  }

 private:
  std::atomic<bool> _stops{false};
  std::thread _thread;
};

/// Client type and number.
using EventName = std::pair<std::int64_t, std::int64_t>;

std::map<EventName, int> arrivals(const ReportingServer& server) {
  std::map<EventName, int> arrived;
  for (const auto& event : eventsOf(server, 7)) {
    ++arrived[{integerValue(event.find("client")), integerValue(event.find("number"))}];
  }
  return arrived;
}

bool waitForAll(const ReportingServer& server, const std::set<EventName>& expected) {
  for (;;) {
    const std::size_t posts = server.posts().size();
    const auto arrived = arrivals(server);
    if (std::all_of(expected.begin(), expected.end(), [&](const auto& event) { return arrived.contains(event); })) {
      return true;
    }
    if (!server.waitForPosts(posts + 1)) return false;
  }
}

TEST(DaemonRestart, ClientsOfADaemonKilledInMidFlightGoOnWithTheNext) {
  const std::vector<std::pair<int, const char*>> types{{5, "bramble"}, {6, "clover"},    {8, "fennel"},
                                                       {9, "heather"}, {12, "lavender"}, {14, "mallow"}};
  constexpr int kRestarts = 4;
  constexpr int kAwayEvents = 20;
  ReportingServer server;
  for (const auto& type : types) server.setStorebag(type.second, storebagWith(server));
  Daemon daemon(server);
  useDaemon(daemon);
  const ClientLog log;
  std::vector<std::unique_ptr<Client>> clients;
  for (const auto& type : types) clients.push_back(std::make_unique<Client>(type.first));
  for (auto& client : clients) ASSERT_TRUE(client->waitUntilConfigured());
  std::vector<int> numbers(types.size(), 0);
  for (std::size_t restart = 1; restart <= kRestarts; ++restart) {
    {
      std::vector<std::unique_ptr<Sender>> senders;
      for (std::size_t at = 0; at < types.size(); ++at) {
        senders.push_back(std::make_unique<Sender>(*clients[at], types[at].first, numbers[at]));
      }
      EXPECT_TRUE(server.waitForPosts(server.posts().size() + 50));
      daemon.kill();
    }
    // From here on the clients know, and what they say waits for the next daemon.
    std::set<EventName> waiting;
    ASSERT_TRUE(log.waitForCount("initWithSessionInfo: IPC connection interrupted", restart * types.size()));
    for (std::size_t at = 0; at < types.size(); ++at) {
      for (int event = 0; event < kAwayEvents; ++event) {
        clients[at]->send(types[at].first, ++numbers[at]);
        waiting.insert({types[at].first, numbers[at]});
      }
      EXPECT_TRUE(clients[at]->flush());
    }
    daemon.start();
    EXPECT_TRUE(waitForAll(server, waiting));
  }
  for (const auto& client : clients) EXPECT_TRUE(client->everyCallbackRanOnce());
  clients.clear();
  EXPECT_EQ(daemon.stop(), 0);

  for (const auto& [event, times] : arrivals(server)) {
    EXPECT_EQ(times, 1) << "client " << event.first << " event " << event.second;
  }
}

}  // namespace
}  // namespace velk::test
