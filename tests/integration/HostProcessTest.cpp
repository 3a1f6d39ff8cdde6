// The library in processes that do what processes do: they start before the daemon, fork, become other programs, exit
// without a word, have signal handlers of their own, and load and unload what links it.

#include <sys/stat.h>
#include <unistd.h>

#include "tests/integration/HostProcess.h"

namespace velk::test {
namespace {

constexpr uid_t kNobody = 65534;

TEST_F(HostProcessTest, NeedsNoDaemonToStartAndOutlivesIt) {
  HostProcess host(*daemon, {{}, std::nullopt, "default"});
  EXPECT_EQ(host.call("create 1"), "");
  EXPECT_EQ(host.call("configure"), " unanswered");
  EXPECT_EQ(host.call("send 1 50"), "");
  daemon->start();
  EXPECT_TRUE(host.flush());
  ASSERT_TRUE(server.waitForEvents(50, {7}));
  daemon->kill();
  ASSERT_TRUE(host.log().waitForPart("IPC connection interrupted"));
  EXPECT_EQ(host.call("send 51 50"), "");
  daemon->start();
  EXPECT_TRUE(host.flush());
  ASSERT_TRUE(server.waitForEvents(100, {7}));
  EXPECT_EQ(arrived(), numbersTo(100));
  EXPECT_EQ(host.end("return"), 0);
}

TEST_F(HostProcessTest, SaysOnceThatItMayNotUseTheSocket) {
  if (geteuid() != 0) GTEST_SKIP() << "only root may be somebody else";
  daemon->start();
  ASSERT_EQ(chmod(daemon->directory().c_str(), 0755), 0);
  ASSERT_EQ(chmod(daemon->socketPath().c_str(), 0600), 0);
  TemporaryDirectory home;
  ASSERT_EQ(chmod(home.path().c_str(), 0777), 0);
  HostProcess host(*daemon, {{{"HOME", home.path()}}, kNobody, "default"});
  EXPECT_EQ(host.call("create 1"), "");
  EXPECT_EQ(host.call("send 1 1"), "");
  EXPECT_GE(host.log().countOnceThereAre(3, "Failed to connect to daemon"), 3U) << "it tries again and again";
  EXPECT_EQ(host.log().count(daemon->socketPath() + ": Permission denied"), 1U);
}

TEST_F(HostProcessTest, CountsWhatTheOutboxRefusedAndSaysSoOnceADaemonIsThere) {
  constexpr std::size_t kTaken = 16'384;
  HostProcess host(*daemon);
  EXPECT_EQ(host.call("create 1"), "");
  EXPECT_EQ(host.call("configure"), " unanswered");
  EXPECT_EQ(host.call("fill"), " " + std::to_string(kTaken) + " 10");
  EXPECT_EQ(host.log().count("were refused"), 0U);
  daemon->start();
  EXPECT_TRUE(host.log().waitForPart("10 events were refused while the daemon was away or slow"));
  EXPECT_TRUE(host.flush());
  ASSERT_TRUE(server.waitForEvents(kTaken, {7}));
  EXPECT_EQ(arrived(), numbersTo(kTaken));
  EXPECT_EQ(host.call("send " + std::to_string(kTaken + 1) + " 1"), "") << "there is room again";
  EXPECT_EQ(host.end("return"), 0);
}

TEST_F(HostProcessTest, ForkedChildrenAreInertAndDoTheParentNoHarm) {
  daemon->start();
  HostProcess host(*daemon, {{}, std::nullopt, "default"});
  host.open();
  EXPECT_EQ(host.call("send 1 1"), "");
  EXPECT_EQ(host.call("fork"), "");
  EXPECT_EQ(host.call("send 2 1"), "");
#if defined(__SANITIZE_THREAD__)
  // Forks are slow here, and what is sent meanwhile has to be posted before the test goes on.
  EXPECT_EQ(host.call("send-forever 1"), "");
  EXPECT_EQ(host.call("fork-often 4"), "");
#else
  EXPECT_EQ(host.call("send-forever 4"), "");
  EXPECT_EQ(host.call("fork-often 20"), "");
#endif
  EXPECT_EQ(host.call("stop-senders"), "");
  EXPECT_TRUE(host.flush()) << "they may have filled the outbox; posts: " << server.posts().size();
  EXPECT_EQ(host.call("send 3 1"), "");
  EXPECT_TRUE(host.flush());
  ASSERT_TRUE(server.waitForEvents(3, {7}));
  EXPECT_EQ(arrived(), numbersTo(3)) << "nothing of a child's";
  EXPECT_EQ(daemon->log().countOnceThereAre(1, "listener: Accepting new IPC connection"), 1U)
      << "the parent's connection is whole";
  EXPECT_EQ(daemon->log().count("finishSessionGracefully"), 0U) << "no child finished it";
  EXPECT_EQ(host.end("exit"), 0);
}

TEST_F(HostProcessTest, ProgramsThatItBecomesInheritNothing) {
  daemon->start();
  HostProcess host(*daemon);
  const auto before = words(host.call("descriptors"));
  host.open();
  const std::string file = daemon->directory() + "/upload";
  writeContents(file, "of the user's");
  const Standstill standstill(*daemon);
  EXPECT_EQ(host.call("upload " + file), " taken");
  EXPECT_EQ(host.call("one-shot 5"), "");
  EXPECT_GT(words(host.call("descriptors")).size(), before.size()) << "the library has some";
  host.write("become-another");
  const auto line = host.lines().waitFor([](const std::string& each) { return each.starts_with("started with"); });
  ASSERT_TRUE(line);
  EXPECT_EQ(words(line->substr(12)), before);
  EXPECT_EQ(host.process().wait(), 0);
}

TEST_F(HostProcessTest, ProgramsThatItStartsMeanwhileInheritNothing) {
  constexpr std::size_t kPrograms = 50;
  daemon->start();
  HostProcess host(*daemon);
  const auto before = words(host.call("descriptors"));
  const std::string file = daemon->directory() + "/upload";
  writeContents(file, "of the user's");
  EXPECT_EQ(host.call("spawn-often " + std::to_string(kPrograms) + " " + file), "");
  std::size_t programs = 0;
  for (const auto& line : host.lines().lines()) {
    if (!line.starts_with("started with")) continue;
    ++programs;
    EXPECT_EQ(words(line.substr(12)), before);
  }
  EXPECT_EQ(programs, kPrograms);
  EXPECT_EQ(host.end("return"), 0);
}

#if !defined(__SANITIZE_THREAD__)  // which knows no child with threads of its own
TEST_F(HostProcessTest, ForkedChildrenMayHaveClientsOfTheirOwn) {
  daemon->start();
  HostProcess host(*daemon);
  host.open();
  EXPECT_EQ(host.call("send 1 1"), "");
  EXPECT_EQ(host.call("fork-with-its-own 2"), "");
  EXPECT_EQ(host.call("send 3 1"), "");
  EXPECT_EQ(host.call("fork-with-its-own 4"), "");
  EXPECT_TRUE(host.flush());
  ASSERT_TRUE(server.waitForEvents(4, {7}));
  auto numbers = arrived();
  std::sort(numbers.begin(), numbers.end());
  EXPECT_EQ(numbers, numbersTo(4)) << "of the parent's and the children's, and of no grandchild's";
  EXPECT_EQ(daemon->log().countOnceThereAre(3, "listener: Accepting new IPC connection"), 3U);
  EXPECT_EQ(host.end("exit"), 0);
}
#endif

TEST_F(HostProcessTest, TheLibraryTakesOneThreadAndSendsWithoutAnother) {
  HostProcess host(*daemon);
  EXPECT_EQ(host.call("threads"), host.threadsAtStart());
  EXPECT_EQ(host.call("create 1"), "");
  EXPECT_EQ(host.call("send 1 100"), "");
  auto expected = words(host.threadsAtStart() + " velkreporting");
#if defined(__SANITIZE_THREAD__)
  expected.emplace_back("host_process");  // the sanitizer's own, which comes with the first other thread
#endif
  std::sort(expected.begin(), expected.end());
  // A thread has its maker's name until it first runs.
  const auto threads = [&] {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    for (;;) {
      auto names = words(host.call("threads"));
      std::sort(names.begin(), names.end());
      if (names == expected || names.size() != expected.size()) return names;
      if (std::chrono::steady_clock::now() > deadline) return names;
    }
  };
  EXPECT_EQ(threads(), expected) << "for a client without a daemon";
  daemon->start();
  EXPECT_TRUE(daemon->log().waitForPart("listener: Accepting new IPC connection"));
  EXPECT_EQ(host.call("send 101 100"), "");
  EXPECT_EQ(threads(), expected);
  EXPECT_EQ(host.end("exit"), 0);
}

TEST_F(HostProcessTest, CallbacksMayWaitForOtherReplies) {
  daemon->start();
  HostProcess host(*daemon);
  host.open();
  EXPECT_EQ(host.call("nested"), "");
  EXPECT_EQ(host.end("return"), 0);
}

TEST_F(HostProcessTest, ItsSignalsAreItsOwn) {
  daemon->start();
  HostProcess host(*daemon, {{}, std::nullopt, "default"});
  const auto actions = host.call("actions");
  host.open();
  EXPECT_EQ(host.call("send-forever 2"), "");
  for (std::size_t restart = 1; restart <= 3; ++restart) {
    daemon->kill();
    std::size_t seen = 0;
    ASSERT_TRUE(host.log().waitFor([&](const std::string& line) {
      return line.find("IPC connection interrupted") != std::string::npos && ++seen == restart;
    }));
    daemon->start();
    ASSERT_TRUE(daemon->log().waitForPart("startConfigWithCompletionHandler: Starting configuration for session 1"));
  }
  EXPECT_EQ(host.call("stop-senders"), "");
  EXPECT_EQ(host.call("actions"), actions);
  EXPECT_EQ(host.call("signal-itself"), "") << "no thread of the library's takes any";
  EXPECT_EQ(host.call("signals"), " 0 0") << "writes to the dead daemon, and children";
  EXPECT_EQ(host.end("return"), 0);
}

TEST_F(HostProcessTest, ABrokenErrorStreamRaisesNoSignal) {
  daemon->start();
  HostProcess host(*daemon, {{}, std::nullopt, "debug"});
  EXPECT_EQ(host.call("break-error-stream"), "");
  host.open();
  EXPECT_EQ(host.call("send 1 10"), "");
  EXPECT_TRUE(host.flush());
  EXPECT_EQ(host.call("signals"), " 0 0");
  EXPECT_EQ(host.end("return"), 0);
}

TEST_F(HostProcessTest, ItsEndIsHeardOfAlthoughAChildLivesOn) {
  daemon->start();
  HostProcess host(*daemon);
  host.open();
  const pid_t child = std::atoi(host.call("fork-and-leave").c_str());
  ASSERT_GT(child, 0);
  EXPECT_EQ(host.call("send 1 1"), "");
  EXPECT_TRUE(host.flush()) << "the connection is whole";
  EXPECT_EQ(daemon->log().count("listener: IPC connection to"), 0U);
  kill(host.process().pid(), SIGKILL);
  EXPECT_EQ(daemon->log().countOnceThereAre(1, "was interrupted"), 1U);
  EXPECT_EQ(kill(child, SIGKILL), 0) << "it is still there";
  EXPECT_TRUE(server.waitForEvents(1, {7}));
}

TEST_F(HostProcessTest, ForeignServiceDirectoriesStayEmpty) {
  daemon->start();
  TemporaryDirectory directory;
  HostProcess::Options options;
  for (const char* name : {"RUNTIME", "STATE", "CACHE", "LOGS", "CONFIGURATION"}) {
    const std::string path = directory / name;
    ASSERT_EQ(mkdir(path.c_str(), 0777), 0);
    ASSERT_EQ(chmod(path.c_str(), 0777), 0);
    options.environment[std::string(name) + "_DIRECTORY"] = path;
  }
  const std::string own = directory / "own";
  ASSERT_EQ(mkdir(own.c_str(), 0777), 0);
  ASSERT_EQ(chmod(own.c_str(), 0777), 0);
  ASSERT_EQ(chmod(directory.path().c_str(), 0755), 0);
  options.environment["XDG_STATE_HOME"] = own;
  options.environment["HOME"] = own;
  if (geteuid() == 0) {  // whose own directories are the machine's
    const std::string rules = daemon->directory() + "/config/entitlements.d";
    mkdir(rules.c_str(), 0755);
    writeContents(rules + "/test.conf", "[com.tavrin.private.velkreportingd]\nusers = 65534\n");
    ASSERT_EQ(chmod((rules + "/test.conf").c_str(), 0644), 0);
    ASSERT_EQ(daemon->stop(), 0);
    daemon->start();
    options.user = kNobody;
  }
  HostProcess host(*daemon, options);
  host.open();
  EXPECT_EQ(host.call("send 1 1"), "");
  const auto identifier = host.call("identifier");
  EXPECT_EQ(identifier.size(), 37U);
  EXPECT_TRUE(host.flush());
  ASSERT_TRUE(server.waitForEvents(1, {7}));
  EXPECT_EQ(host.end("return"), 0);
  for (const auto& [name, path] : options.environment) {
    if (path == own) continue;
    EXPECT_TRUE(std::filesystem::is_empty(path)) << name;
  }
  const auto suite = fileNamed(own, "com.tavrin.velkreporting.json");
  ASSERT_TRUE(suite) << "identifiers are the user's";
  EXPECT_NE(contentsOf(*suite).find(identifier.substr(1)), std::string::npos);
  EXPECT_EQ(contentsOf(daemon->directory() + "/state/com.tavrin.velkreporting.json").find(identifier.substr(1)),
            std::string::npos)
      << "and not what the daemon reads";
}

TEST_F(HostProcessTest, LoadingDoesNothingAndUnloadingNothingEither) {
  daemon->start();
  ChildProcess::Options options;
  options.command = {VELK_LOADING_HOST_PROGRAM, VELK_CLIENT_LIBRARY, "100"};
  options.environment = {{"VELKREPORTING_SOCKET", daemon->socketPath()}, {"ASAN_OPTIONS", "detect_leaks=0"}};
  const auto finished = runProgram(options);
  EXPECT_EQ(finished.status, 0) << finished.errors;
  std::istringstream output(finished.output);
  std::string loaded, done;
  int threadsBefore = 0, threads = 0, descriptorsBefore = 0, descriptors = 0, threadsAtEnd = 0, isMapped = 0;
  output >> loaded >> threadsBefore >> threads >> descriptorsBefore >> descriptors >> done >> threadsAtEnd >> isMapped;
  EXPECT_EQ(loaded + done, "loadeddone") << finished.output;
  EXPECT_EQ(threads, threadsBefore);
  EXPECT_EQ(descriptors, descriptorsBefore);
  EXPECT_EQ(isMapped, 1) << "its thread is in it";
  EXPECT_LE(threadsAtEnd, threadsBefore + 3) << "its own, and those that bring the last replies";
  EXPECT_TRUE(server.waitForEvents(1, {7}));
}

}  // namespace
}  // namespace velk::test
