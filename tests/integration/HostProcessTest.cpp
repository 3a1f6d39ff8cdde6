// The library in processes that do what processes do: they start before the daemon, fork, become other programs, exit
// without a word, have signal handlers of their own, and load and unload what links it.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <numeric>
#include <sstream>

#include "tests/integration/Scenario.h"

namespace velk::test {
namespace {

constexpr uid_t kNobody = 65534;

/// See clients/host_process.cpp.
class HostProcess {
 public:
  struct Options {
    std::map<std::string, std::string> environment;
    std::optional<uid_t> user;
    std::string log = "error";
  };

  explicit HostProcess(const Daemon& daemon) : HostProcess(daemon, Options()) {}
  HostProcess(const Daemon& daemon, const Options& options)
      : _process([&] {
          ChildProcess::Options child;
          child.command = {VELK_HOST_PROGRAM};
          child.environment = {{"VELKREPORTING_SOCKET", daemon.socketPath()},
                               {"VELKREPORTING_LOG", options.log},
                               // A forked child has not the stacks from which its parent's threads reach what they own.
                               {"ASAN_OPTIONS", "detect_leaks=0"}};
          for (const auto& [name, value] : options.environment) child.environment[name] = value;
          child.user = options.user;
          return child;
        }()) {
    const auto line = lines().waitFor([](const std::string& each) { return each.starts_with("started"); });
    _threadsAtStart = line.value_or("nothing").substr(7);
  }

  [[nodiscard]] ChildProcess& process() { return _process; }
  [[nodiscard]] LineCollector& lines() { return _process.output(); }
  [[nodiscard]] LineCollector& log() { return _process.errors(); }
  /// The names of the threads that it had before it used the library.
  [[nodiscard]] std::string threadsAtStart() const { return _threadsAtStart; }

  void write(const std::string& command) { _process.write(command + "\n"); }
  /// Waits until it is done: what it says of it, a space in front; or "no answer".
  std::string call(const std::string& command) {
    const std::size_t from = lines().lines().size();
    write(command);
    const auto line = lines().waitFor([&](const std::string& each) { return each.starts_with(command); }, from);
    return line ? line->substr(command.size()) : "no answer";
  }
  void open(int number = 1) {
    EXPECT_EQ(call("create " + std::to_string(number)), "");
    EXPECT_EQ(call("configure"), "");
  }
  /// Waits until the daemon has taken and posted everything that was sent: it may have to come back first.
  [[nodiscard]] bool flush() {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (std::chrono::steady_clock::now() < deadline) {
      const auto code = call("flush");
      if (code == " 0") return true;
      if (code == "no answer") return false;
    }
    return false;
  }
  int end(const std::string& command) {
    write(command);
    return _process.wait().value_or(-1);
  }

 private:
  ChildProcess _process;
  std::string _threadsAtStart;
};

/// A daemon that does nothing, for as long as this lives.
class Standstill {
 public:
  explicit Standstill(Daemon& daemon) : _daemon(daemon) { _daemon.process().signal(SIGSTOP); }
  ~Standstill() { _daemon.process().signal(SIGCONT); }
  Standstill(const Standstill&) = delete;
  Standstill& operator=(const Standstill&) = delete;

 private:
  Daemon& _daemon;
};

class HostProcessTest : public testing::Test {
 protected:
  HostProcessTest() {
    server.setStorebag("heather", storebagWith(server));
    Daemon::Options options;
    options.starts = false;
    daemon = std::make_unique<Daemon>(server, options);
  }

  /// The numbers of the events that arrived, in the order in which the daemon had them: posts may overtake each other,
  /// the events of one post may not.
  [[nodiscard]] std::vector<std::int64_t> arrived() const {
    std::vector<std::vector<std::int64_t>> posts;
    for (const auto& post : server.posts()) {
      std::vector<std::int64_t> numbers;
      const auto* const events = post.body.array("events");
      for (std::size_t at = 0; events != nullptr && at < events->size(); ++at) {
        const auto* const event = (*events)[at].dictionary();
        if (integerValue(event->find("_method")) == 7) numbers.push_back(integerValue(event->find("n")));
      }
      posts.push_back(std::move(numbers));
    }
    std::sort(posts.begin(), posts.end());
    std::vector<std::int64_t> all;
    for (const auto& numbers : posts) all.insert(all.end(), numbers.begin(), numbers.end());
    return all;
  }
  [[nodiscard]] static std::vector<std::int64_t> numbersTo(std::size_t last) {
    std::vector<std::int64_t> numbers(last);
    std::iota(numbers.begin(), numbers.end(), 1);
    return numbers;
  }
  [[nodiscard]] static std::vector<std::string> words(const std::string& text) {
    std::istringstream stream(text);
    std::vector<std::string> all;
    for (std::string word; stream >> word;) all.push_back(word);
    return all;
  }

  ReportingServer server;
  std::unique_ptr<Daemon> daemon;
};

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
  EXPECT_EQ(daemon->log().count("listener: Accepting new IPC connection"), 1U) << "the parent's connection is whole";
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
  EXPECT_EQ(host.call("signals"), " 0 0") << "writes to the dead daemon, and children";
  EXPECT_EQ(host.end("return"), 0);
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

/// Ways in which a process ends with events queued.
class EndOfProcess : public HostProcessTest, public testing::WithParamInterface<std::vector<std::string>> {};

TEST_P(EndOfProcess, LosesNoneOfAThousandEvents) {
  daemon->start();
  HostProcess host(*daemon);
  host.open();
  for (const auto& command : GetParam()) host.write(command);
  EXPECT_EQ(host.process().wait(), 0);
  ASSERT_TRUE(server.waitForEvents(1000, {7}));
  EXPECT_EQ(arrived(), numbersTo(1000));
  EXPECT_EQ(host.log().count("are lost"), 0U);
}

INSTANTIATE_TEST_SUITE_P(
    Ways, EndOfProcess,
    testing::Values(std::vector<std::string>{"send 1 1000", "exit"}, std::vector<std::string>{"send 1 1000", "return"},
                    std::vector<std::string>{"send 1 1000", "release", "exit"},
                    std::vector<std::string>{"leave-it-to-a-static", "create 2", "configure", "send 1 1000", "exit"},
                    std::vector<std::string>{"send 1 1000", "leave-it-to-a-static", "return"}));

TEST_F(HostProcessTest, ExitSendsSingleMessagesToo) {
  daemon->start();
  HostProcess host(*daemon);
  for (const char* command : {"one-shot 1", "one-shot 2", "one-shot 3", "exit"}) host.write(command);
  EXPECT_EQ(host.process().wait(), 0);
  ASSERT_TRUE(server.waitForEvents(3, {7}));
  EXPECT_EQ(arrived(), numbersTo(3));
}

TEST_F(HostProcessTest, ExitPassesAModuleThatIsStuck) {
  daemon->start();
  HostProcess host(*daemon);
  host.open();
  EXPECT_EQ(host.call("block-a-module"), "");
  EXPECT_EQ(host.call("send 1 100"), "");
  EXPECT_EQ(host.end("exit"), 0);
  ASSERT_TRUE(server.waitForEvents(100, {7}));
  EXPECT_EQ(arrived(), numbersTo(100));
}

TEST_F(HostProcessTest, AModuleMayEndTheProcess) {
  daemon->start();
  HostProcess host(*daemon);
  host.open();
  EXPECT_EQ(host.call("send 1 100"), "");
  EXPECT_EQ(host.end("exit-in-a-module"), 0);
  ASSERT_TRUE(server.waitForEvents(100, {7}));
  EXPECT_EQ(arrived(), numbersTo(100));
}

/// Commands that leave nothing to wait for but a daemon at a standstill.
class EndWithoutADaemon : public HostProcessTest, public testing::WithParamInterface<std::vector<std::string>> {};

TEST_P(EndWithoutADaemon, WaitsWithinABound) {
  daemon->start();
  HostProcess host(*daemon);
  host.open();
  EXPECT_EQ(host.call("create 2"), "");
  const Standstill standstill(*daemon);
  EXPECT_EQ(host.call("send 1 10000"), "");  // more than its socket holds
  for (const auto& command : GetParam()) host.write(command);
  EXPECT_EQ(host.process().wait(), 0);
}

INSTANTIATE_TEST_SUITE_P(Ways, EndWithoutADaemon,
                         testing::Values(std::vector<std::string>{"exit"}, std::vector<std::string>{"bound 10", "exit"},
                                         std::vector<std::string>{"bound 0", "exit"},
                                         std::vector<std::string>{"bound 10", "release", "exit"},
                                         std::vector<std::string>{"one-shot 10001", "exit"},
                                         std::vector<std::string>{"leave-it-to-a-static", "return"}));

TEST_F(HostProcessTest, ExitWaitsAsLongAsItIsTold) {
  daemon->start();
  HostProcess host(*daemon);
  host.open();
  EXPECT_EQ(host.call("bound 3600000"), "");
  {
    const Standstill standstill(*daemon);
    EXPECT_EQ(host.call("send 1 10000"), "");
    host.write("exit");
    EXPECT_FALSE(host.process().wait(std::chrono::seconds(2))) << "twice what it would wait otherwise";
  }
  EXPECT_EQ(host.process().wait(), 0);
  ASSERT_TRUE(server.waitForEvents(10'000, {7}));
  EXPECT_EQ(arrived(), numbersTo(10'000));
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
