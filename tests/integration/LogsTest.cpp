// The daemon's two logs when their readers or their disk do not keep up: sessions never feel it.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <csignal>

#include "platform/Files.h"
#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

/// A named pipe for the daemon's standard error stream, read when the test says so.
class UnreadStream {
 public:
  explicit UnreadStream(const std::string& path) : _path(path) {
    EXPECT_EQ(::mkfifo(path.c_str(), 0600), 0);
    // With a writing end of its own: a stream that is not written yet is not at its end.
    _stream = FileDescriptor(::open(path.c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC));
  }
  [[nodiscard]] const std::string& path() const { return _path; }
  /// Reads until `part` has come, or nothing more comes in time; everything that was read so far.
  const std::string& readUntil(std::string_view part) {
    char buffer[4096];
    while (_text.find(part, _seen) == std::string::npos) {
      pollfd readable{_stream.get(), POLLIN, 0};
      if (::poll(&readable, 1, static_cast<int>(kPatience.count()) * 1000) != 1) break;
      const auto count = ::read(_stream.get(), buffer, sizeof buffer);
      if (count <= 0) break;
      _text.append(buffer, static_cast<std::size_t>(count));
    }
    return _text;
  }
  /// What was read until now is not looked at again.
  void forget() { _seen = _text.size(); }

 private:
  const std::string _path;
  FileDescriptor _stream;
  std::string _text;
  std::size_t _seen = 0;
};

ChildProcess::Options daemonOn(const UnreadStream& stream, const Daemon& daemon, ReportingServer& server) {
  ChildProcess::Options options;
  options.command = {
      "/bin/sh",           "-c",         "exec \"$0\" --socket \"$1\" --log-level debug 2>\"$2\"", daemonProgram(),
      daemon.socketPath(), stream.path()};
  options.environment = daemon.environment();
  options.environment["SSL_CERT_FILE"] = server.tls().caFile();
  return options;
}

TEST(Logs, FullStandardErrorStopsNoSessionAndTheLinesLeftOutAreCounted) {
  constexpr std::size_t kEvents = 4000;
  ReportingServer server;
  for (const char* name : {"heather", "sorrel", "yarrow"}) server.setStorebag(name, storebagWith(server));
  Daemon::Options options;
  options.starts = false;
  Daemon daemon(server, options);
  UnreadStream stream(daemon.directory() + "/errors");
  ChildProcess process(daemonOn(stream, daemon, server));
  static_cast<void>(stream.readUntil("main: Listener resumes with sandbox, start loop."));
  {
    // Nothing is read from here on.
    ControlledSession session(daemon);
    ASSERT_EQ(session.open(9, 1).size(), 3U);
    std::size_t last = 0;
    for (std::size_t number = 0; number < kEvents; ++number) last = session.sendEvent(7, 1);
    EXPECT_FALSE(session.reply(last).empty());
    // Another one is served as well.
    ControlledSession other(daemon);
    EXPECT_EQ(other.open(9, 2).size(), 3U);
  }
  stream.forget();
  const auto& text = stream.readUntil("lines that nothing read in time");
  EXPECT_NE(text.find("<3>log: left out "), std::string::npos);
  stream.forget();
  // It ends in good time although nothing is read again, and without a word left behind where there is room.
  process.signal(SIGTERM);
  EXPECT_EQ(process.wait(), 0);
  EXPECT_NE(stream.readUntil("main: Asked to stop.").find("main: Asked to stop."), std::string::npos);
}

TEST(Logs, FullMessageLogGoesToTheSpoolAndTheNextEntryIsKept) {
  ReportingServer server;
  for (const char* name : {"heather", "sorrel", "yarrow"}) server.setStorebag(name, storebagWith(server));
  const TemporaryDirectory spool;
  Daemon::Options options;
  options.starts = false;
  options.defaults = {{"logSubmissionDirectory", spool.path()}};
  Daemon daemon(server, options);
  const auto full = daemon.directory() + "/logs/velkreportingd_2020-01-01-00-00-00_messageLog.ips";
  ASSERT_TRUE(files::createDirectories(daemon.directory() + "/logs"));
  ASSERT_TRUE(files::createEmpty(full));
  ASSERT_EQ(::truncate(full.c_str(), 64 * 1024 * 1024 - 10), 0);
  daemon.start();
  {
    ControlledSession session(daemon);
    ASSERT_EQ(session.open(9, 1).size(), 3U);
    const auto last = session.sendEvent(7, 1, PropertyDictionary{{"name", "kept"}});
    EXPECT_FALSE(session.reply(last).empty());
  }
  EXPECT_EQ(daemon.stop(), 0);
  EXPECT_NE(daemon.messageLog().find("\"kept\""), std::string::npos);
  EXPECT_LT(daemon.messageLog().size(), 1024U * 1024);
  EXPECT_EQ(files::list(spool.path()).value_or(std::vector<std::string>()),
            std::vector<std::string>{"224-velkreportingd_2020-01-01-00-00-00_messageLog.ips"});
}

}  // namespace
}  // namespace velk::test
