// A storebag service over fakes: real queues (a synchronous fetch blocks its thread), a clock that the test moves,
// files in memory and a network in memory.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "daemon/LogTexts.h"
#include "daemon/StorebagService.h"
#include "device/DeviceEnvironment.h"
#include "foundation/Format.h"
#include "platform/ThreadPool.h"
#include "tests/support/FakeHttpSession.h"
#include "tests/support/FakePlatform.h"
#include "tests/support/RecordingLog.h"
#include "tests/unit/daemon/StorebagFakes.h"

namespace velk::test {

class StorebagFixture : public ::testing::Test {
 protected:
  StorebagFixture() { fakes.setHttpSessionService(&http); }
  ~StorebagFixture() override {
    service->startAfresh();
    pool->stop();
  }

  [[nodiscard]] Platform platform() {
    const Platform fake = fakes.platform();
    return Platform{fake.clock,  *pool,          fake.defaults, fake.device,  fake.locale,       fake.http,
                    fake.random, fake.keepAlive, fake.consent,  fake.process, fake.logSubmission};
  }

  /// The server answers every request so.
  void serve(FakeAnswer answer) {
    http.setResponder([answer](const HttpRequest&) { return std::optional(answer); });
  }
  void serveBag(const PropertyValue& bag, std::vector<std::pair<std::string, std::string>> headers = {}) {
    serve({200, textOf(key.envelope(bag)), std::move(headers), std::nullopt});
  }
  void serveStatus(int status) { serve({status, "", {}, std::nullopt}); }
  void serveNothing() { serve({0, "", {}, Error{"HttpErrorDomain", 7, "could not connect"}}); }

  [[nodiscard]] std::size_t requestCount() { return http.startedTasks().size(); }
  [[nodiscard]] HttpRequest request(std::size_t number) { return http.waitForTask(number)->request(); }
  /// Waits until that many pulls have been answered, and what came with them has been dealt with.
  [[nodiscard]] bool waitForPulls(int count) { return log.waitFor("has been completed with error", count); }
  void setEnvironment(std::uint32_t type) { fakes.defaults.put("environmentType", type); }
  void advanceSeconds(double seconds) {
    fakes.clock().advance(std::chrono::duration_cast<Duration>(std::chrono::duration<double>(seconds)));
  }
  void putOnDisk(const std::string& name, const PropertyValue& bag, std::int32_t maxAge) {
    files.put(name, key.envelope(bag));
    fakes.defaults.put("CACHED_" + name + "_max-age", maxAge);
  }

  [[nodiscard]] std::optional<PropertyValue> pullDue(const std::string& name) const {
    return fakes.defaults.value("CACHED_" + name + "_pull-due");
  }
  void setPullDue(const std::string& name, std::int64_t secondsFromNow) {
    fakes.defaults.put("CACHED_" + name + "_pull-due", fakes.clock().wallTime().seconds + secondsFromNow);
  }
  /// The delays of the pulls that were asked for, as the log tells them.
  [[nodiscard]] int pullsDelayedBy(int seconds) const {
    const auto delay = formatText("' delayed by %d seconds has been initiated", {seconds});
    int count = 0;
    for (const auto& line : log.lines()) count += line.text.find(delay) != std::string::npos ? 1 : 0;
    return count;
  }

  template <class... Arguments>
  [[nodiscard]] int logged(std::string_view format, const Arguments&... arguments) {
    return log.count(formatText(format, {FormatArgument(arguments)...}));
  }
  template <class... Arguments>
  [[nodiscard]] int loggedAsError(std::string_view format, const Arguments&... arguments) {
    return log.count(log::Level::error, formatText(format, {FormatArgument(arguments)...}));
  }

  /// A storebag whose section of each environment tells its name.
  [[nodiscard]] static PropertyDictionary bagWithSections(std::string version = "1") {
    PropertyDictionary bag{{"version", std::move(version)}};
    for (const auto name : {"development", "tavrin_internal", "seed", "release"}) {
      bag.set(name, PropertyDictionary{{"splunk", PropertyDictionary{{"section", name}}}});
    }
    return bag;
  }
  [[nodiscard]] static std::string sectionName(const std::optional<PropertyDictionary>& section) {
    const auto* splunk = section ? section->dictionary("splunk") : nullptr;
    const auto* name = splunk != nullptr ? splunk->string("section") : nullptr;
    return name != nullptr ? *name : "none";
  }

  RecordingLog log;
  FakeHttpSessionService http;
  FakePlatform fakes;
  const std::unique_ptr<ThreadPool> pool = makeThreadPool();
  const SigningKey& key = SigningKey::shared();
  MemoryStorebagFiles files{fakes.clock()};
  DeviceEnvironment environment{fakes.defaults, fakes.device};
  const std::shared_ptr<StorebagService> service =
      StorebagService::make(platform(), environment, files.cache(), key.source());
};

inline constexpr std::int32_t kBramble = 5;
inline constexpr std::int32_t kConference = 7;

}  // namespace velk::test
