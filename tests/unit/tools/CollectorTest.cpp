#include "tools/collector/Collector.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <sstream>

#include "foundation/Json.h"
#include "tests/support/FakeClock.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/unit/tools/Packing.h"
#include "tools/collector/HttpDate.h"

namespace velk::collector {
namespace {

constexpr const char* kPost =
    R"({"postTime":1.5,"clientId":"c","events":[{"_method":3,"_status":4,"_eventNumber":9,"_sender":"VELK","a":"b"}]})";

class CollectorTest : public ::testing::Test {
 protected:
  CollectorTest() {
    options.storebagDirectory = directory.path();
    options.json = true;
  }

  /// With the options as they are now.
  Collector& collector() {
    if (_collector == nullptr) {
      _announcer = std::make_unique<Announcer>(_lines, options.json, options.quiet);
      _collector = std::make_unique<Collector>(options, nullptr, *_announcer, _clock);
    }
    return *_collector;
  }

  /// The n-th line that was printed.
  PropertyDictionary line(std::size_t number) const {
    std::istringstream lines(printed.str());
    std::string text;
    for (std::size_t at = 0; at <= number; ++at) {
      if (!std::getline(lines, text)) return {};
    }
    return *json::parse(text)->dictionary();
  }

  const test::TemporaryDirectory directory;
  CollectorOptions options;
  std::ostringstream printed;

 private:
  tools::JsonLines _lines{printed};
  test::FakeClock _clock;
  std::unique_ptr<Announcer> _announcer;
  std::unique_ptr<Collector> _collector;
};

TEST_F(CollectorTest, ServesAStorebagWithItsAge) {
  options.maxAgeSeconds = 77;
  std::filesystem::last_write_time(directory.write("sorrel", "envelope"),
                                   std::filesystem::file_time_type::clock::now() - std::chrono::hours(1));
  const Answer answer = collector().storebag("sorrel", nullptr);
  EXPECT_EQ(answer.status, 200);
  EXPECT_EQ(answer.body, "envelope");
  EXPECT_EQ(*headerValue(answer.headers, "cache-control"), "max-age=77");
  EXPECT_TRUE(secondsFromHttpDate(*headerValue(answer.headers, "Last-Modified")));
}

TEST_F(CollectorTest, AnswersNotModifiedForTheDateThatItGave) {
  directory.write("sorrel", "envelope");
  const std::string date = *headerValue(collector().storebag("sorrel", nullptr).headers, "Last-Modified");
  EXPECT_EQ(collector().storebag("sorrel", &date).status, 304);
  const std::string earlier = httpDate(*secondsFromHttpDate(date) - 1);
  EXPECT_EQ(collector().storebag("sorrel", &earlier).status, 200);
  const std::string nonsense = "yesterday";
  EXPECT_EQ(collector().storebag("sorrel", &nonsense).status, 200);
}

TEST_F(CollectorTest, ServesNothingButStorebags) {
  directory.write("bags/sorrel", "envelope");
  directory.write("bags/.hidden", "secret");
  directory.write("secret", "secret");
  options.storebagDirectory = directory.path() + "/bags";
  for (const char* name : {"missing", "../secret", "..", ".", "", ".hidden", "a/b", "sorrel\n", "/etc/passwd"}) {
    EXPECT_EQ(collector().storebag(name, nullptr).status, 404) << name;
  }
  EXPECT_EQ(collector().storebag(std::string("sorrel\0x", 8), nullptr).status, 404);
  EXPECT_EQ(collector().storebag(std::string(5000, 'a'), nullptr).status, 404);
}

TEST_F(CollectorTest, PrintsThePostAndEachEvent) {
  EXPECT_EQ(collector().post("/post", {}, kPost).status, 200);
  EXPECT_EQ(*line(0).string("event"), "post");
  EXPECT_EQ(integerValue(line(0).find("events")), 1);
  EXPECT_EQ(*line(1).string("event"), "event");
  EXPECT_EQ(integerValue(line(1).find("post")), 1);
  EXPECT_EQ(*line(1).string("sender"), "VELK");
  EXPECT_EQ(integerValue(line(1).find("method")), 3);
  EXPECT_EQ(*line(1).dictionary("body")->string("a"), "b");
}

TEST_F(CollectorTest, PrintsWordsForPeople) {
  options.json = false;
  ASSERT_EQ(collector().post("/post", {}, kPost).status, 200);
  EXPECT_NE(printed.str().find("Post 1 to /post: 1 event,"), std::string::npos) << printed.str();
  EXPECT_NE(printed.str().find("VELK 3/4 #9  {\"a\":\"b\"}"), std::string::npos) << printed.str();
}

TEST_F(CollectorTest, LetsNoPeerSteerTheTerminal) {
  options.json = false;
  (void)collector().post("/\x1b[2J", {},
                         "{\"postTime\":1,\"clientId\":\"c\",\"events\":[{\"_sender\":\"\\u001b[2J\\n\"}]}");
  EXPECT_EQ(printed.str().find('\x1b'), std::string::npos) << printed.str();
}

TEST_F(CollectorTest, PrintsNothingOfPostsWhenQuiet) {
  options.quiet = true;
  EXPECT_EQ(collector().post("/post", {}, kPost).status, 200);
  EXPECT_EQ(printed.str(), "");
}

TEST_F(CollectorTest, RefusesBadPostsWithASentence) {
  const Answer answer = collector().post("/post", {}, "[1");
  EXPECT_EQ(answer.status, 400);
  EXPECT_NE(answer.body.find("not JSON"), std::string::npos);
  EXPECT_EQ(*line(0).string("event"), "refused");
  EXPECT_EQ(integerValue(line(0).find("status")), 400);
  EXPECT_EQ(collector().totals().refused, 1u);
  EXPECT_EQ(collector().totals().posts, 0u);
}

TEST_F(CollectorTest, RefusesPostsWithoutTheRightDigest) {
  options.digestKey = ByteData{1, 2, 3};
  EXPECT_EQ(collector().post("/post", {}, kPost).status, 400);
  EXPECT_EQ(collector().post("/post", {{"X-Velk-DIGEST", "00"}}, kPost).status, 400);
}

TEST_F(CollectorTest, CountsWithoutLookingWhenItIsASink) {
  options.sink = true;
  EXPECT_EQ(collector().post("/post", {{"Content-Encoding", "gzip"}}, test::packed(kPost)).status, 200);
  EXPECT_EQ(collector().post("/post", {}, kPost).status, 200);
  EXPECT_EQ(collector().totals().events, 2u);
  EXPECT_EQ(collector().totals().posts, 2u);
  EXPECT_EQ(printed.str(), "");
}

TEST_F(CollectorTest, AnswersTheStatusesThatItIsTold) {
  options.postStatus = 503;
  options.storebagStatus = 500;
  directory.write("sorrel", "envelope");
  EXPECT_EQ(collector().post("/post", {}, kPost).status, 503);
  EXPECT_EQ(collector().storebag("sorrel", nullptr).status, 500);
  EXPECT_EQ(collector().totals().events, 0u);
}

TEST_F(CollectorTest, GivesItsCounts) {
  (void)collector().post("/post", {}, kPost);
  (void)collector().unreadablePost("/post");
  const auto stats = json::parse(collector().stats().body);
  ASSERT_TRUE(stats);
  EXPECT_EQ(integerValue(stats->dictionary()->find("posts")), 1);
  EXPECT_EQ(integerValue(stats->dictionary()->find("events")), 1);
  EXPECT_EQ(integerValue(stats->dictionary()->find("refused")), 1);
}

TEST_F(CollectorTest, DelaysEndWhenItStops) {
  options.storebagDelaySeconds = 3600;
  collector().stop();
  EXPECT_EQ(collector().storebag("sorrel", nullptr).status, 404);
}

}  // namespace
}  // namespace velk::collector
