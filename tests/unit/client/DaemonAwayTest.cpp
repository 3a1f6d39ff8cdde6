// What is asked of a daemon that is not there: a line in the log for each call, an answer where one is due, and no
// upload.
#include <atomic>
#include <functional>
#include <ostream>

#include "client/LogTexts.h"
#include "platform/Files.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

PropertyArray logData() { return PropertyArray{PropertyDictionary{{"a", 1}}}; }

/// A call and what it is called in the line that tells of its failure.
struct AskedInVain {
  const char* name;
  const char* operation;
  std::function<void(VelkReporting& client)> call;
};

void PrintTo(const AskedInVain& asked, std::ostream* stream) { *stream << asked.name; }

class DaemonAwayTest : public VelkReportingTest {
 protected:
  /// Behind everything that the client was asked before it.
  void awaitTurn(VelkReporting& client) {
    auto done = std::make_shared<Semaphore>();
    client.startConfigurationWithCompletionHandler([done](const auto&) { done->signal(); });
    EXPECT_TRUE(done->waitFor(kPatience));
  }
  /// The lines about calls that found no daemon, but for those of `awaitTurn`.
  [[nodiscard]] std::vector<std::string> linesOfFailure() const {
    std::vector<std::string> found;
    for (const auto& line : _log.lines()) {
      const bool isOurs = line.text.ends_with(": Failed to get remote object proxy: no daemon answers");
      const bool isOfTheTurn = line.text.starts_with("startConfigurationWithCompletionHandler: ");
      if (!isOurs || isOfTheTurn) continue;
      EXPECT_EQ(line.level, log::Level::standard) << line.text;
      found.push_back(line.text);
    }
    return found;
  }
};

class DaemonAwayLine : public DaemonAwayTest, public ::testing::WithParamInterface<AskedInVain> {};

TEST_P(DaemonAwayLine, IsWrittenOnceForACall) {
  const auto client = makeClient();
  GetParam().call(*client);
  awaitTurn(*client);
  const std::string line = std::string(GetParam().operation) + ": Failed to get remote object proxy: no daemon answers";
  EXPECT_EQ(linesOfFailure(), std::vector<std::string>{line});
  GetParam().call(*client);
  awaitTurn(*client);
  EXPECT_EQ(linesOfFailure(), (std::vector<std::string>{line, line})) << "and again for another one";
}

INSTANTIATE_TEST_SUITE_P(
    Of, DaemonAwayLine,
    ::testing::Values(
        AskedInVain{"fetchReportingStates", "fetchReportingStatesWithUserInfo",
                    [](VelkReporting& client) { client.fetchReportingStatesWithUserInfo(userInfo(), nullptr); }},
        AskedInVain{"flush", "flushMessagesWithCompletion", [](VelkReporting& client) { client.flushMessages(); }},
        AskedInVain{"flushWithCompletion", "flushMessagesWithCompletion",
                    [](VelkReporting& client) { client.flushMessagesWithCompletion([](const auto&) {}); }},
        AskedInVain{"updateSharedDataWithDictionary", "updateSharedDataWithDictionary",
                    [](VelkReporting& client) {
                      client.updateSharedDataWithDictionary({{"a", 1}});
                    }},
        AskedInVain{"updateSharedDataForKey", "updateSharedDataForKey",
                    [](VelkReporting& client) { client.updateSharedDataForKey("a", PropertyValue(1)); }},
        AskedInVain{"removalOfSharedDataForKey", "updateSharedDataForKey",
                    [](VelkReporting& client) { client.updateSharedDataForKey("a", std::nullopt); }},
        AskedInVain{"uploadFile", "uploadFileWithURL",
                    [](VelkReporting& client) { EXPECT_TRUE(client.uploadFileWithURL("/proc/self/status", nullptr)); }},
        AskedInVain{"uploadLogData", "uploadDataArray",
                    [](VelkReporting& client) { EXPECT_TRUE(client.uploadDataArray(logData(), nullptr)); }}),
    [](const auto& info) { return std::string(info.param.name); });

TEST_F(DaemonAwayTest, StatesAreAnsweredOnceWithNothing) {
  const auto client = makeClient();
  auto answers = std::make_shared<std::atomic<int>>(0);
  auto answered = std::make_shared<Semaphore>();
  client->fetchReportingStatesWithUserInfo(userInfo(), [answers, answered](const auto& enabled) {
    EXPECT_FALSE(enabled);
    ++*answers;
    answered->signal();
  });
  ASSERT_TRUE(answered->waitFor(kPatience));
  _daemon.start();
  client->sendMessageWithCategory(1, 1);
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 1));
  EXPECT_FALSE(flush(*client));
  EXPECT_EQ(answers->load(), 1);
  EXPECT_EQ(_daemon.count("fetchStatesWithUserInfo"), 0U);
}

TEST_F(DaemonAwayTest, FlushIsAnsweredWithTheConnectionsError) {
  const auto client = makeClient();
  EXPECT_EQ(flush(*client), (Error{"VelkConnectionErrorDomain", 9, "no daemon answers"}));
}

/// What an upload's callback owns: once that has ended, the callback can be called no more.
class DaemonAwayUpload : public DaemonAwayTest {
 protected:
  /// Remembers calls, and tells when it ended.
  [[nodiscard]] VelkReporting::UploadCallback callback() {
    const std::shared_ptr<void> captured(nullptr, [ended = _ended](void*) { ended->signal(); });
    return [captured, calls = _calls](bool, const std::optional<Error>&) { ++*calls; };
  }
  void expectEndWithoutACall() {
    EXPECT_TRUE(_ended->waitFor(kPatience));
    EXPECT_EQ(_calls->load(), 0);
  }
  /// A daemon that comes later is not told of it either.
  void expectNothingOf(const std::string& method, VelkReporting& client) {
    _daemon.start();
    _daemon.setDeliversUploads(true);
    client.sendMessageWithCategory(1, 1);
    ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 1));
    EXPECT_FALSE(flush(client));
    EXPECT_EQ(_daemon.count(method), 0U);
  }

  const std::shared_ptr<std::atomic<int>> _calls = std::make_shared<std::atomic<int>>(0);
  const std::shared_ptr<Semaphore> _ended = std::make_shared<Semaphore>();
  const TemporaryDirectory _directory;
};

TEST_F(DaemonAwayUpload, OfAFileIsNotAnsweredAndTheFileStays) {
  const auto client = makeClient();
  const auto path = _directory.write("log", "text");
  EXPECT_TRUE(client->uploadFileWithURL("file://" + path, callback()));
  expectEndWithoutACall();
  expectNothingOf("uploadFileAtPath", *client);
  EXPECT_EQ(_calls->load(), 0);
  EXPECT_EQ(_directory.read("log"), "text");
}

TEST_F(DaemonAwayUpload, OfLogDataIsNotAnswered) {
  const auto client = makeClient();
  EXPECT_TRUE(client->uploadDataArray(logData(), callback()));
  expectEndWithoutACall();
  expectNothingOf("uploadLogData", *client);
  EXPECT_EQ(_calls->load(), 0);
}

TEST_F(DaemonAwayUpload, LetsGoOfItsFile) {
  const auto client = makeClient();
  const auto path = _directory.write("log", "text");
  // More than one client may hold at once.
  for (int upload = 0; upload < 65; ++upload) {
    ASSERT_TRUE(client->uploadFileWithURL(path, callback())) << upload;
    expectEndWithoutACall();
    awaitTurn(*client);
  }
  EXPECT_TRUE(files::exists(path));
}

}  // namespace
}  // namespace velk::test
