#include "backends/QuillBackend.h"

#include <functional>

#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {
namespace {

struct Forwarded {
  std::uint16_t method;
  std::uint16_t respCode;
  std::optional<std::string> dict;
  bool operator==(const Forwarded&) const = default;
};

/// A bundle whose adaptor notes what it is handed.
class FakeBundle : public AdaptorBundle {
 public:
  Result<std::shared_ptr<QuillAdaptorClass>> load() override {
    ++loads;
    if (loadError) return Failure(*loadError);
    if (!hasAdaptor) return nullptr;
    return std::make_shared<Class>(*this);
  }
  bool stop(Duration) override { return true; }

  int loads = 0;
  int made = 0;
  int released = 0;
  bool hasAdaptor = true;
  bool responds = true;
  std::optional<Error> loadError;
  std::optional<Error> makeError;
  std::optional<Error> sendError;
  std::vector<Forwarded> forwarded;

 private:
  class Instance : public QuillAdaptor {
   public:
    explicit Instance(FakeBundle& bundle) : _bundle(bundle) {}
    const std::string& description() const override { return _description; }
    bool respondsToSendMessage() const override { return _bundle.responds; }
    Result<void> sendMessageWithMethod(std::uint16_t method, std::uint16_t respCode,
                                       const std::optional<std::string>& dict) override {
      if (_bundle.sendError) return Failure(*_bundle.sendError);
      _bundle.forwarded.push_back({method, respCode, dict});
      return {};
    }
    void release() override { ++_bundle.released; }

   private:
    FakeBundle& _bundle;
    const std::string _description = "<QuillAdaptor fake>";
  };

  class Class : public QuillAdaptorClass {
   public:
    explicit Class(FakeBundle& bundle) : _bundle(bundle) {}
    Result<std::unique_ptr<QuillAdaptor>> makeInstance() override {
      if (_bundle.makeError) return Failure(*_bundle.makeError);
      ++_bundle.made;
      return std::make_unique<Instance>(_bundle);
    }

   private:
    FakeBundle& _bundle;
  };
};

class QuillBackendTest : public BackendTest {
 protected:
  QuillBackendTest() { platform.adaptorBundle = &bundle; }

  std::shared_ptr<VelkReportingBackend> makeFor(std::int32_t clientType) {
    return newBackendWithName(context, "quill", PropertyDictionary{{"active", true}}, "Lamp", clientType);
  }

  FakeBundle bundle;
};

TEST_F(QuillBackendTest, IsMadeForThreeClientTypes) {
  for (const int allowed : {7, 11, 13}) {
    log.clear();
    EXPECT_TRUE(makeFor(allowed)) << allowed;
    EXPECT_EQ(log.lines(), (std::vector<RecordingLog::Line>{
                               {log::Level::standard, formatText(backend_texts::kLoadingQuillAdaptor, {allowed})}}));
  }
  EXPECT_EQ(bundle.made, 3) << "an instance each";
}

TEST_F(QuillBackendTest, IsRefusedToAllOthers) {
  for (const int refused : {6, 8, 9, 10, 12, 14, 0, -1, -25, 39, 7 + 32, 1 << 30}) {
    log.clear();
    EXPECT_FALSE(makeFor(refused)) << refused;
    EXPECT_EQ(log.lines(),
              (std::vector<RecordingLog::Line>{
                  {log::Level::standard,
                   formatText("QuillBackend(initWithName): Loading Quill adaptor class for client type %d", {refused})},
                  {log::Level::error,
                   formatText("QuillBackend(initWithName): No matching bundle found for client type %d", {refused})}}));
  }
  EXPECT_EQ(bundle.loads, 0) << "foreign code is not loaded for them";
}

TEST_F(QuillBackendTest, IsRefusedWithoutClientType) {
  EXPECT_FALSE(QuillBackend::initWithName(context, "quill", PropertyDictionary{}, "Lamp"));
  EXPECT_EQ(log.count(log::Level::error, "QuillBackend(initWithName): No matching bundle found for client type 0"), 1);
}

TEST_F(QuillBackendTest, IsKeptOffOneFamilyOfDevices) {
  fakes.device.set("ProductType", "Hollin");
  EXPECT_FALSE(makeFor(7));
  EXPECT_EQ(log.lines(),
            (std::vector<RecordingLog::Line>{{log::Level::error, "VelkReportingBackend(newBackendWithName): quill"}}));
  fakes.device.set("ProductType", "Hollin2");
  EXPECT_TRUE(makeFor(7));
}

TEST_F(QuillBackendTest, ForwardsMethodResponseCodeAndMessage) {
  const auto backend = makeFor(7);
  const PropertyDictionary message{{"SharedData", PropertyDictionary{{"room", 4}}},
                                   {"ClientData", PropertyDictionary{{"loss", 0.5}, {"when", Date{12}}}}};
  EXPECT_EQ(backend->sendMessage(message, kStart, 70, 3, 1), std::nullopt);
  EXPECT_EQ(backend->sendMessage(std::nullopt, kStart, 65'535, 65'535, 0), std::nullopt);
  EXPECT_EQ(backend->sendMessage(PropertyDictionary{}, kStart, 0, 0, 0), std::nullopt);
  EXPECT_EQ(
      bundle.forwarded,
      (std::vector<Forwarded>{{70, 3, R"({"SharedData":{"room":4},"ClientData":{"loss":0.5,"when":{"$date":12.0}}})"},
                              {65'535, 65'535, std::nullopt},
                              {0, 0, "{}"}}));
}

TEST_F(QuillBackendTest, IsEnabledAndAnswersNothingElse) {
  const auto backend = makeFor(11);
  EXPECT_EQ(backend->updateState(), kBackendEnabled);
  EXPECT_FALSE(backend->isHTTPSPostBackend());
  EXPECT_EQ(backend->batchedEventsSize(), 0U);
  EXPECT_FALSE(backend->uploadLogData({}));
}

TEST_F(QuillBackendTest, WithoutAdaptorEveryEventIsAnErrorLine) {
  bundle.hasAdaptor = false;
  const auto backend = makeFor(7);
  ASSERT_TRUE(backend);
  log.clear();
  for (int sent = 0; sent < 3; ++sent) EXPECT_EQ(send(*backend, {{"a", 1}}), std::nullopt);
  EXPECT_EQ(log.lines().size(), 3U);
  EXPECT_EQ(log.count(log::Level::error,
                      "QuillBackend(sendMessage): Quill adaptor (null) does not respond to forwarding selector "
                      "sendMessageWithMethod:respCode:dict:"),
            3);
}

TEST_F(QuillBackendTest, OnAPlatformWithoutBundlesEveryEventIsAnErrorLine) {
  platform.adaptorBundle = nullptr;
  const auto backend = makeFor(7);
  ASSERT_TRUE(backend);
  send(*backend, {{"a", 1}});
  EXPECT_TRUE(log.contains("Quill adaptor (null) does not respond"));
}

TEST_F(QuillBackendTest, AnAdaptorThatTakesNoEventsIsNamed) {
  bundle.responds = false;
  const auto backend = makeFor(7);
  send(*backend, {{"a", 1}});
  EXPECT_EQ(log.count(log::Level::error,
                      "QuillBackend(sendMessage): Quill adaptor <QuillAdaptor fake> does not respond to forwarding "
                      "selector sendMessageWithMethod:respCode:dict:"),
            1);
  EXPECT_TRUE(bundle.forwarded.empty());
}

TEST_F(QuillBackendTest, SaysWhyThereIsNoAdaptorAndTriesAgainNextTime) {
  bundle.loadError = Error{"AdaptorBundle", 1, "/x/quill.so: not there"};
  const auto backend = makeFor(7);
  ASSERT_TRUE(backend);
  EXPECT_EQ(log.count(log::Level::error, "QuillBackend(initWithName): no Quill adaptor: /x/quill.so: not there"), 1);
  send(*backend, {{"a", 1}});
  EXPECT_TRUE(log.contains("Quill adaptor (null) does not respond"));
  bundle.loadError.reset();
  send(*makeFor(7), {{"a", 1}});
  EXPECT_EQ(bundle.forwarded.size(), 1U);
}

TEST_F(QuillBackendTest, AnAdaptorThatMakesNoInstanceIsAbsent) {
  bundle.makeError = Error{"AdaptorBundle", 1, "status 9"};
  const auto backend = makeFor(7);
  ASSERT_TRUE(backend);
  EXPECT_EQ(log.count(log::Level::error, "QuillBackend(initWithName): no Quill adaptor: status 9"), 1);
  send(*backend, {{"a", 1}});
  EXPECT_TRUE(log.contains("Quill adaptor (null) does not respond"));
}

TEST_F(QuillBackendTest, AnEventThatTheAdaptorRefusesIsLostAlone) {
  const auto backend = makeFor(7);
  bundle.sendError = Error{"AdaptorBundle", 1, "status 7"};
  send(*backend, {{"a", 1}});
  EXPECT_EQ(log.count(log::Level::error, "QuillBackend(sendMessage): an event is lost: status 7"), 1);
  bundle.sendError.reset();
  send(*backend, {{"a", 2}});
  EXPECT_EQ(bundle.forwarded.size(), 1U);
}

TEST_F(QuillBackendTest, GivesTheAdaptorBackOnAQueueAndNotWhereTheLastReferenceGoes) {
  auto backend = makeFor(13);
  backend.reset();
  EXPECT_EQ(bundle.released, 0);
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(bundle.released, 1);
}

}  // namespace
}  // namespace velk::test
