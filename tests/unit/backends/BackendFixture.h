// What the tests of this folder have in common: a faked platform, a fake transport, and an HTTPS post backend between.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "backends/HTTPSPostBackend.h"
#include "backends/LogTexts.h"
#include "device/DeviceEnvironment.h"
#include "foundation/Format.h"
#include "tests/support/FakePlatform.h"
#include "tests/support/FakeTransport.h"
#include "tests/support/RecordingLog.h"

namespace velk::test {

/// The wall clock of the fake platform when a test begins.
inline constexpr std::int64_t kNow = 1'600'000'000;  // 2020-09-13 12:26:40 UTC
inline constexpr TimeValue kStart{kNow, 250'000};

/// What inflates a gzip or zlib stream; nothing when it is damaged.
[[nodiscard]] std::optional<std::string> inflated(std::string_view bytes);
/// The JSON of a post, decompressed if need be.
[[nodiscard]] std::string jsonOf(const HttpRequest& request);
[[nodiscard]] PropertyDictionary bodyOf(const HttpRequest& request);
[[nodiscard]] std::vector<PropertyDictionary> eventsOf(const HttpRequest& request);
[[nodiscard]] std::optional<std::string> headerOf(const HttpRequest& request, std::string_view name);

/// The dictionary with one entry more.
[[nodiscard]] inline PropertyDictionary with(PropertyDictionary entry, std::string_view key, PropertyValue value) {
  entry.set(key, std::move(value));
  return entry;
}

/// What became of a flush. An answer that comes after its end is of no interest.
struct FlushOutcome {
  int calls = 0;
  bool abandoned = false;
  std::optional<std::string> text;
  std::optional<Error> error;

  [[nodiscard]] BackendFlushCompletion completion() {
    const std::weak_ptr<FlushOutcome*> weak = _self;
    return BackendFlushCompletion(
        [weak](std::optional<std::string> given, std::optional<Error> failed) {
          const auto self = weak.lock();
          if (!self) return;
          ++(*self)->calls;
          (*self)->text = std::move(given);
          (*self)->error = std::move(failed);
        },
        [weak] {
          if (const auto self = weak.lock()) (*self)->abandoned = true;
        });
  }

  FlushOutcome() = default;
  FlushOutcome(const FlushOutcome&) = delete;
  FlushOutcome& operator=(const FlushOutcome&) = delete;

 private:
  std::shared_ptr<FlushOutcome*> _self = std::make_shared<FlushOutcome*>(this);
};

class BackendTest : public ::testing::Test {
 protected:
  BackendTest();
  ~BackendTest() override;

  /// A client entry that enables everybody everywhere.
  [[nodiscard]] static PropertyDictionary openEntry();
  [[nodiscard]] static PropertyDictionary profileWith(PropertyArray clients);
  [[nodiscard]] static PropertyDictionary userInfo(const char* client = "Media", const char* service = "Calls");

  [[nodiscard]] std::shared_ptr<VelkReportingBackend> make(const std::string& name, const PropertyValue& profile);
  /// A post backend with all its properties set, not yet configured.
  [[nodiscard]] std::shared_ptr<HTTPSPostBackend> makePost(const PropertyDictionary& entry);
  [[nodiscard]] std::shared_ptr<HTTPSPostBackend> makePostWith(PropertyArray clients);
  /// The same, configured and in the state that the entry gives.
  [[nodiscard]] std::shared_ptr<HTTPSPostBackend> makeConfigured(const PropertyDictionary& entry);
  /// Configured, enabled and batching.
  [[nodiscard]] std::shared_ptr<HTTPSPostBackend> makeBatching(const PropertyDictionary& entry);

  /// Sends `payload` as a session does.
  std::optional<std::string> send(VelkReportingBackend& backend, const PropertyDictionary& payload,
                                  std::uint16_t method = 7, std::uint16_t type = 3, std::uint32_t flag = 0);
  void sendMany(VelkReportingBackend& backend, int count, std::uint16_t method = 7);
  [[nodiscard]] HttpRequest lastRequest() const { return transport->request(transport->count() - 1); }
  [[nodiscard]] PropertyDictionary onlyEvent() const;

  RecordingLog log;
  FakePlatform fakes;
  std::shared_ptr<FakeTransport> transport = std::make_shared<FakeTransport>();
  Platform platform = fakes.platform();
  DeviceEnvironment environment{fakes.defaults, fakes.device};
  BackendContext context{platform, environment};
  bool isInternal = false;
};

}  // namespace velk::test
