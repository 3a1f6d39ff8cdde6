// The last moments of processes that link the library, and of the clients in them: what was handed over is sent, within
// a bound, however they end.

#include "tests/integration/HostProcess.h"

namespace velk::test {
namespace {

using HostProcessEndTest = HostProcessTest;

/// Ways in which a process ends with events queued.
class EndOfProcess : public HostProcessTest, public testing::WithParamInterface<std::vector<std::string>> {};

TEST_P(EndOfProcess, LosesNoneOfAThousandEvents) {
  daemon->start();
  HostProcess host(*daemon);
  host.open();
  // What is told of here is that nothing is lost, however slow the machine.
  EXPECT_EQ(host.call("bound 30000"), "");
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
                    std::vector<std::string>{"leave-it-to-a-static", "create 2", "bound 30000", "configure",
                                             "send 1 1000", "exit"},
                    std::vector<std::string>{"send 1 1000", "leave-it-to-a-static", "return"},
                    std::vector<std::string>{"send 1 1000", "leave-it-to-an-inner-static", "return"},
                    std::vector<std::string>{"send 1 1000", "leave-it-to-an-exit-handler", "exit"},
                    std::vector<std::string>{"send 1 1000", "release-in-a-module", "exit"},
                    std::vector<std::string>{"send 1 1000", "exit-in-a-callback"}));

TEST_F(HostProcessEndTest, ExitSendsSingleMessagesToo) {
  daemon->start();
  HostProcess host(*daemon);
  for (const char* command : {"one-shot 1", "one-shot 2", "one-shot 3", "exit"}) host.write(command);
  EXPECT_EQ(host.process().wait(), 0);
  ASSERT_TRUE(server.waitForEvents(3, {7}));
  EXPECT_EQ(arrived(), numbersTo(3));
}

TEST_F(HostProcessEndTest, ExitPassesAModuleThatIsStuck) {
  daemon->start();
  HostProcess host(*daemon);
  host.open();
  // Three quarters of it pass before the events have their turn.
  EXPECT_EQ(host.call("bound 4000"), "");
  EXPECT_EQ(host.call("block-a-module"), "");
  EXPECT_EQ(host.call("send 1 100"), "");
  EXPECT_EQ(host.end("exit"), 0);
  ASSERT_TRUE(server.waitForEvents(100, {7}));
  EXPECT_EQ(arrived(), numbersTo(100));
}

TEST_F(HostProcessEndTest, AModuleMayEndTheProcess) {
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

TEST_F(HostProcessEndTest, ExitWaitsAsLongAsItIsTold) {
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

/// Ways to end while the daemon is being restarted.
class EndDuringRestart : public HostProcessTest, public testing::WithParamInterface<std::vector<std::string>> {};

TEST_P(EndDuringRestart, WaitsForTheDaemon) {
  daemon->start();
  HostProcess host(*daemon, {{}, std::nullopt, "default"});
  host.open();
  EXPECT_EQ(host.call("bound 60000"), "");
  daemon->kill();
  ASSERT_TRUE(host.log().waitForPart("IPC connection interrupted"));
  EXPECT_EQ(host.call("send 1 100"), "");
  const std::size_t before = host.log().count("Failed to connect to daemon");
  for (const auto& command : GetParam()) host.write(command);
  std::size_t attempts = 0;
  ASSERT_TRUE(host.log().waitFor([&](const std::string& line) {
    return line.find("Failed to connect to daemon") != std::string::npos && ++attempts > before + 3;
  })) << "it tries again and again";
  daemon->start();
  EXPECT_EQ(host.process().wait(), 0);
  ASSERT_TRUE(server.waitForEvents(100, {7}));
  EXPECT_EQ(arrived(), numbersTo(100));
  EXPECT_EQ(host.log().count("are lost"), 0U);
}

INSTANTIATE_TEST_SUITE_P(Ways, EndDuringRestart,
                         testing::Values(std::vector<std::string>{"exit"}, std::vector<std::string>{"release", "exit"},
                                         std::vector<std::string>{"leave-it-to-a-static", "return"}));

/// Ways to release a client, which is gone when the process exits.
class EndByRelease : public HostProcessTest, public testing::WithParamInterface<const char*> {};

TEST_P(EndByRelease, WaitsAsLongAsItIsTold) {
  daemon->start();
  HostProcess host(*daemon, {{}, std::nullopt, "default"});
  host.open();
  EXPECT_EQ(host.call("bound 3600000"), "");
  {
    const Standstill standstill(*daemon);
    // More than its socket holds, and less than the connection does.
    EXPECT_EQ(host.call("send 1 10000"), "");
    host.write(GetParam());
    host.write("exit");
    ASSERT_TRUE(host.log().waitForPart("is about to dealloc"));
    EXPECT_FALSE(host.process().wait(std::chrono::seconds(2))) << "twice what a closing connection waits otherwise";
  }
  EXPECT_EQ(host.process().wait(), 0);
  ASSERT_TRUE(server.waitForEvents(10'000, {7}));
  EXPECT_EQ(arrived(), numbersTo(10'000));
  EXPECT_EQ(host.log().count("are lost"), 0U);
}

INSTANTIATE_TEST_SUITE_P(Ways, EndByRelease, testing::Values("release", "release-in-a-module"));

}  // namespace
}  // namespace velk::test
