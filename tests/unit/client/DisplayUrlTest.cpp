// Where a session's reports can be seen, as the logging block is told it.
#include <ostream>

#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

/// What the daemon answers, and the text that the block gets.
struct Answer {
  const char* name;
  std::optional<std::string> url;
  std::optional<std::string> text;
};

void PrintTo(const Answer& answer, std::ostream* stream) { *stream << answer.name; }

class DisplayUrlTest : public VelkReportingTest, public ::testing::WithParamInterface<Answer> {
 protected:
  /// The texts of a configuration, up to that of the flush behind it.
  std::vector<std::string> textsOfConfiguration(VelkReporting& client) {
    auto texts = std::make_shared<std::vector<std::string>>();
    auto flushed = std::make_shared<Semaphore>();
    client.setMessageLoggingBlock([texts, flushed](const std::string& text) {
      texts->push_back(text);
      if (text == "flushed") flushed->signal();
    });
    static_cast<void>(configure(client));
    EXPECT_TRUE(flushed->waitFor(kPatience));
    return *texts;
  }
};

TEST_P(DisplayUrlTest, ReachesTheLoggingBlock) {
  _daemon.start();
  _daemon.setDisplayUrl(GetParam().url);
  const auto client = makeClient();
  std::vector<std::string> expected;
  if (GetParam().text) expected.push_back(*GetParam().text);
  expected.emplace_back("flushed");
  EXPECT_EQ(textsOfConfiguration(*client), expected);
  EXPECT_EQ(_daemon.count("fetchDisplayURL"), 1U);
}

INSTANTIATE_TEST_SUITE_P(When, DisplayUrlTest,
                         ::testing::Values(Answer{"NotAvailable", "URL not available", "URL not available"},
                                           Answer{"AnAddress", "https://reports.example/a?b=1#c",
                                                  "URL for the session is: https://reports.example/a?b=1#c"},
                                           Answer{"NotAnAddress", "somewhere", "URL for the session is: somewhere"},
                                           Answer{"TheFixedTextAndMore", "URL not available yet",
                                                  "URL for the session is: URL not available yet"},
                                           Answer{"TheFixedTextInOtherLetters", "url not available",
                                                  "URL for the session is: url not available"},
                                           Answer{"APlaceholder", "https://reports.example/%@%s%20",
                                                  "URL for the session is: https://reports.example/%@%s%20"},
                                           Answer{"Empty", "", "URL for the session is: "},
                                           Answer{"Nothing", std::nullopt, std::nullopt}),
                         [](const auto& info) { return std::string(info.param.name); });

TEST_F(VelkReportingTest, DisplayUrlIsAskedForThoughNobodyListens) {
  _daemon.start();
  const auto client = makeClient();
  static_cast<void>(configure(*client));
  EXPECT_EQ(_daemon.count("fetchDisplayURL"), 1U);
  EXPECT_FALSE(_log.contains("URL for the session is")) << "it is for the block alone";
}

}  // namespace
}  // namespace velk::test
