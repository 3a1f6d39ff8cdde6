// A client object and the daemon that it talks to.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string_view>
#include <thread>
#include <utility>

#include "client/ClientRuntime.h"
#include "client/VelkReporting.h"
#include "platform/Semaphore.h"
#include "tests/support/RecordingLog.h"
#include "tests/unit/client/FakeDaemon.h"

namespace velk::test {

inline constexpr Duration kPatience = std::chrono::seconds(30);
/// More than it takes, for what a turn leaves to the next.
inline constexpr int kTurnsOfAnEnd = 4;

inline PropertyDictionary sessionInfo(int clientType = 9) { return {{"ComponentType", clientType}, {"SessionID", 7}}; }
inline PropertyDictionary userInfo() { return {{"_clientName", "Test"}, {"_serviceName", "unit"}}; }
inline PropertyDictionary message(int category, int type = 1) {
  return {{"ParametersCategory", category}, {"ParametersType", type}};
}

/// Runs something when a line is written, on the thread that writes it.
struct Trigger : log::Sink {
  Trigger(std::string_view text, std::function<void()> action) : line(text), run(std::move(action)) {}
  void write(log::Level, std::string_view written) override {
    if (written == line) run();
  }
  const std::string_view line;
  const std::function<void()> run;
};

class VelkReportingTest : public ::testing::Test {
 protected:
  /// What clients still do that have been released, and what the library says of them, belongs to this test: not to the
  /// next one's daemon and log. A client that ends on a thread for callbacks may take its time; a connection closes in
  /// one turn of the library's thread and tells of it in the next.
  ~VelkReportingTest() override {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (ClientRuntime::shared().hasClients() && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::yield();
    }
    EXPECT_FALSE(ClientRuntime::shared().hasClients()) << "a client outlives its test";
    for (int turn = 0; turn < kTurnsOfAnEnd; ++turn) awaitTurn();
  }

  /// Waits until the library's thread has done all that it had begun or been handed. Where none is to be had, nothing
  /// is under way.
  static void awaitTurn() {
    EventLoop& loop = ClientRuntime::shared().loop();
    if (!loop.start()) return;
    Semaphore over;
    loop.post([&over] { over.signal(); });
    over.wait();
  }

  std::shared_ptr<VelkReporting> makeClient(VelkReportingAggregationBlock block = nullptr) {
    return VelkReporting::initWithSessionInfo(sessionInfo(), userInfo(), {"framework"}, std::move(block));
  }

  /// Configures and waits for the callback; then for the lists, which are cached before the next call is answered.
  std::optional<PropertyArray> configure(VelkReporting& client) {
    auto states = std::make_shared<std::optional<PropertyArray>>();
    auto answered = std::make_shared<Semaphore>();
    client.startConfigurationWithCompletionHandler([states, answered](const std::optional<PropertyArray>& enabled) {
      *states = enabled;
      answered->signal();
    });
    EXPECT_TRUE(answered->waitFor(kPatience));
    flush(client);
    return *states;
  }

  std::optional<Error> flush(VelkReporting& client) {
    auto result = std::make_shared<std::optional<Error>>();
    auto answered = std::make_shared<Semaphore>();
    client.flushMessagesWithCompletion([result, answered](const std::optional<Error>& error) {
      *result = error;
      answered->signal();
    });
    EXPECT_TRUE(answered->waitFor(kPatience));
    return *result;
  }

  RecordingLog _log;
  FakeDaemon _daemon;
};

}  // namespace velk::test
