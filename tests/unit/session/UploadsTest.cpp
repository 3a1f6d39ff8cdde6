#include "session/UploadQueue.h"
#include "tests/unit/session/SessionFixture.h"

namespace velk::test {
namespace {

using namespace session_texts;

class UploadsTest : public SessionTest {
 protected:
  std::string displayURL() {
    std::optional<std::string> answer;
    session->fetchDisplayURL([&](std::optional<std::string> url) { answer = std::move(url); });
    return answer.value_or("(no reply)");
  }
  std::optional<bool> uploadFile(const std::string& url) {
    std::optional<bool> answer;
    session->uploadFileAtPath(url, "token", FileDescriptor(), [&](bool success, bool isDelivered) {
      answer = success;
      delivered = isDelivered;
    });
    fakes.scheduler.runUntilIdle();
    return answer;
  }
  std::optional<bool> uploadLog(const PropertyArray& logData) {
    std::optional<bool> answer;
    session->uploadLogData(logData, [&](bool success, std::optional<Error> error) {
      answer = success;
      EXPECT_FALSE(error.has_value());
    });
    fakes.scheduler.runUntilIdle();
    return answer;
  }
  void offer(const std::vector<std::pair<std::string, std::optional<std::string>>>& urls) {
    std::vector<std::string> names;
    for (const auto& each : urls) names.push_back(each.first);
    prepareBackend = [&urls](FakeBackend& each) {
      for (const auto& [name, url] : urls) {
        if (name == each.name()) each.setDisplayURL(url);
      }
    };
    start(names);
    prepareBackend = nullptr;
  }
  /// Two uploads are under way: one file and one array, whose answers are counted.
  void leaveTwoUploadsBehind() {
    session->uploadFileAtPath("file:///tmp/a", "token", FileDescriptor(), [&](bool, bool) { ++answers; });
    session->uploadLogData(numbers({1}), [&](bool, std::optional<Error>) { ++answers; });
  }

  bool delivered = false;
  int answers = 0;
};

TEST_F(UploadsTest, DisplayURLIsNotAvailableWithoutBackends) {
  describe();
  EXPECT_EQ(displayURL(), "URL not available");
  EXPECT_EQ(recordedLog.count("fetchDisplayURL: Fetching display URL for session 7"), 1);
}

TEST_F(UploadsTest, DashboardWithoutDisplayURLHasNone) {
  offer({{"dashboard", std::nullopt}});
  EXPECT_EQ(displayURL(), "URL not available");
}

TEST_F(UploadsTest, FirstSplunkWithAnAddressWins) {
  offer({{"korrin", "k"}, {"dashboard", "d"}, {"splunk", std::nullopt}, {"splunk2", "s2"}, {"splunk3", "s3"}});
  EXPECT_EQ(displayURL(), "s2");
}

TEST_F(UploadsTest, KorrinFollowsASplunkWithoutAddress) {
  offer({{"splunk", std::nullopt}, {"dashboard", "d"}, {"korrin", "k"}});
  EXPECT_EQ(displayURL(), "k");
}

TEST_F(UploadsTest, DashboardComesLast) {
  offer({{"korrin", std::nullopt}, {"dashboard", "d"}, {"quill", "q"}});
  EXPECT_EQ(displayURL(), "d");
}

TEST_F(UploadsTest, MessageLogNamesTheFileByItsAddress) {
  prepareBackend = [](FakeBackend& each) { each.takesUploads = true; };
  start({"upload_server"});
  EXPECT_EQ(uploadFile("/tmp/a b"), true);
  EXPECT_EQ(messageLog.journal.entries(),
            std::vector<std::string>{"[uploadFileWithURL] Upload succeeded for file file:///tmp/a%20b"});
}

TEST_F(UploadsTest, EveryBackendIsOfferedTheFile) {
  prepareBackend = [](FakeBackend& each) { each.takesUploads = each.name() != "quill"; };
  start({"splunk", "korrin", "quill"});
  EXPECT_EQ(uploadFile("file:///tmp/a%20b"), true);
  EXPECT_EQ(journal.entries(), (std::vector<std::string>{"upload splunk /tmp/a b token", "upload korrin /tmp/a b token",
                                                         "upload quill /tmp/a b token"}));
  EXPECT_EQ(recordedLog.count("uploadFileAtPath: Uploading file for session 7"), 1);
  EXPECT_EQ(recordedLog.count(log::Level::standard, "uploadFileWithURL: File upload successful for /tmp/a b"), 1);
  EXPECT_EQ(messageLog.journal.entries(),
            std::vector<std::string>{"[uploadFileWithURL] Upload succeeded for file file:///tmp/a%20b"});
}

TEST_F(UploadsTest, OnlyAFileThatAServerHasIsSaidToBeDelivered) {
  prepareBackend = [](FakeBackend& each) { each.takesUploads = each.deliversUploads = each.name() == "splunk"; };
  start({"splunk", "korrin"});
  EXPECT_EQ(uploadFile("file:///tmp/a"), true);
  EXPECT_TRUE(delivered) << "whoever else was asked afterwards";
  backend("splunk").deliversUploads = false;
  EXPECT_EQ(uploadFile("file:///tmp/a"), true);
  EXPECT_FALSE(delivered);
}

TEST_F(UploadsTest, OtherCallsGoOnMeanwhile) {
  prepareBackend = [](FakeBackend& each) { each.takesUploads = true; };
  start({"splunk"});
  leaveTwoUploadsBehind();
  EXPECT_EQ(send(message(3, 4)), std::nullopt);
  EXPECT_EQ(displayURL(), "URL not available");
  EXPECT_EQ(answers, 0);
  EXPECT_EQ(journal.entries(), std::vector<std::string>{"send splunk 3/4"});
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(answers, 2);
  EXPECT_EQ(journal.entries(),
            (std::vector<std::string>{"send splunk 3/4", "upload splunk /tmp/a token", "logData splunk 1"}));
}

TEST_F(UploadsTest, MoreThanItTakesIsRefusedAtOnce) {
  prepareBackend = [](FakeBackend& each) { each.takesUploads = true; };
  start({"splunk"});
  for (std::size_t number = 0; number < UploadQueue::kMaximumUploads; number += 2) leaveTwoUploadsBehind();
  std::vector<bool> refused;
  session->uploadFileAtPath("file:///tmp/b", "token", FileDescriptor(),
                            [&](bool taken, bool isDelivered) { refused.push_back(taken || isDelivered); });
  session->uploadLogData(numbers({1}), [&](bool taken, std::optional<Error>) { refused.push_back(taken); });
  EXPECT_EQ(refused, (std::vector<bool>{false, false}));
  EXPECT_EQ(recordedLog.count(log::Level::error, "uploadFileWithURL: File upload failed for /tmp/b"), 1);
  EXPECT_EQ(
      recordedLog.count(
          "uploadFileAtPath: session 7 takes no more: 16 uploads of its own, or its user's share of the 64 places, are "
          "under way"),
      2);
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(answers, static_cast<int>(UploadQueue::kMaximumUploads));
  EXPECT_EQ(uploadFile("file:///tmp/b"), true) << "there is room again";
}

TEST_F(UploadsTest, WhatEndedSessionsLeftBehindCountsForAll) {
  prepareBackend = [](FakeBackend& each) { each.takesUploads = true; };
  start({"splunk"});
  leaveTwoUploadsBehind();
  session->teardown();
  auto& ofAll = *services.backends.uploads;
  EXPECT_EQ(ofAll.count(), 2U);
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(ofAll.count(), 0U);
  while (ofAll.enter(connection->user())) {
  }
  start({"splunk"});
  EXPECT_EQ(uploadFile("file:///tmp/b"), false);
  ofAll.leave(connection->user());
  EXPECT_EQ(uploadFile("file:///tmp/b"), true);
}

TEST_F(UploadsTest, OtherUsersTakeNoPlacesOfThisOne) {
  prepareBackend = [](FakeBackend& each) { each.takesUploads = true; };
  start({"splunk"});
  auto& ofAll = *services.backends.uploads;
  while (ofAll.enter(connection->user() + 1)) {
  }
  EXPECT_EQ(uploadFile("file:///tmp/b"), true);
}

TEST_F(UploadsTest, BackendsHearWhoseUploadItIs) {
  start({"splunk"});
  EXPECT_EQ(uploadFile("file:///tmp/b"), false);
  EXPECT_EQ(backend("splunk").uploadsUser, connection->user());
}

TEST_F(UploadsTest, WhatWaitsAtTheEndOfTheProcessIsNotBegunAndStaysWithItsClient) {
  prepareBackend = [](FakeBackend& each) { each.takesUploads = each.deliversUploads = true; };
  start({"splunk"});
  std::vector<bool> taken;
  session->uploadFileAtPath("file:///tmp/a", "token", FileDescriptor(),
                            [&](bool isTaken, bool isDelivered) { taken.push_back(isTaken || isDelivered); });
  session->uploadLogData(numbers({1}), [&](bool isTaken, std::optional<Error>) { taken.push_back(isTaken); });
  services.backends.uploads->stop();
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(taken, (std::vector<bool>{false, false}));
  EXPECT_EQ(journal.entries(), std::vector<std::string>{});
  EXPECT_EQ(services.backends.uploads->leftBehind(), 2U);
  EXPECT_EQ(uploadFile("file:///tmp/b"), false) << "nor what comes afterwards";
  EXPECT_EQ(services.backends.uploads->leftBehind(), 3U);
}

TEST_F(UploadsTest, WhatIsDeliveredWhileTheProcessEndsIsNotLeftBehind) {
  prepareBackend = [](FakeBackend& each) { each.takesUploads = each.deliversUploads = true; };
  start({"splunk"});
  UploadQueue queue(fakes.scheduler, services.backends.uploads, connection->user());
  queue.run(queue.takePlace(), [this](bool mayBegin) {
    services.backends.uploads->stop();
    return mayBegin;
  });
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(services.backends.uploads->leftBehind(), 0U);
}

TEST_F(UploadsTest, SessionThatEndsKeepsItsTransportForWhatItLeavesBehind) {
  prepareBackend = [](FakeBackend& each) { each.takesUploads = true; };
  start({"splunk"}, {}, userNamed("Media", "Calls"));
  leaveTwoUploadsBehind();
  journal.clear();
  session->teardown();
  const auto atOnce = journal.entries();
  EXPECT_EQ(journal.count("send splunk 0/1") + journal.count("flush splunk"), 2) << "said goodbye at once";
  EXPECT_EQ(journal.count("cleanup splunk"), 0);
  EXPECT_TRUE(session->userInfo().has_value());
  fakes.scheduler.runUntilIdle();
  EXPECT_EQ(answers, 2);
  const auto all = journal.entries();
  const std::vector<std::string> after(all.begin() + static_cast<std::ptrdiff_t>(atOnce.size()), all.end());
  ASSERT_GE(after.size(), 3U);
  EXPECT_EQ(after[0], "upload splunk /tmp/a token");
  EXPECT_EQ(after[1], "logData splunk 1");
  EXPECT_EQ(after.back(), "cleanup splunk");
  EXPECT_FALSE(session->userInfo().has_value());
}

TEST_F(UploadsTest, FileThatNobodyTakesFails) {
  start({"splunk"});
  EXPECT_EQ(uploadFile("file:///tmp/a"), false);
  EXPECT_EQ(recordedLog.count(log::Level::error, "uploadFileWithURL: File upload failed for /tmp/a"), 1);
  EXPECT_EQ(messageLog.journal.entries(),
            std::vector<std::string>{"[uploadFileWithURL] Upload failed for file file:///tmp/a"});
}

TEST_F(UploadsTest, SessionWithoutBackendsFails) {
  EXPECT_EQ(uploadFile("file:///tmp/a"), false);
  EXPECT_EQ(uploadLog({}), false);
}

TEST_F(UploadsTest, AddressCannotForgeAnEntry) {
  uploadFile("file:///a\n[splunk -> sendMessageWithDictionary] forged");
  EXPECT_EQ(messageLog.journal.entries()[0].find('\n'), std::string::npos);
}

TEST_F(UploadsTest, EveryBackendIsOfferedTheLogData) {
  prepareBackend = [](FakeBackend& each) { each.takesUploads = each.name() == "splunk"; };
  start({"splunk", "korrin"});
  EXPECT_EQ(uploadLog(numbers({1, 2})), true);
  EXPECT_EQ(journal.entries(), (std::vector<std::string>{"logData splunk 2", "logData korrin 2"}));
  EXPECT_EQ(recordedLog.count(log::Level::standard, kLogDataSuccessful), 1);
}

TEST_F(UploadsTest, LogDataThatNobodyTakesFails) {
  start({"splunk"});
  EXPECT_EQ(uploadLog(numbers({1})), false);
  EXPECT_EQ(recordedLog.count(log::Level::error, kLogDataFailed), 1);
}

}  // namespace
}  // namespace velk::test
