// The dashboard from end to end: real sockets, the real daemon, the collector as the other end.

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <array>
#include <csignal>
#include <filesystem>
#include <map>
#include <thread>
#include <utility>

#include "backends/DashboardBackend.h"
#include "device/DeviceEnvironment.h"
#include "foundation/Json.h"
#include "platform/ThreadPool.h"
#include "platform/UdpSocket.h"
#include "tests/integration/Scenario.h"
#include "tests/support/FakePlatform.h"

namespace velk::test {
namespace {

const PropertyDictionary kUser{{"_clientName", "Test"}, {"_serviceName", "unit"}};

PropertyDictionary parsed(const std::string& line) {
  const auto value = json::parse(line, json::Extensions::tagged);
  return value && value->dictionary() != nullptr ? *value->dictionary() : PropertyDictionary();
}

bool isEvent(const PropertyDictionary& object, std::string_view name) {
  const auto* event = object.string("event");
  return event != nullptr && *event == name;
}

/// A port that takes datagrams and answers none unless it is told.
class SilentPort {
 public:
  SilentPort() : _socket(opened()) {
    auto address = here(0);
    socklen_t size = sizeof(address);
    EXPECT_EQ(::bind(_socket.get(), reinterpret_cast<sockaddr*>(&address), size), 0);
    EXPECT_EQ(::getsockname(_socket.get(), reinterpret_cast<sockaddr*>(&address), &size), 0);
    port = ntohs(address.sin_port);
  }
  /// On loopback a datagram is here when its sender's call returns.
  [[nodiscard]] bool hasDatagram() const {
    std::array<char, 16> buffer{};
    return ::recv(_socket.get(), buffer.data(), buffer.size(), 0) >= 0;
  }
  /// Takes datagrams from nobody but itself: others hear that the port is closed.
  void refuse() const {
    const auto self = here(port);
    EXPECT_EQ(::connect(_socket.get(), reinterpret_cast<const sockaddr*>(&self), sizeof(self)), 0);
  }
  void admit() {
    const FileDescriptor refusing = std::exchange(_socket, opened());
    const auto address = here(port);
    EXPECT_EQ(::bind(_socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)), 0);
  }
  /// Sends the next datagram's header back, and tells its event number; nothing when there is none.
  [[nodiscard]] std::optional<int> acknowledgeNext() const {
    std::array<std::uint8_t, 2048> buffer{};
    sockaddr_in sender{};
    socklen_t size = sizeof(sender);
    auto* const from = reinterpret_cast<sockaddr*>(&sender);
    if (::recvfrom(_socket.get(), buffer.data(), buffer.size(), 0, from, &size) < 64) return std::nullopt;
    EXPECT_EQ(::sendto(_socket.get(), buffer.data(), 64, 0, from, size), 64);
    return buffer[60] * 256 + buffer[61];
  }
  std::uint16_t port = 0;

 private:
  static sockaddr_in here(std::uint16_t port) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    address.sin_port = htons(port);
    return address;
  }
  /// Two sockets may have the port at once, so that it is held while one follows the other.
  static FileDescriptor opened() {
    FileDescriptor socket(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    const int yes = 1;
    EXPECT_EQ(::setsockopt(socket.get(), SOL_SOCKET, SO_REUSEADDR, &yes, sizeof(yes)), 0);
    return socket;
  }

  FileDescriptor _socket;
};

/// velkcollector in a directory of its own.
class CollectorProcess {
 public:
  explicit CollectorProcess(const std::vector<std::string>& more = {}) : _process(options(more)) {
    _listening = parsed(_process.output()
                            .waitFor([](const std::string& line) { return isEvent(parsed(line), "listening"); })
                            .value_or("{}"));
  }

  [[nodiscard]] std::string url(const std::string& path) const { return *_listening.string("url") + path; }
  [[nodiscard]] std::string caFile() const { return *_listening.string("ca"); }
  [[nodiscard]] std::uint16_t dashboardPort() const { return uint16Value(_listening.find("dashboardPort")); }
  [[nodiscard]] LineCollector& lines() { return _process.output(); }
  [[nodiscard]] std::vector<PropertyDictionary> events(std::string_view name) {
    std::vector<PropertyDictionary> found;
    for (const auto& line : lines().lines()) {
      if (auto object = parsed(line); isEvent(object, name)) found.push_back(std::move(object));
    }
    return found;
  }
  int stop() {
    _process.signal(SIGTERM);
    const auto status = _process.wait();
    if (!status) return -1;
    lines().waitForEnd();
    return *status;
  }

 private:
  ChildProcess::Options options(const std::vector<std::string>& more) const {
    ChildProcess::Options result;
    result.command = {collectorProgram(), "--state", _directory.path(), "--port", "0", "--json", "--dashboard"};
    result.command.insert(result.command.end(), more.begin(), more.end());
    return result;
  }

  const TemporaryDirectory _directory;
  ChildProcess _process;
  PropertyDictionary _listening;
};

PropertyDictionary dashboardStorebag(std::uint16_t port, const PropertyDictionary& more = {}) {
  PropertyDictionary section{{"ip", "127.0.0.1"}, {"port", port}};
  section.merge(more);
  return storebagOf({{"dashboard", section}});
}

std::size_t openDescriptors(const ChildProcess& process) {
  std::size_t count = 0;
  const auto path = "/proc/" + std::to_string(process.pid()) + "/fd";
  for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator(path)) ++count;
  return count;
}

PropertyDictionary oneShot(int number) {
  return {{"method", "sendMessageWithSessionInfo"},
          {"sessionInfo", PropertyDictionary{{"ComponentType", 9}, {"SessionID", 5}, {"ClientVersion", 2}}},
          {"userInfo", kUser},
          {"category", 7},
          {"type", 3},
          {"payload", PropertyDictionary{{"number", number}}}};
}

TEST(Dashboard, OneShotsLeaveTheDescriptorCountFlat) {
  for (const PropertyDictionary& more : std::vector<PropertyDictionary>{{}, {{"reliable", 500}}}) {
    const SilentPort port;
    ReportingServer server;
    server.setStorebag("heather", dashboardStorebag(port.port, more));
    Daemon daemon(server);
    ControlledSession session(daemon);
    const auto send = [&](int number) { ASSERT_EQ(session.call(oneShot(number)), PropertyArray{"finished"}); };
    for (int number = 0; number < 3; ++number) send(number);
    const std::size_t before = openDescriptors(daemon.process());
    for (int number = 0; number < 100; ++number) send(number);
    // The last ones end on queues of their own.
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (openDescriptors(daemon.process()) > before && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::yield();
    }
    EXPECT_LE(openDescriptors(daemon.process()), before);
    EXPECT_EQ(session.finish(), 0);
    EXPECT_EQ(daemon.stop(), 0);
    ASSERT_TRUE(daemon.log().waitForPart("main: Asked to stop."));
    EXPECT_EQ(daemon.log().countOnceThereAre(103, "createBackendsWithStorebag: Creating backends for session 5"), 103U);
    EXPECT_FALSE(port.hasDatagram());
  }
}

TEST(Dashboard, GetsNoEventsOfSessions) {
  const SilentPort port;
  ReportingServer server;
  server.setStorebag("heather", dashboardStorebag(port.port, {{"reliable", 20}}));
  Daemon daemon(server);
  ControlledSession session(daemon);
  EXPECT_EQ(session.open(9, 5)[0], PropertyValue(PropertyArray{"dashboard"}));
  for (int number = 0; number < 5; ++number) {
    EXPECT_FALSE(session.reply(session.sendEvent(7, 3, PropertyDictionary{{"number", number}})).empty());
  }
  EXPECT_FALSE(session.call({{"method", "flushMessagesWithCompletion"}}).empty());
  EXPECT_EQ(session.finish(), 0);
  EXPECT_EQ(daemon.stop(), 0);
  EXPECT_FALSE(port.hasDatagram()) << "neither events nor the start and health messages";
}

TEST(Dashboard, LogDataGoesToTheCollectorWhichSaysWhereItIs) {
  CollectorProcess collector;
  ReportingServer server;
  server.setStorebag("heather", dashboardStorebag(collector.dashboardPort(), {{"post_url", collector.url("/logdata")},
                                                                              {"display_url", "https://d.example/"}}));
  const TemporaryDirectory directory;
  Daemon::Options options;
  options.environment["SSL_CERT_FILE"] =
      directory.write("authorities.pem", contentsOf(server.tls().caFile()) + contentsOf(collector.caFile()));
  Daemon daemon(server, options);
  ControlledSession session(daemon);
  EXPECT_EQ(session.open(9, 5)[0], PropertyValue(PropertyArray{"dashboard"}));
  EXPECT_EQ(session.call({{"method", "fetchDisplayURL"}}), PropertyArray{"https://d.example/"});

  const PropertyArray logData{
      PropertyDictionary{{"LogData", "first words"}, {"StartTime", Date{1.5e9}}, {"EndTime", Date{1.5e9 + 1}}},
      PropertyDictionary{{"LogData", ByteData{0, 1, 2, 255}}}};
  for (int number = 1; number <= 2; ++number) {
    EXPECT_EQ(session.call({{"method", "uploadLogData"}, {"logData", logData}}),
              (PropertyArray{true, PropertyValue()}));
    const auto location = collector.url("/logdata/" + std::to_string(number));
    EXPECT_TRUE(daemon.log().waitForPart("DashboardBackend(uploadLogData): Log data uploaded to " + location));
  }
  EXPECT_TRUE(daemon.log().waitForPart("uploadLogData: Log data array upload successful"));
  ASSERT_TRUE(collector.lines().waitForPart(collector.url("/logdata/2")));
  const auto taken = collector.events("logData");
  ASSERT_EQ(taken.size(), 2U);
  EXPECT_EQ(integerValue(taken[0].find("entries")), 2);
  EXPECT_EQ(*taken[1].string("location"), collector.url("/logdata/2"));
  EXPECT_TRUE(collector.events("datagram").empty()) << "the notice takes a number, and sends nothing";
  EXPECT_EQ(session.finish(), 0);
  EXPECT_EQ(collector.stop(), 0);
}

TEST(Dashboard, LogDataOfASessionIsTakenForUploadedWhateverTheServerSays) {
  const SilentPort port;
  ReportingServer server;
  TlsTestServer::Response refusal;
  refusal.status = 500;
  server.setPostResponse(refusal);
  server.setStorebag("heather", dashboardStorebag(port.port, {{"post_url", server.url("/logs")}}));
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 5).size(), 3U);
  const PropertyDictionary upload{{"method", "uploadLogData"}, {"logData", PropertyArray{PropertyDictionary{}}}};
  EXPECT_EQ(session.call(upload), (PropertyArray{true, PropertyValue()}));
  const auto posts = server.posts();
  ASSERT_EQ(posts.size(), 1U);
  EXPECT_EQ(posts[0].request.target, "/logs");
  EXPECT_EQ(*posts[0].request.header("Content-Type"), "application/octet-stream");
  EXPECT_EQ(posts[0].request.body.substr(0, 8), "bplist00");
}

TEST(Dashboard, WithoutPostAddressRefusesLogData) {
  const SilentPort port;
  ReportingServer server;
  server.setStorebag("heather", dashboardStorebag(port.port));
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 5).size(), 3U);
  EXPECT_EQ(session.call({{"method", "uploadLogData"}, {"logData", PropertyArray{}}}),
            (PropertyArray{false, PropertyValue()}));
  EXPECT_TRUE(daemon.log().waitForPart("<3>DashboardBackend(uploadLogData): Post URL for log data array is nil"));
  EXPECT_EQ(session.call({{"method", "fetchDisplayURL"}}), PropertyArray{"URL not available"});
}

/// A backend of its own in this process, over real queues, timers and sockets.
class RealBackend {
 public:
  RealBackend(std::uint16_t port, int period) {
    platform.udpSockets = sockets.get();
    backend = DashboardBackend::initWithName(
        context, "dashboard", PropertyDictionary{{"ip", "127.0.0.1"}, {"port", port}, {"reliable", period}}, "Lamp");
    backend->setUdid("0123456789abcdef0123456789abcdef01234567");
    backend->setSessionID(77);
    backend->setCompType(9);
  }
  ~RealBackend() { pool->stop(); }

  void send(std::uint16_t eventNumber) {
    EXPECT_TRUE(backend->sendMessageWithoutFlag(PropertyDictionary{{"number", eventNumber}},
                                                fakes.platform().clock.wallTime(), 7, 3, eventNumber));
  }
  /// True when the backend has gone by itself, with everything that owned it.
  [[nodiscard]] bool endsAfterCleanup() {
    const std::weak_ptr<DashboardBackend> weak = backend;
    backend->cleanup();
    backend.reset();
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (!weak.expired() && std::chrono::steady_clock::now() < deadline) std::this_thread::yield();
    return weak.expired();
  }

  FakePlatform fakes;
  const std::unique_ptr<UdpSocketService> sockets = makeUdpSocketService();
  const std::unique_ptr<ThreadPool> pool = makeThreadPool();
  Platform own = fakes.platform();
  Platform platform{own.clock,  *pool,         own.defaults, own.device,  own.locale,       own.http,
                    own.random, own.keepAlive, own.consent,  own.process, own.logSubmission};
  const DeviceEnvironment environment{fakes.defaults, fakes.device};
  const BackendContext context{platform, environment};
  std::shared_ptr<DashboardBackend> backend;
};

/// What the collector saw of one event.
struct Arrivals {
  int count = 0;
  int acknowledged = 0;  ///< by which arrival first; 0: by none
};

std::map<int, Arrivals> arrivalsAt(CollectorProcess& collector) {
  std::map<int, Arrivals> arrivals;
  for (const auto& datagram : collector.events("datagram")) {
    Arrivals& of = arrivals[static_cast<int>(integerValue(datagram.find("eventNumber")))];
    ++of.count;
    if (of.acknowledged == 0 && *datagram.string("fate") == "acknowledged") of.acknowledged = of.count;
  }
  return arrivals;
}

TEST(Dashboard, IsAcknowledgedByTheCollector) {
  CollectorProcess collector;
  // Ticks are an hour apart: nothing but acknowledgements can empty the queue.
  RealBackend real(collector.dashboardPort(), 3'600'000);
  for (std::uint16_t number = 1; number <= 20; ++number) real.send(number);
  ASSERT_TRUE(collector.lines().waitForPart("\"eventNumber\":20,"));
  const auto datagrams = collector.events("datagram");
  ASSERT_EQ(datagrams.size(), 20U);
  EXPECT_EQ(*datagrams[0].string("fate"), "acknowledged");
  EXPECT_EQ(*datagrams[4].string("text"), " number=5");
  EXPECT_EQ(*datagrams[4].string("device"), "0123456789abcdef0123456789abcdef01234567");
  EXPECT_EQ(integerValue(datagrams[4].find("session")), 77);
  EXPECT_EQ(integerValue(datagrams[4].find("component")), 9);
  EXPECT_EQ(integerValue(datagrams[4].find("flags")), 1);
  // A clean-up with something pending would wait for the next tick: asked again and again, it finds nothing pending
  // as soon as the last acknowledgement is there.
  const std::weak_ptr<DashboardBackend> weak = real.backend;
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  auto backend = std::move(real.backend);
  while (backend && std::chrono::steady_clock::now() < deadline) {
    backend->cleanup();
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
    if (backend.use_count() == 1) backend.reset();
  }
  EXPECT_TRUE(weak.expired());
  EXPECT_EQ(collector.stop(), 0);
}

TEST(Dashboard, AcrossALossyLinkDeliversOrGivesUp) {
  constexpr int kEvents = 40;
  CollectorProcess collector({"--dashboard-drop", "0.3", "--dashboard-drop-acks", "0.3", "--dashboard-seed", "11"});
  RealBackend real(collector.dashboardPort(), 20);
  for (std::uint16_t number = 1; number <= kEvents; ++number) real.send(number);
  // Every event is acknowledged, or has come as often as it is ever sent.
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  const auto settled = [&] {
    const auto arrivals = arrivalsAt(collector);
    if (arrivals.size() != kEvents) return false;
    for (const auto& [number, of] : arrivals) {
      if (of.acknowledged == 0 && of.count < 5) return false;
    }
    return true;
  };
  while (!settled() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  EXPECT_TRUE(settled());
  EXPECT_TRUE(real.endsAfterCleanup());
  EXPECT_EQ(collector.stop(), 0);
  const auto arrivals = arrivalsAt(collector);
  int givenUp = 0;
  int resent = 0;
  for (const auto& [number, of] : arrivals) {
    // An acknowledgement on its way does not stop a sending that is due.
    EXPECT_LE(of.count, 5) << number;
    EXPECT_GE(of.count, of.acknowledged > 0 ? of.acknowledged : 5) << number;
    givenUp += of.acknowledged == 0 ? 1 : 0;
    resent += of.count > 1 ? 1 : 0;
  }
  EXPECT_GT(resent, 5);
  EXPECT_LT(givenUp, 15);
}

TEST(Dashboard, GoesOnWhenTheCollectorComesLater) {
  SilentPort port;
  port.refuse();
  RealBackend real(port.port, 500);
  for (std::uint16_t number = 1; number <= 5; ++number) real.send(number);
  port.admit();
  // Acknowledged as they come, again and again, until nothing is pending.
  std::map<int, int> arrivals;
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  while (arrivals.size() < 5 && std::chrono::steady_clock::now() < deadline) {
    if (const auto number = port.acknowledgeNext()) ++arrivals[*number];
    std::this_thread::yield();
  }
  ASSERT_EQ(arrivals.size(), 5U);
  EXPECT_TRUE(real.endsAfterCleanup());
  while (const auto number = port.acknowledgeNext()) ++arrivals[*number];
  int total = 0;
  for (const auto& [number, count] : arrivals) total += count;
  EXPECT_LT(total, 5 * 4) << "acknowledgements were read: nothing was sent until it was given up";
}

}  // namespace
}  // namespace velk::test
