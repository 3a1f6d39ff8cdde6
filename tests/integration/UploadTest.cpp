// Files on their way from a client through the daemon to an upload server, and what becomes of them afterwards.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/fanotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "platform/Semaphore.h"
#include "tests/integration/RawConnection.h"
#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

const PropertyArray kTaken{true};
const PropertyArray kNotTaken{false};
constexpr uid_t kNobody = 65534;

TlsTestServer::Response answering(std::string text, int status = 200) {
  TlsTestServer::Response response;
  response.status = status;
  response.body = std::move(text);
  return response;
}

/// Holds up whoever reads a file, as a server of files that has gone does.
class StuckFile {
 public:
  explicit StuckFile(const std::string& path)
      : _events(::fanotify_init(FAN_CLASS_CONTENT | FAN_CLOEXEC, O_RDONLY | O_CLOEXEC)) {
    _isStuck = _events && ::fanotify_mark(_events.get(), FAN_MARK_ADD, FAN_ACCESS_PERM, AT_FDCWD, path.c_str()) == 0;
  }
  /// False where the system does not let us.
  [[nodiscard]] bool isStuck() const { return _isStuck; }
  [[nodiscard]] bool waitForReader() const {
    pollfd waiting{_events.get(), POLLIN, 0};
    return ::poll(&waiting, 1, static_cast<int>(std::chrono::milliseconds(kPatience).count())) == 1;
  }

 private:
  const FileDescriptor _events;
  bool _isStuck = false;
};

class Upload : public ::testing::Test {
 protected:
  Upload() {
    auto section = PropertyDictionary{{"release_timeout", 1}};
    section.set("upload_server", PropertyDictionary{{"post_url", server.url("/up")}});
    server.setStorebag("heather", storebagOf(section));
    server.setPostResponse(answering("success"));
    daemonOptions.deviceConfiguration = kDeviceLines;
  }
  static PropertyDictionary call(const std::string& path) { return {{"method", "uploadFileAtPath"}, {"path", path}}; }
  static PropertyArray replyTo(ControlledSession& session, std::size_t line) {
    const auto answer = session.reply(line);
    const auto* values = answer.array("reply");
    return values != nullptr ? *values : PropertyArray();
  }
  /// Requests that were never answered end. One that was sent over a connection already used is sent once more.
  void endSilence() {
    server.setPostResponse(answering("too late"));
    server.tls().closeConnections();
  }
  /// The highest resident memory of the daemon so far, in KiB.
  static long peakMemory(Daemon& daemon) {
    const auto status = contentsOf("/proc/" + std::to_string(daemon.process().pid()) + "/status");
    const auto at = status.find("VmHWM:");
    return at == std::string::npos ? -1 : std::atol(status.c_str() + at + 6);
  }

  ReportingServer server;
  Daemon::Options daemonOptions;
  const TemporaryDirectory directory;
};

TEST_F(Upload, DeliveredFilesAreRemovedByTheirOwner) {
  Daemon daemon(server, daemonOptions);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 77).size(), 3U);
  const auto one = directory.write("one", "x");
  const auto named = directory.write("a b&c.log", "what happened");
  EXPECT_EQ(session.call(call(one)), kTaken);
  EXPECT_EQ(session.call(call(named)), kTaken);
  EXPECT_FALSE(std::filesystem::exists(one));
  EXPECT_FALSE(std::filesystem::exists(named));
  const auto posts = server.posts();
  ASSERT_EQ(posts.size(), 2U);
  EXPECT_EQ(posts[0].request.method, "POST");
  EXPECT_EQ(TlsTestServer::gunzip(posts[0].request.body), "x");
  EXPECT_EQ(posts[1].request.target,
            "/up?uuid=0123456789abcdef0123456789abcdef01234567&sequence=77"
            "&description=Vistra%20AFRC%20log%20(Uploaded%20by%20Fenn)&filename=a%20b&c.log.gz&raw=true");
  EXPECT_EQ(TlsTestServer::gunzip(posts[1].request.body), "what happened");
  EXPECT_EQ(*posts[1].request.header("Content-Encoding"), "gzip");
  EXPECT_EQ(*posts[1].request.header("Content-Type"), "application/octet-stream");
  EXPECT_EQ(session.finish(), 0);
  EXPECT_NE(daemon.messageLog().find("[uploadFileWithURL] Upload succeeded for file file://" + one + "\n"),
            std::string::npos);
}

TEST_F(Upload, WhatIsNoFileOrHoldsNothingStays) {
  Daemon daemon(server, daemonOptions);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  const auto link = directory / "link";
  std::filesystem::create_symlink(directory.write("log", "text"), link);
  const auto fifo = directory / "fifo";
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
  for (const auto& path : {link, fifo, directory.path(), directory.write("empty", "")}) {
    EXPECT_EQ(session.call(call(path)), kNotTaken) << path;
    EXPECT_TRUE(std::filesystem::exists(path));
  }
  EXPECT_EQ(session.finish(), 0);
  ASSERT_TRUE(daemon.log().waitForPart("UploadBackend(uploadFileAtPath): Input file is empty")) << "the last of them";
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "UploadBackend(uploadFileAtPath): Input file is empty"), 1U);
  EXPECT_EQ(daemon.log().countOnceThereAre(3, "UploadBackend(uploadFileAtPath): Only upload a regular file."), 3U);
  EXPECT_TRUE(server.posts().empty());
  EXPECT_EQ(daemon.stop(), 0);
}

TEST_F(Upload, AStopDoesNotWaitForAFileThatCannotBeRead) {
  Daemon daemon(server, daemonOptions);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  const auto path = directory.write("log", "text");
  const StuckFile stuck(path);
  if (!stuck.isStuck()) GTEST_SKIP() << "only root may hold readers up";
  session.send(call(path));
  ASSERT_TRUE(stuck.waitForReader());
  EXPECT_EQ(daemon.stop(), 70);
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "stop: files of clients that are being uploaded cannot be read"), 1U);
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "stop: uploads left behind: 1;"), 1U);
  EXPECT_TRUE(std::filesystem::exists(path));
}

TEST_F(Upload, LargeFilesTakeLittleMemory) {
  constexpr std::size_t kSize = 200'000'000;
  Daemon daemon(server, daemonOptions);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  const auto large = directory.write("large", "begin");
  std::filesystem::resize_file(large, kSize);
  EXPECT_EQ(session.call(call(large)), kTaken);
  EXPECT_FALSE(std::filesystem::exists(large));
  const auto posts = server.posts();
  ASSERT_EQ(posts.size(), 1U);
  const auto text = TlsTestServer::gunzip(posts[0].request.body);
  EXPECT_EQ(text.size(), kSize);
  EXPECT_EQ(text.substr(0, 5), "begin");
  EXPECT_LT(peakMemory(daemon), 150'000);
  EXPECT_EQ(session.finish(), 0);
}

TEST_F(Upload, BodiesLongerThanMemoryShouldHoldAreSentFromTheDisk) {
  Daemon daemon(server, daemonOptions);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  std::string noise;
  std::uint32_t state = 1;
  while (noise.size() < 12'000'000) noise += static_cast<char>((state = state * 1664525 + 1013904223) >> 24);
  EXPECT_EQ(session.call(call(directory.write("noise", noise))), kTaken);
  const auto posts = server.posts();
  ASSERT_EQ(posts.size(), 1U);
  EXPECT_TRUE(TlsTestServer::gunzip(posts[0].request.body) == noise);
  ASSERT_NE(posts[0].request.header("Content-Length"), nullptr);
  EXPECT_EQ(session.finish(), 0);
}

TEST_F(Upload, ServersThatFailLeaveTheFileWhereItIs) {
  Daemon daemon(server, daemonOptions);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  const auto path = directory.write("log", "text");
  server.setPostResponse(answering("broken", 500));
  EXPECT_EQ(session.call(call(path)), kTaken) << "whatever the server says";
  TlsTestServer::Response cut;
  cut.raw = "HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\nsucc";
  server.setPostResponse(cut);
  EXPECT_EQ(session.call(call(path)), kTaken);
  cut.raw = "HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\n";
  server.setPostResponse(cut);
  EXPECT_EQ(session.call(call(path)), kTaken);
  EXPECT_TRUE(daemon.log().waitForPart("UploadBackend(uploadFileAtPath): post 127.0.0.1: "));
  EXPECT_TRUE(std::filesystem::exists(path));
  EXPECT_EQ(session.finish(), 0);
}

TEST_F(Upload, FileThatTookAnothersPlaceStays) {
  Daemon daemon(server, daemonOptions);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  Semaphore arrived;
  Semaphore replaced;
  server.tls().setHandler([&](const TlsTestServer::Request&) {
    arrived.signal();
    EXPECT_TRUE(replaced.waitFor(kPatience));
    return answering("success");
  });
  const auto path = directory.write("log", "text");
  const auto line = session.send(call(path));
  ASSERT_TRUE(arrived.waitFor(kPatience));
  std::filesystem::remove(path);
  static_cast<void>(directory.write("log", "another one"));
  replaced.signal();
  EXPECT_EQ(replyTo(session, line), kTaken);
  EXPECT_EQ(session.finish(), 0);
  EXPECT_EQ(directory.read("log"), "another one");
}

TEST_F(Upload, FileOfSomebodyElseStays) {
  if (::geteuid() != 0) GTEST_SKIP() << "only root may be another user";
  daemonOptions.starts = false;
  Daemon daemon(server, daemonOptions);
  std::filesystem::create_directories(daemon.directory() + "/config/entitlements.d");
  writeContents(daemon.directory() + "/config/entitlements.d/tests.conf",
                "[com.tavrin.private.velkreportingd]\nusers = 65534\n");
  daemon.start();
  std::filesystem::permissions(directory.path(), std::filesystem::perms(0755));
  const auto path = directory.write("log", "text");
  std::filesystem::permissions(path, std::filesystem::perms(0644));
  const auto secret = directory.write("secret", "text");
  ControlledSession session(daemon, kNobody);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  EXPECT_EQ(session.call(call(path)), kTaken);
  EXPECT_EQ(TlsTestServer::gunzip(server.posts().at(0).request.body), "text");
  EXPECT_TRUE(std::filesystem::exists(path));
  EXPECT_NE(session.reply(session.send(call(secret))).string("error"), nullptr) << "what it may not read stays secret";
  EXPECT_EQ(server.posts().size(), 1U);
  EXPECT_EQ(session.finish(), 0);
}

TEST_F(Upload, ServerThatNeverAnswersHoldsNothingElseUp) {
  Daemon daemon(server, daemonOptions);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  TlsTestServer::Response silence;
  silence.silent = true;
  server.setPostResponse(silence);
  const auto line = session.send(call(directory.write("log", "text")));
  ASSERT_TRUE(server.waitForPosts(1));
  EXPECT_EQ(session.call({{"method", "fetchDisplayURL"}}), PropertyArray{"URL not available"});
  EXPECT_EQ(session
                .call({{"method", "fetchStatesWithUserInfo"},
                       {"userInfo", PropertyDictionary{{"_clientName", "Other"}, {"_serviceName", "user"}}}})
                .size(),
            3U)
      << "a change of the transport included";
  EXPECT_EQ(session.process().output().count("\"line\":" + std::to_string(line) + ","), 0U) << "still under way";
  endSilence();
  EXPECT_EQ(replyTo(session, line), kTaken);
  EXPECT_EQ(session.finish(), 0);
}

TEST_F(Upload, KilledClientsFreeTheirSlotsAtOnceAndTheDaemonInTheEnd) {
  daemonOptions.arguments = {"--idle-exit", "1"};
  Daemon daemon(server, daemonOptions);
  TlsTestServer::Response silence;
  silence.silent = true;
  server.setPostResponse(silence);
  // Somebody who says nothing is there until the first of them has started.
  RawConnection bystander(daemon);
  ASSERT_TRUE(bystander.isConnected());
  std::vector<std::unique_ptr<ControlledSession>> sessions;
  for (int number = 0; number < 5; ++number) {
    sessions.push_back(std::make_unique<ControlledSession>(daemon));
    ASSERT_EQ(sessions.back()->open(9, number).size(), 3U);
    sessions.back()->send(call(directory.write("log" + std::to_string(number), "text")));
  }
  ASSERT_TRUE(server.waitForPosts(5));
  bystander.close();
  for (auto& session : sessions) session->kill();
  for (int number = 0; number < 5; ++number) {
    EXPECT_TRUE(daemon.log().waitForPart("invalidateReportingSession: ReportingdSession <ReportingdSession " +
                                         std::to_string(number) + ", "));
  }
  {
    ControlledSession next(daemon);
    EXPECT_EQ(next.open(9, 9).size(), 3U) << "none of the dead counts any more";
    EXPECT_EQ(next.finish(), 0);
  }
  EXPECT_EQ(daemon.process().wait(std::chrono::milliseconds(0)), std::nullopt) << "uploads are still under way";
  endSilence();
  EXPECT_EQ(daemon.process().wait(), 0);
  EXPECT_TRUE(std::filesystem::exists(directory / "log0"));
}

TEST_F(Upload, DaemonThatIsToldToStopLeavesThemBehind) {
  Daemon daemon(server, daemonOptions);
  TlsTestServer::Response silence;
  silence.silent = true;
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  server.setPostResponse(silence);
  session.send(call(directory.write("log", "text")));
  ASSERT_TRUE(server.waitForPosts(1));
  // Minutes of work for whoever would still compress them.
  constexpr int kWaiting = 15;
  for (int number = 0; number < kWaiting; ++number) {
    const auto large = directory.write("large" + std::to_string(number), "begin");
    std::filesystem::resize_file(large, 200'000'000);
    session.send(call(large));
  }
  EXPECT_EQ(session.call({{"method", "fetchDisplayURL"}}).size(), 1U) << "behind them";
  EXPECT_EQ(daemon.stop(), 0);
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "stop: uploads left behind: 16; their files stay with their clients"),
            1U);
  EXPECT_EQ(daemon.log().count("are still under way after"), 0U) << "nobody waits for a server that never answers";
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "UploadBackend(uploadFileAtPath): Uploading file "), 1U)
      << "the others were not begun";
  EXPECT_TRUE(std::filesystem::exists(directory / "log"));
  EXPECT_TRUE(std::filesystem::exists(directory / "large0"));
}

TEST_F(Upload, OneThatTheServerIsAboutToTakeIsStillDeliveredAtTheEnd) {
  Daemon daemon(server, daemonOptions);
  ControlledSession session(daemon);
  ASSERT_EQ(session.open(9, 1).size(), 3U);
  Semaphore arrived;
  server.tls().setHandler([&](const TlsTestServer::Request& request) {
    arrived.signal();
    EXPECT_TRUE(daemon.log().waitForPart("main: Asked to stop."));
    EXPECT_EQ(TlsTestServer::gunzip(request.body), "text");
    return answering("success");
  });
  const auto path = directory.write("log", "text");
  session.send(call(path));
  ASSERT_TRUE(arrived.waitFor(kPatience));
  EXPECT_EQ(daemon.stop(), 0);
  EXPECT_EQ(daemon.log().count("left behind"), 0U);
  EXPECT_EQ(daemon.log().countOnceThereAre(1, "UploadBackend(uploadFileAtPath): sending to |"), 1U);
}

}  // namespace
}  // namespace velk::test
