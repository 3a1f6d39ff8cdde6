// A connectivity helper among fakes.
#pragma once

#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <vector>

#include "connectivity/LogTexts.h"
#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "tests/support/FakeHttpSession.h"
#include "tests/support/FakePlatform.h"
#include "tests/support/RecordingLog.h"

namespace velk {

namespace texts = connectivity_texts;

/// Stands for the agent.
class FakeOwner : public ConnectivityHelperDelegate {
 public:
  void releaseIPCTransactions(std::uint32_t count) override {
    // The lock is held by the caller already.
    Guard guard(_monitor);
    released.push_back(count);
    if (onRelease) onRelease();
  }
  [[nodiscard]] Monitor& monitor() override { return _monitor; }

  std::vector<std::uint32_t> released;
  std::function<void()> onRelease;

 private:
  Monitor _monitor;
};

/// What became of one completion.
struct Answer {
  int calls = 0;
  int abandoned = 0;
  ByteData data;
  std::shared_ptr<const HttpResponse> response;
  std::optional<Error> error;

  [[nodiscard]] HttpCompletion completion() {
    return HttpCompletion(
        [this](ByteData received, std::shared_ptr<const HttpResponse> answer, std::optional<Error> failure) {
          ++calls;
          data = std::move(received);
          response = std::move(answer);
          error = std::move(failure);
        },
        [this] { ++abandoned; });
  }
  [[nodiscard]] std::string text() const { return {data.begin(), data.end()}; }
};

class ConnectivityHelperTest : public testing::Test {
 protected:
  using Helper = ReportingSessionConnectivityHelper;

  ConnectivityHelperTest() { fakes.setHttpSessionService(&http); }
  ~ConnectivityHelperTest() override {
    for (const auto& weak : _made) {
      if (const auto helper = weak.lock()) helper->invalidate();
    }
    scheduler().runUntilIdle();
  }

  [[nodiscard]] std::shared_ptr<Helper> make(std::int32_t mode) {
    auto helper =
        Helper::initWithDelegate(fakes.platform(), owner, mode, {{"_clientName", "Media"}, {"_serviceName", "Calls"}});
    _made.push_back(helper);
    return helper;
  }
  [[nodiscard]] std::shared_ptr<Helper> makeActive(std::int32_t mode, std::uint32_t releaseTimeout = 30) {
    auto helper = make(mode);
    helper->activate(releaseTimeout);
    scheduler().runUntilIdle();
    return helper;
  }

  [[nodiscard]] test::ManualScheduler& scheduler() { return fakes.scheduler; }
  [[nodiscard]] std::string identifier() const { return http.lastSession()->sessionDescription(); }
  [[nodiscard]] std::shared_ptr<test::FakeHttpTask> lastTask() const { return http.startedTasks().back(); }

  [[nodiscard]] static HttpRequest request(std::string url = "https://example.net/bag") {
    HttpRequest request;
    request.url = std::move(url);
    return request;
  }
  /// A line that was logged at the default level.
  [[nodiscard]] int logged(std::string_view format, std::initializer_list<FormatArgument> arguments) const {
    return log.count(log::Level::standard, formatText(format, arguments));
  }
  [[nodiscard]] int loggedError(std::string_view format, std::initializer_list<FormatArgument> arguments) const {
    return log.count(log::Level::error, formatText(format, arguments));
  }
  [[nodiscard]] Helper::ReleaseBlock recordCount() {
    return [this](std::uint32_t count) { counts.push_back(count); };
  }

  test::RecordingLog log;
  test::FakePlatform fakes;
  test::FakeHttpSessionService http;
  std::shared_ptr<FakeOwner> owner = std::make_shared<FakeOwner>();
  std::shared_ptr<Queue> ownerQueue = fakes.scheduler.makeSerialQueue("owner");
  std::vector<std::uint32_t> counts;

 private:
  std::vector<std::weak_ptr<Helper>> _made;
};

}  // namespace velk
