#include "session/FileUrl.h"
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
    session->uploadFileAtPath(url, "token", FileDescriptor(), [&](bool success) { answer = success; });
    return answer;
  }
  std::optional<bool> uploadLog(const PropertyArray& logData) {
    std::optional<bool> answer;
    session->uploadLogData(logData, [&](bool success, std::optional<Error> error) {
      answer = success;
      EXPECT_FALSE(error.has_value());
    });
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

TEST(FileUrl, GivesThePath) {
  EXPECT_EQ(fileSystemPath("file:///tmp/a%20b"), "/tmp/a b");
  EXPECT_EQ(fileSystemPath("file://localhost/tmp/a"), "/tmp/a");
  EXPECT_EQ(fileSystemPath("FILE:/tmp/a"), "/tmp/a");
  EXPECT_EQ(fileSystemPath("/tmp/a%20b"), "/tmp/a%20b");
  EXPECT_EQ(fileSystemPath("file://host"), "");
  EXPECT_EQ(fileSystemPath(""), "");
}

TEST(FileUrl, LeavesWhatIsNoEscape) {
  EXPECT_EQ(fileSystemPath("file:///a%2"), "/a%2");
  EXPECT_EQ(fileSystemPath("file:///a%zz%C3%A9"), "/a%zz\xC3\xA9");
  EXPECT_EQ(fileSystemPath("file:///a%00b"), "/a%00b");
}

}  // namespace
}  // namespace velk::test
