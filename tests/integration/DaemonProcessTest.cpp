// The daemon as a process of the system: the sockets it is handed, what it tells the service manager, the settings that
// other processes hold, and an end that is bounded.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>

#include "platform/FileDescriptor.h"
#include "platform/LocalSocket.h"
#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

const PropertyValue kSplunk = PropertyArray{"splunk"};

Daemon::Options notStarted() {
  Daemon::Options options;
  options.starts = false;
  return options;
}

/// Started as a service manager does it: descriptors from number 3 on, and its own number in LISTEN_PID.
ChildProcess::Options activated(const Daemon& daemon, const ReportingServer& server, const std::vector<int>& sockets) {
  std::string script = "exec";
  // Above 3 they stand already, so no number is overwritten before it was copied.
  for (std::size_t index = 0; index < sockets.size(); ++index) {
    script += " " + std::to_string(3 + index) + "<&" + std::to_string(sockets[index]);
  }
  script += "; export LISTEN_FDS=" + std::to_string(sockets.size()) + " LISTEN_PID=$$; exec \"$0\"";
  ChildProcess::Options options;
  options.command = {"/bin/bash", "-c", script, daemonProgram()};
  options.environment = daemon.environment();
  options.environment["SSL_CERT_FILE"] = const_cast<ReportingServer&>(server).tls().caFile();
  return options;
}

/// A copy that a child process inherits, under a number that leaves room for those of the service manager.
FileDescriptor inheritable(const FileDescriptor& socket) {
  FileDescriptor copy(::fcntl(socket.get(), F_DUPFD, 50));
  EXPECT_TRUE(copy);
  return copy;
}

int statusThrough(const Daemon& daemon, const std::string& socketPath) {
  ChildProcess::Options options;
  options.command = {controlProgram(), "status"};
  options.environment = daemon.environment();
  options.environment["VELKREPORTING_SOCKET"] = socketPath;
  return runProgram(options).status;
}

TEST(Activation, ServesEverySocketThatIsHandedOver) {
  ReportingServer server;
  Daemon daemon(server, notStarted());
  const std::string second = daemon.directory() + "/run/second";
  auto firstSocket = bindLocalSocket(daemon.socketPath(), "test");
  auto secondSocket = bindLocalSocket(second, "test");
  ASSERT_TRUE(firstSocket && secondSocket);
  const auto first = inheritable(firstSocket->socket);
  const auto other = inheritable(secondSocket->socket);
  ChildProcess process(activated(daemon, server, {first.get(), other.get()}));
  ASSERT_TRUE(process.errors().waitForPart("main: Listener resumes with sandbox, start loop."));
  EXPECT_EQ(statusThrough(daemon, daemon.socketPath()), 0);
  EXPECT_EQ(statusThrough(daemon, second), 0);
  process.signal(SIGTERM);
  EXPECT_EQ(process.wait(), 0);
  EXPECT_TRUE(std::filesystem::exists(second)) << "the path is the service manager's";
}

TEST(Activation, NamesADescriptorThatIsNoListeningSocketAndServesTheOthers) {
  ReportingServer server;
  Daemon daemon(server, notStarted());
  auto socket = bindLocalSocket(daemon.socketPath(), "test");
  auto pair = makeLocalSocketPair();
  ASSERT_TRUE(socket && pair);
  const auto connected = inheritable(pair->first);
  const auto listening = inheritable(socket->socket);
  ChildProcess process(activated(daemon, server, {connected.get(), listening.get()}));
  ASSERT_TRUE(process.errors().waitForPart("main: Listener resumes with sandbox, start loop."));
  EXPECT_EQ(process.errors().count("Launch: Descriptor 3 is not a listening local stream socket"), 1U);
  EXPECT_EQ(statusThrough(daemon, daemon.socketPath()), 0);
}

/// The service manager's end of the notification socket.
class ServiceManager {
 public:
  explicit ServiceManager(std::string path)
      : _path(std::move(path)), _socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, _path.c_str(), sizeof(address.sun_path) - 1);
    EXPECT_EQ(::bind(_socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof(address)), 0);
  }
  [[nodiscard]] const std::string& path() const { return _path; }
  /// The next message; empty when none came in time.
  [[nodiscard]] std::string receive(std::chrono::milliseconds patience = kPatience) {
    pollfd waiting{_socket.get(), POLLIN, 0};
    if (::poll(&waiting, 1, static_cast<int>(patience.count())) != 1) return {};
    char buffer[512];
    const auto count = ::recv(_socket.get(), buffer, sizeof(buffer), 0);
    return count > 0 ? std::string(buffer, static_cast<std::size_t>(count)) : std::string();
  }

 private:
  const std::string _path;
  const FileDescriptor _socket;
};

TEST(Readiness, IsToldOnceClientsAreTaken) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server, notStarted());
  ServiceManager manager(daemon.directory() + "/notify");
  ChildProcess::Options options;
  options.command = {daemonProgram(), "--socket", daemon.socketPath()};
  options.environment = daemon.environment();
  options.environment["SSL_CERT_FILE"] = server.tls().caFile();
  options.environment["NOTIFY_SOCKET"] = manager.path();
  ChildProcess process(options);
  EXPECT_EQ(manager.receive().rfind("READY=1", 0), 0U);
  EXPECT_EQ(statusThrough(daemon, daemon.socketPath()), 0);
  process.signal(SIGTERM);
  EXPECT_EQ(manager.receive(), "STOPPING=1");
  EXPECT_EQ(process.wait(), 0);
}

TEST(Readiness, IsNotToldByADaemonThatCannotListen) {
  ReportingServer server;
  Daemon daemon(server);
  ServiceManager manager(daemon.directory() + "/notify");
  ChildProcess::Options options;
  options.command = {daemonProgram(), "--socket", daemon.socketPath()};
  options.environment = daemon.environment();
  options.environment["NOTIFY_SOCKET"] = manager.path();
  ChildProcess second(options);
  EXPECT_EQ(second.wait(), 69);
  EXPECT_EQ(manager.receive(std::chrono::milliseconds(0)), "");
}

TEST(Descriptors, AreAsManyAsTheSystemAllows) {
  ReportingServer server;
  Daemon daemon(server, notStarted());
  ChildProcess::Options options;
  options.command = {"/bin/bash", "-c", "ulimit -S -n 256; exec \"$0\" --socket \"$1\"", daemonProgram(),
                     daemon.socketPath()};
  options.environment = daemon.environment();
  ChildProcess process(options);
  ASSERT_TRUE(process.errors().waitForPart("main: Listener resumes with sandbox, start loop."));
  rlimit limit{};
  ASSERT_EQ(::prlimit(process.pid(), RLIMIT_NOFILE, nullptr, &limit), 0);
  EXPECT_EQ(limit.rlim_cur, std::min<rlim_t>(limit.rlim_max, 65'536));
}

TEST(Settings, HeldByAnotherProcessDelayASessionAMomentAlone) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  Daemon daemon(server);
  const FileDescriptor lock(
      ::open((daemon.directory() + "/state/com.tavrin.velkreporting.lock").c_str(), O_RDWR | O_CLOEXEC));
  ASSERT_TRUE(lock);
  ASSERT_EQ(::flock(lock.get(), LOCK_EX | LOCK_NB), 0);
  const auto begun = std::chrono::steady_clock::now();
  ControlledSession session(daemon);
  const auto lists = session.open(9, 1);
  ASSERT_EQ(lists.size(), 3U);
  EXPECT_EQ(lists[0], kSplunk) << "nothing needs to be stored for it";
  EXPECT_LT(std::chrono::steady_clock::now() - begun, std::chrono::seconds(30)) << "one wait, on a busy machine";
  EXPECT_TRUE(daemon.log().waitForPart("com.tavrin.velkreporting.lock is held by another process"));
}

/// What a grant to another user needs root for.
class Reload : public testing::Test {
 protected:
  void SetUp() override {
    if (geteuid() != 0) GTEST_SKIP() << "needs root, to run clients as another user";
    server.setStorebag("heather", storebagWith(server));
    daemon = std::make_unique<Daemon>(server, notStarted());
    ASSERT_EQ(::mkdir(rules().c_str(), 0755), 0);
    writeContents(rules() + "/a.conf", "[com.tavrin.private.velkreportingd]\nusers = 65534\n");
    ASSERT_EQ(::chmod((rules() + "/a.conf").c_str(), 0644), 0);
    daemon->start();
  }
  [[nodiscard]] std::string rules() const { return daemon->directory() + "/config/entitlements.d"; }
  [[nodiscard]] bool isTaken() {
    ControlledSession session(*daemon, 65534);
    return !session.open(9, 1).empty();
  }

  ReportingServer server;
  std::unique_ptr<Daemon> daemon;
};

TEST_F(Reload, KeepsTheRulesWhenAFileCannotBeRead) {
  ASSERT_EQ(::unlink((rules() + "/a.conf").c_str()), 0);
  ASSERT_EQ(::mkdir((rules() + "/b.conf").c_str(), 0755), 0);
  daemon->process().signal(SIGHUP);
  ASSERT_TRUE(daemon->log().waitForPart("<3>reload: not all entitlements can be read: the old ones stay"));
  EXPECT_TRUE(daemon->log().waitForPart("<3>Entitlements: " + rules() + "/b.conf is not a regular file"));
  EXPECT_TRUE(isTaken());
  ASSERT_EQ(::rmdir((rules() + "/b.conf").c_str()), 0);
  daemon->process().signal(SIGHUP);
  ASSERT_TRUE(daemon->log().waitForPart("reload: 0 entitlement grants"));
  EXPECT_FALSE(isTaken());
}

TEST_F(Reload, AskedForAHundredTimesReadsTheLastRules) {
  for (int signal = 0; signal < 100; ++signal) daemon->process().signal(SIGHUP);
  ASSERT_EQ(::unlink((rules() + "/a.conf").c_str()), 0);
  daemon->process().signal(SIGHUP);
  ASSERT_TRUE(daemon->log().waitForPart("reload: 0 entitlement grants"));
  EXPECT_FALSE(isTaken());
  EXPECT_EQ(daemon->stop(), 0);
  EXPECT_LE(daemon->log().count("reload: "), 101U);
}

TEST(End, NamesTheServersThatDoNotAnswer) {
  ReportingServer server;
  server.setStorebag("heather", storebagWith(server));
  TlsTestServer::Response never;
  never.silent = true;
  server.setPostResponse(never);
  Daemon daemon(server);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1)[0], kSplunk);
  for (int event = 0; event < 80; ++event) session.sendEvent(7, event);
  ASSERT_TRUE(server.waitForPosts(2));
  const auto begun = std::chrono::steady_clock::now();
  EXPECT_EQ(daemon.stop(), 0) << "what was cut off was none of the process's own";
  EXPECT_LT(std::chrono::steady_clock::now() - begun, std::chrono::seconds(30)) << "five, on a busy machine";
  EXPECT_EQ(daemon.log().count("stop: posts are still under way after 3800 ms and are cut off"), 1U);
}

}  // namespace
}  // namespace velk::test
