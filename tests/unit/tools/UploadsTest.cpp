#include "tools/collector/Uploads.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <sstream>

#include "tests/support/FakeClock.h"
#include "tests/support/TemporaryDirectory.h"
#include "tests/unit/tools/Packing.h"

namespace velk::collector {
namespace {

using test::packed;

constexpr const char* kTarget = "/upload?uuid=u&sequence=7&description=d&filename=a%20b&c.log.gz&raw=true";

class UploadsTest : public ::testing::Test {
 protected:
  /// The answer to these pieces of a body.
  Answer upload(const std::vector<std::string>& pieces, const std::string& target = kTarget, bool whole = true) {
    const auto incoming = _uploads.begin();
    for (const auto& piece : pieces) whole = incoming->take(piece) && whole;
    return _uploads.end(*incoming, whole, target);
  }
  std::vector<std::string> kept() const {
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(directory / "uploads")) {
      names.push_back(entry.path().filename());
    }
    return names;
  }

  const test::TemporaryDirectory directory;
  CollectorOptions options;
  std::ostringstream printed;

 private:
  tools::JsonLines _lines{printed};
  test::FakeClock _clock;
  Announcer _announcer{_lines, true, false};
  std::unique_ptr<UploadStore> _store = UploadStore::open(directory.path()).value();
  Uploads _uploads{options, _store.get(), _announcer, _clock};
};

TEST_F(UploadsTest, KeepsAFileAsItCameAndSaysSuccess) {
  const std::string body = packed("what happened");
  const Answer answer = upload({body.substr(0, 5), body.substr(5)});
  EXPECT_EQ(answer.status, 200);
  EXPECT_EQ(answer.body, "success");
  EXPECT_EQ(kept(), std::vector<std::string>{"1-a_b_c.log.gz"});
  EXPECT_EQ(directory.read("uploads/1-a_b_c.log.gz"), body);
  EXPECT_EQ(printed.str(), "{\"event\":\"upload\",\"upload\":1,\"name\":\"a b&c.log.gz\",\"bytes\":13,\"wireBytes\":" +
                               std::to_string(body.size()) + "}\n");
}

TEST_F(UploadsTest, NamesNeverLeadOutOfTheDirectory) {
  EXPECT_EQ(upload({packed("x")}, "/upload?filename=..%2F..%2Fetc%2Fpasswd&raw=true").status, 200);
  EXPECT_EQ(upload({packed("x")}, "/upload").status, 200);
  EXPECT_EQ(kept().size(), 2U);
}

TEST_F(UploadsTest, RefusesWhatIsNoWholeGzipBody) {
  const std::string body = packed("what happened");
  std::string damaged = body;
  damaged[damaged.size() - 6] = static_cast<char>(damaged[damaged.size() - 6] ^ 1);
  EXPECT_EQ(upload({"plain"}).status, 400);
  EXPECT_EQ(upload({}).status, 400);
  EXPECT_EQ(upload({body.substr(0, body.size() - 1)}).status, 400);
  EXPECT_EQ(upload({damaged}).status, 400) << "its checksum is wrong";
  EXPECT_EQ(upload({body, "more"}).status, 400);
  EXPECT_EQ(upload({body}, kTarget, false).status, 400) << "the connection broke";
  EXPECT_TRUE(kept().empty());
}

TEST_F(UploadsTest, AnswersAsItIsTold) {
  options.postStatus = 503;
  EXPECT_EQ(upload({packed("x")}).status, 503);
  EXPECT_TRUE(kept().empty());
}

TEST(UploadedFileName, ReachesUpToTheLastParameter) {
  EXPECT_EQ(uploadedFileName(kTarget), "a b&c.log.gz");
  EXPECT_EQ(uploadedFileName("/upload?filename=a%2"), "a%2");
  EXPECT_EQ(uploadedFileName("/upload"), "");
}

}  // namespace
}  // namespace velk::collector
