// A process that links the library, driven from outside, and what its tests have in common.
#pragma once

#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <map>
#include <memory>
#include <numeric>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include "tests/integration/Scenario.h"

namespace velk::test {

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

}  // namespace velk::test
