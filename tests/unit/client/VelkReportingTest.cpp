#include "client/VelkReporting.h"

#include <atomic>
#include <filesystem>
#include <stdexcept>

#include "client/LogTexts.h"
#include "platform/Files.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

TEST_F(VelkReportingTest, TakesClientTypesFiveToThirty) {
  const auto isTaken = [](int type) {
    return VelkReporting::initWithSessionInfo(sessionInfo(type), {}, {}) != nullptr;
  };
  EXPECT_FALSE(isTaken(4));
  EXPECT_TRUE(isTaken(5));
  EXPECT_TRUE(isTaken(30));
  EXPECT_FALSE(isTaken(31));
  EXPECT_EQ(_log.count(texts::kClientTypeIsInvalid), 2);
}

TEST_F(VelkReportingTest, NeedsASessionInfo) {
  EXPECT_EQ(VelkReporting::initWithSessionInfo(std::nullopt, {}, {}), nullptr);
  EXPECT_EQ(_log.count(texts::kSessionInfoIsNil), 1);
}

TEST_F(VelkReportingTest, EnableFlagOfZeroDisablesTheSession) {
  PropertyDictionary info = sessionInfo();
  info.set("EnableFlag", 0);
  EXPECT_EQ(VelkReporting::initWithSessionInfo(info, {}, {}), nullptr);
  EXPECT_EQ(_log.count(texts::kSessionDisabled), 1);
  info.set("EnableFlag", 1);
  EXPECT_NE(VelkReporting::initWithSessionInfo(info, {}, {}), nullptr);
}

TEST_F(VelkReportingTest, DescribesItselfBeforeAnythingElse) {
  _daemon.start();
  const auto client = makeClient();
  EXPECT_EQ(configure(*client), (PropertyArray{"splunk"}));
  const auto calls = _daemon.calls();
  ASSERT_GE(calls.size(), 3U);
  EXPECT_EQ(calls[0].method, "setSessionInfo");
  EXPECT_EQ(calls[0].arguments, (PropertyArray{sessionInfo(), userInfo(), PropertyArray{"framework"}, false}));
  EXPECT_EQ(calls[1].method, "startConfigWithCompletionHandler");
  EXPECT_EQ(calls[2].method, "fetchDisplayURL");
}

TEST_F(VelkReportingTest, EverythingPassesBeforeTheFirstAnswer) {
  const auto client = makeClient();
  EXPECT_TRUE(client->isWhitelistedEvent(1));
  EXPECT_FALSE(client->isBlacklistedEvent(1));
}

TEST_F(VelkReportingTest, SendsOnlyWhatBothListsLetPass) {
  _daemon.start();
  _daemon.setConfiguration(PropertyArray{"splunk"}, PropertyArray{3, 4}, PropertyArray{4});
  const auto client = makeClient();
  static_cast<void>(configure(*client));
  EXPECT_EQ(_log.count("Cached 1 enabled backends, ([3,4], [4]) listed events"), 1);
  EXPECT_TRUE(client->sendMessageWithDictionary(message(3)));
  EXPECT_FALSE(client->sendMessageWithDictionary(message(5)));
  EXPECT_FALSE(client->sendMessageWithDictionary(message(4))) << "it is on both lists";
  EXPECT_EQ(_log.count("Event 5 is filtered by storebag"), 1);
  flush(*client);
  EXPECT_EQ(_daemon.count("sendMessageWithDictionary"), 1U);
}

TEST_F(VelkReportingTest, EmptyListsLetEverythingPass) {
  _daemon.start();
  _daemon.setConfiguration(PropertyArray{"splunk"}, PropertyArray{}, PropertyArray{});
  const auto client = makeClient();
  static_cast<void>(configure(*client));
  EXPECT_TRUE(client->sendMessageWithDictionary(message(5)));
}

TEST_F(VelkReportingTest, CategoryFormAnswersTrueForAFilteredEvent) {
  _daemon.start();
  _daemon.setConfiguration(PropertyArray{}, PropertyArray{3}, std::nullopt);
  const auto client = makeClient();
  static_cast<void>(configure(*client));
  Error error;
  EXPECT_TRUE(client->sendMessageWithCategory(9, 1, std::nullopt, &error));
  EXPECT_EQ(error, Error());
  EXPECT_FALSE(client->sendMessageWithDictionary(message(9), &error));
  EXPECT_EQ(error, Error());
}

TEST_F(VelkReportingTest, CategoryZeroIsAnError) {
  const auto client = makeClient();
  Error error;
  EXPECT_FALSE(client->sendMessageWithCategory(0, 1, std::nullopt, &error));
  EXPECT_EQ(error.code, 4);
  EXPECT_EQ(error.domain, "VelkReportingErrorDomain");
  error = {};
  EXPECT_FALSE(client->sendMessageWithDictionary(message(65536), &error)) << "0 in sixteen bits";
  EXPECT_EQ(error.code, 4);
}

TEST_F(VelkReportingTest, MissingParametersStandInTheDomain) {
  const auto client = makeClient();
  Error error;
  EXPECT_FALSE(client->sendMessageWithDictionary({{"ParametersType", 1}}, &error));
  EXPECT_EQ(error, (Error{"Missing mandatory parameter 'category'", 7, ""}));
  EXPECT_FALSE(client->sendMessageWithDictionary({{"ParametersCategory", 1}}, &error));
  EXPECT_EQ(error, (Error{"Missing mandatory parameter 'type'", 7, ""}));
}

TEST_F(VelkReportingTest, CategoryFormBuildsTheWholeMessage) {
  _daemon.start();
  const auto client = makeClient();
  EXPECT_TRUE(client->sendMessageWithCategory(3, 9, PropertyDictionary{{"a", 1}}));
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 1));
  const PropertyDictionary expected{{"ParametersCategory", 3},
                                    {"ParametersType", 9},
                                    {"ParametersPayload", PropertyDictionary{{"a", 1}}},
                                    {"ParametersFlag", 0}};
  EXPECT_EQ(_daemon.calls().back().arguments, PropertyArray{expected});
}

class CountingDelegate : public VelkReportingMessageSentDelegate {
 public:
  void didSendMessageForReportingClient(const std::shared_ptr<VelkReporting>&, const PropertyDictionary&) override {
    heard.signal();
  }
  Semaphore heard;
};

TEST_F(VelkReportingTest, DelegateHearsOfFilteredMessagesToo) {
  _daemon.start();
  _daemon.setConfiguration(PropertyArray{}, std::nullopt, PropertyArray{5});
  const auto client = makeClient();
  static_cast<void>(configure(*client));
  const auto delegate = std::make_shared<CountingDelegate>();
  client->setMessageSentDelegate(delegate);
  flush(*client);
  EXPECT_EQ(client->messageSentDelegate(), delegate);
  EXPECT_FALSE(client->sendMessageWithDictionary(message(5)));
  EXPECT_TRUE(client->sendMessageWithDictionary(message(6)));
  EXPECT_TRUE(delegate->heard.waitFor(kPatience));
  EXPECT_TRUE(delegate->heard.waitFor(kPatience));
}

TEST_F(VelkReportingTest, DelegateHearsOfTheVeryNextMessage) {
  const auto client = makeClient();
  const auto delegate = std::make_shared<CountingDelegate>();
  client->setMessageSentDelegate(delegate);
  EXPECT_TRUE(client->sendMessageWithDictionary(message(6)));
  EXPECT_TRUE(delegate->heard.waitFor(kPatience));
}

TEST_F(VelkReportingTest, LoggingBlockGetsTextsInOrder) {
  _daemon.start();
  _daemon.setMessageReply("sent text");
  const auto client = makeClient();
  auto texts = std::make_shared<std::vector<std::string>>();
  auto heard = std::make_shared<Semaphore>();
  client->setMessageLoggingBlock([texts, heard](const std::string& text) {
    texts->push_back(text);
    heard->signal();
  });
  client->startConfigurationWithCompletionHandler(nullptr);
  client->sendMessageWithCategory(1, 1);
  client->flushMessages();
  for (int text = 0; text < 3; ++text) ASSERT_TRUE(heard->waitFor(kPatience));
  EXPECT_EQ(*texts,
            (std::vector<std::string>{"URL for the session is: https://reports.example/", "sent text", "flushed"}));
}

TEST_F(VelkReportingTest, FlushHandsTheErrorOn) {
  _daemon.start();
  _daemon.setFlushError(Error{"VelkReportingErrorDomain", -1, "Nothing to flush"});
  const auto client = makeClient();
  const auto error = flush(*client);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, -1);
  EXPECT_EQ(_log.count("flushMessagesWithCompletion: flush failed with error 'Nothing to flush'"), 1);
}

TEST_F(VelkReportingTest, DigestKeyFailureSharesTheWordsOfAnotherOperation) {
  const auto client = makeClient();
  EXPECT_FALSE(client->setDigestKey(std::nullopt, 0));
  EXPECT_EQ(_log.count(texts::kDigestKeyIsNil), 1);
  EXPECT_TRUE(client->setDigestKey(ByteData{1, 2}, 0));
  flush(*client);
  EXPECT_TRUE(_log.contains("uploadDataArray: Failed to get remote object proxy: "));
}

TEST_F(VelkReportingTest, SharedDataReachesTheDaemon) {
  _daemon.start();
  const auto client = makeClient();
  client->updateSharedDataWithDictionary({{"a", 1}});
  client->updateSharedDataForKey("b", PropertyValue(2));
  client->updateSharedDataForKey("b", std::nullopt);
  ASSERT_TRUE(_daemon.waitForCalls("updateSharedDataForKey", 2));
  EXPECT_EQ(_daemon.calls().back().arguments, (PropertyArray{"b", nullptr}));
}

TEST_F(VelkReportingTest, ReportsWhetherFilesMayBeUploaded) {
  _daemon.start();
  _daemon.setConfiguration(PropertyArray{"splunk", "upload_server"}, std::nullopt, std::nullopt);
  const auto client = makeClient();
  EXPECT_FALSE(client->serverSupportsFileUpload());
  EXPECT_EQ(_log.count("serverSupportsFileUpload:NO (0 backends)"), 1);
  static_cast<void>(configure(*client));
  EXPECT_TRUE(client->serverSupportsFileUpload());
  EXPECT_EQ(_log.count("serverSupportsFileUpload:YES (2 backends)"), 1);
}

TEST_F(VelkReportingTest, UploadsNeedSomethingToUpload) {
  const auto client = makeClient();
  EXPECT_FALSE(client->uploadFileWithURL(std::nullopt, nullptr));
  EXPECT_FALSE(client->uploadFileWithURL("/nonexistent/file", nullptr));
  EXPECT_EQ(_log.count("uploadFileWithURL: Failed to get sandbox extension for path /nonexistent/file, errno 2"), 1);
  EXPECT_FALSE(client->uploadFileWithURL("file:///proc/self/status%00.gz", nullptr)) << "not the file before the zero";
  EXPECT_FALSE(client->uploadFileWithURL("file:///proc/self/st% 61tus", nullptr)) << "no escape";
  EXPECT_TRUE(client->uploadFileWithURL("file:///proc/self/st%61tus", nullptr));
  EXPECT_FALSE(client->uploadDataArray(PropertyArray{}, nullptr));
  EXPECT_FALSE(client->uploadDataArray(std::nullopt, nullptr));
  EXPECT_EQ(_log.count(texts::kLogDataArrayIsEmpty), 2);
}

TEST_F(VelkReportingTest, UploadHandsTheFileOver) {
  _daemon.start();
  const auto client = makeClient();
  auto answered = std::make_shared<Semaphore>();
  EXPECT_TRUE(client->uploadFileWithURL("file:///proc/self/status", [answered](bool uploaded, const auto& error) {
    EXPECT_TRUE(uploaded);
    EXPECT_FALSE(error);
    answered->signal();
  }));
  EXPECT_TRUE(answered->waitFor(kPatience));
  EXPECT_EQ(_daemon.calls().back().arguments[2], PropertyValue(true)) << "a descriptor came along";
}

class ClientUploadTest : public VelkReportingTest {
 protected:
  /// The answer to the upload of that file.
  bool upload(VelkReporting& client, const std::string& path) {
    auto uploaded = std::make_shared<std::atomic<bool>>(false);
    auto answered = std::make_shared<Semaphore>();
    EXPECT_TRUE(client.uploadFileWithURL(path, [uploaded, answered](bool value, const auto&) {
      *uploaded = value;
      answered->signal();
    }));
    EXPECT_TRUE(answered->waitFor(kPatience));
    return *uploaded;
  }

  const TemporaryDirectory _directory;
};

TEST_F(ClientUploadTest, FileThatTheServerHasIsGoneWhenTheAnswerComes) {
  _daemon.start();
  _daemon.setDeliversUploads(true);
  const auto path = _directory.write("log", "text");
  EXPECT_TRUE(upload(*makeClient(), "file://" + path));
  EXPECT_FALSE(files::exists(path));
}

TEST_F(ClientUploadTest, FileThatTheServerRefusedStays) {
  _daemon.start();
  const auto path = _directory.write("log", "text");
  EXPECT_TRUE(upload(*makeClient(), path));
  EXPECT_TRUE(files::exists(path));
}

TEST_F(ClientUploadTest, FileThatTookItsPlaceStays) {
  _daemon.start();
  _daemon.setDeliversUploads(true);
  _daemon.holdCalls(true);
  const auto path = _directory.write("log", "text");
  const auto client = makeClient();
  auto answered = std::make_shared<Semaphore>();
  EXPECT_TRUE(client->uploadFileWithURL(path, [answered](bool, const auto&) { answered->signal(); }));
  ASSERT_TRUE(files::remove(path).has_value());
  static_cast<void>(_directory.write("log", "another one"));
  _daemon.holdCalls(false);
  EXPECT_TRUE(answered->waitFor(kPatience));
  EXPECT_EQ(_directory.read("log"), "another one");
  EXPECT_EQ(_log.count("uploadFileWithURL: An uploaded file stays: " + path + ": another file has taken its place"), 1);
}

TEST_F(ClientUploadTest, LinksAndDirectoriesReachTheDaemon) {
  _daemon.start();
  const auto client = makeClient();
  const auto link = _directory / "link";
  std::filesystem::create_symlink(_directory.write("log", "text"), link);
  EXPECT_TRUE(upload(*client, link));
  EXPECT_EQ(_daemon.calls().back().arguments[2], PropertyValue(true)) << "a descriptor came along";
  EXPECT_TRUE(upload(*client, _directory.path()));
  EXPECT_EQ(_daemon.calls().back().arguments[2], PropertyValue(true)) << "a descriptor came along";
}

TEST_F(ClientUploadTest, AddressesOfFilesAreReadAsTheDaemonReadsThem) {
  _daemon.start();
  _daemon.setDeliversUploads(true);
  const auto client = makeClient();
  for (const char* scheme : {"FILE://", "file:", "File://localhost", "file://"}) {
    const auto path = _directory.write("a log", "text");
    EXPECT_TRUE(upload(*client, scheme + _directory.path() + "/a%20log")) << scheme;
    EXPECT_FALSE(files::exists(path)) << scheme;
  }
  // A name may look like the beginning of an address.
  EXPECT_TRUE(upload(*client, _directory.write("file:log", "text")));
  EXPECT_TRUE(upload(*client, _directory.write("100%20", "text")));
  EXPECT_FALSE(files::exists(_directory / "100%20"));
}

TEST_F(ClientUploadTest, HoldsSoManyFilesAndNoMore) {
  _daemon.start();
  _daemon.holdCalls(true);
  const auto client = makeClient();
  const auto path = _directory.write("log", "text");
  auto answered = std::make_shared<Semaphore>();
  for (int number = 0; number < 64; ++number) {
    EXPECT_TRUE(client->uploadFileWithURL(path, [answered](bool, const auto&) { answered->signal(); }));
  }
  EXPECT_FALSE(client->uploadFileWithURL(path, nullptr));
  EXPECT_EQ(_log.count("uploadFileWithURL: Failed to get sandbox extension for path " + path + ", errno 24"), 1);
  _daemon.holdCalls(false);
  for (int number = 0; number < 64; ++number) EXPECT_TRUE(answered->waitFor(kPatience));
  EXPECT_TRUE(upload(*client, path)) << "answered files are let go";
}

TEST_F(VelkReportingTest, AggregationBlockGetsEventsInOrder) {
  _daemon.start();
  auto types = std::make_shared<std::vector<int>>();
  auto heard = std::make_shared<Semaphore>();
  const auto client = makeClient([types, heard](const std::optional<PropertyDictionary>& origin, double timestamp,
                                                std::uint16_t, std::uint16_t type, const auto& payload) {
    EXPECT_EQ(origin, sessionInfo(7));
    EXPECT_EQ(timestamp, 12.5);
    EXPECT_TRUE(payload);
    types->push_back(type);
    heard->signal();
  });
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
  EXPECT_EQ(_daemon.calls()[0].arguments[3], PropertyValue(true));
  for (std::uint16_t type = 1; type <= 3; ++type) {
    _daemon.sendToClient(sessionInfo(7), 12.5, 2, type, PropertyDictionary{{"x", type}});
  }
  for (int event = 0; event < 3; ++event) ASSERT_TRUE(heard->waitFor(kPatience));
  EXPECT_EQ(*types, (std::vector<int>{1, 2, 3}));
  EXPECT_EQ(_log.count("sendMessageToClient: 2, 3"), 1);
}

TEST_F(VelkReportingTest, ThrowingAggregationBlockIsCalledOnce) {
  _daemon.start();
  std::atomic<int> calls{0};
  auto heard = std::make_shared<Semaphore>();
  const auto client = makeClient([&calls, heard](auto&&...) {
    ++calls;
    heard->signal();
    throw std::runtime_error("the host's own mistake");
  });
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
  _daemon.sendToClient(sessionInfo(), 1, 2, 1, std::nullopt);
  ASSERT_TRUE(heard->waitFor(kPatience));
  _daemon.sendToClient(sessionInfo(), 1, 2, 2, std::nullopt);
  flush(*client);  // behind it on the wire
  EXPECT_EQ(calls.load(), 1);
}

TEST_F(VelkReportingTest, CallbacksMayWaitForOtherCallbacks) {
  _daemon.start();
  const auto client = makeClient();
  auto done = std::make_shared<Semaphore>();
  client->startConfigurationWithCompletionHandler([client, done](const auto&) {
    auto inner = std::make_shared<Semaphore>();
    client->flushMessagesWithCompletion([inner](const auto&) { inner->signal(); });
    if (inner->waitFor(kPatience)) done->signal();
  });
  EXPECT_TRUE(done->waitFor(kPatience));
}

}  // namespace
}  // namespace velk::test
