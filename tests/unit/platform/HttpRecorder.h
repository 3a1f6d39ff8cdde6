// A delegate that remembers what a session said, and a queue that the test's thread works off.
#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <deque>
#include <functional>
#include <map>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/HttpSession.h"
#include "platform/Lock.h"
#include "tests/support/RecordingLog.h"

namespace velk {

/// A queue that the test's thread works off while it waits for something.
class PumpedQueue : public Queue {
 public:
  [[nodiscard]] std::string_view label() const override { return "test"; }
  void async(Task task) override {
    {
      Guard guard(_lock);
      _tasks.push_back(std::move(task));
    }
    _handedOver.notifyAll();
  }
  void asyncAfter(Duration, Task) override {}
  [[nodiscard]] bool isCurrent() const override { return true; }

  bool runUntil(const std::function<bool()>& done, Duration limit = std::chrono::seconds(20)) {
    const auto deadline = std::chrono::steady_clock::now() + limit;
    while (!done()) {
      Task task;
      {
        Guard guard(_lock);
        while (_tasks.empty()) {
          if (!_handedOver.waitUntil(_lock, deadline)) return false;
        }
        task = std::move(_tasks.front());
        _tasks.pop_front();
      }
      task();
    }
    return true;
  }
  void runPending() {
    (void)runUntil([this] {
      Guard guard(_lock);
      return _tasks.empty();
    });
  }
  [[nodiscard]] std::size_t pending() {
    Guard guard(_lock);
    return _tasks.size();
  }

 protected:
  void runSync(void (*work)(void*), void* context) override { work(context); }

 private:
  Lock _lock;
  Condition _handedOver;
  std::deque<Task> _tasks VELK_GUARDED_BY(_lock);
};

/// How many lines of the log hold `part`.
[[nodiscard]] inline auto linesWith(const test::RecordingLog& log, std::string_view part) {
  const auto lines = log.lines();
  return std::count_if(lines.begin(), lines.end(),
                       [&](const auto& line) { return line.text.find(part) != std::string::npos; });
}

/// What a session said, in order.
struct Recorder : HttpSessionDelegate {
  struct Outcome {
    std::optional<Error> error;
    std::shared_ptr<const HttpResponse> response;
    std::string body;
    int completions = 0;
  };

  void didReceiveResponse(HttpSession&, HttpTask& task) override {
    note(task, "response");
    EXPECT_NE(task.response(), nullptr);
  }
  void didReceiveData(HttpSession&, HttpTask& task, std::span<const std::uint8_t> data) override {
    if (events.empty() || events.back() != task.taskDescription() + " data") note(task, "data");
    outcomes[task.taskDescription()].body.append(data.begin(), data.end());
    largestData = std::max(largestData, data.size());
  }
  void didSendBodyData(HttpSession&, HttpTask&, std::int64_t count, std::int64_t expected) override {
    sent = count;
    toSend = expected;
  }
  void didBecomeDownloadTask(HttpSession&, HttpTask&) override { FAIL(); }
  void taskIsWaitingForConnectivity(HttpSession&, HttpTask& task) override {
    note(task, "waits");
    ++waiting;
  }
  void didCompleteWithError(HttpSession&, HttpTask& task, const std::optional<Error>& error) override {
    note(task, "completed");
    auto& outcome = outcomes[task.taskDescription()];
    outcome.error = error;
    outcome.response = task.response();
    ++outcome.completions;
    ++completed;
    EXPECT_EQ(std::this_thread::get_id(), thread);
  }
  void didBecomeInvalidWithError(HttpSession&, const std::optional<Error>& error) override {
    events.emplace_back("invalid");
    EXPECT_FALSE(error);
    invalid = true;
  }
  void note(HttpTask& task, const char* what) { events.push_back(task.taskDescription() + " " + what); }

  std::vector<std::string> events;
  std::map<std::string, Outcome> outcomes;
  int completed = 0;
  int waiting = 0;
  bool invalid = false;
  std::int64_t sent = 0;
  std::int64_t toSend = 0;
  std::size_t largestData = 0;
  std::thread::id thread = std::this_thread::get_id();
};

}  // namespace velk
