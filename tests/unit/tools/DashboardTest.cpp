// What the collector's dashboard keeps, shows and answers.
#include "tools/collector/Dashboard.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <sstream>

#include "foundation/Json.h"
#include "platform/PropertyList.h"
#include "tests/support/FakeClock.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk::collector {
namespace {

std::string archived(const PropertyValue& value) {
  const auto bytes = propertylist::serialize(value, propertylist::Form::binary);
  return bytes ? std::string(bytes->begin(), bytes->end()) : std::string();
}

ReceivedDatagram someDatagram(const std::string& text = " a=1") {
  ReceivedDatagram datagram;
  datagram.header.majorVersion = 8;
  datagram.header.component = 9;
  datagram.header.fourMilliseconds = 125;
  datagram.header.seconds = 1'600'000'000;
  datagram.header.sessionID = 4'000'000'000;
  datagram.header.clientVersion = 12;
  datagram.header.method = 7;
  datagram.header.respCode = 3;
  datagram.header.deviceIdentifier = {'a', 'b', 'c'};
  datagram.header.eventNumber = 513;
  datagram.header.flags = 1;
  datagram.text = text;
  datagram.fate = DatagramFate::acknowledged;
  return datagram;
}

class DashboardTest : public ::testing::Test {
 protected:
  DashboardTest() { EXPECT_TRUE(store); }

  [[nodiscard]] std::string lastLine() const {
    const std::string text = printed.str();
    if (text.empty()) return "";
    const auto from = text.rfind('\n', text.size() - 2);
    return text.substr(from == std::string::npos ? 0 : from + 1);
  }
  [[nodiscard]] PropertyDictionary lastObject() const {
    const auto value = json::parse(lastLine(), json::Extensions::tagged);
    return value && value->dictionary() != nullptr ? *value->dictionary() : PropertyDictionary();
  }

  const test::TemporaryDirectory directory;
  const Result<std::unique_ptr<DashboardStore>> store = DashboardStore::open(directory.path() + "/dashboard.sqlite");
  std::ostringstream printed;
  tools::JsonLines lines{printed};
  Announcer announcer{lines, true, false};
  test::FakeClock clock;
  Dashboard dashboard{store->get(), announcer, clock};
};

TEST_F(DashboardTest, ShowsADatagram) {
  dashboard.take(someDatagram());
  EXPECT_EQ(lastObject(), (PropertyDictionary{{"event", "datagram"},
                                              {"fate", "acknowledged"},
                                              {"eventNumber", 513},
                                              {"sent", 1600000000.5},
                                              {"component", 9},
                                              {"majorVersion", 8},
                                              {"session", 4'000'000'000},
                                              {"clientVersion", 12},
                                              {"method", 7},
                                              {"status", 3},
                                              {"device", "abc"},
                                              {"flags", 1},
                                              {"text", " a=1"}}));
}

TEST_F(DashboardTest, ShowsADatagramInWords) {
  Announcer words(lines, false, false);
  Dashboard(nullptr, words, clock).take(someDatagram(" a=1\x1b[2J\nForged"));
  EXPECT_EQ(lastLine(), "Datagram 513 (acknowledged) of component 9, session 4000000000: 7/3 a=1\\x1b[2J\\nForged\n");
}

TEST_F(DashboardTest, ShowsWhatIsNoText) {
  dashboard.take(someDatagram(" a=\xFF"));
  EXPECT_EQ(*lastObject().find("text"), PropertyValue(ByteData{' ', 'a', '=', 0xFF}));
}

TEST_F(DashboardTest, KeepsLogDataAndSaysWhere) {
  const std::string archive = archived(PropertyArray{PropertyDictionary{{"LogData", "words"}}, 2});
  const Answer answer = dashboard.postLogData({{"Host", "127.0.0.1:8443"}}, archive);
  EXPECT_EQ(answer.status, 200);
  EXPECT_EQ(answer.body, "https://127.0.0.1:8443/logdata/1");
  EXPECT_EQ(answer.contentType, "text/plain");
  EXPECT_EQ(
      lastObject(),
      (PropertyDictionary{
          {"event", "logData"}, {"number", 1}, {"entries", 2}, {"bytes", archive.size()}, {"location", answer.body}}));
  const Answer kept = dashboard.logData("1");
  EXPECT_EQ(kept.status, 200);
  EXPECT_EQ(kept.body, archive);
  for (const char* number : {"2", "0", "", "-1", "1x", "99999999999999999999"}) {
    EXPECT_EQ(dashboard.logData(number).status, 404) << number;
  }
}

TEST_F(DashboardTest, NamesNoHostThatIsNone) {
  const std::string archive = archived(PropertyArray{});
  for (const std::string& host : {std::string("a\nb"), std::string("a/b"), std::string(), std::string(256, 'a')}) {
    EXPECT_EQ(dashboard.postLogData({{"Host", host}}, archive).body.rfind("/logdata/", 0), 0U) << host;
  }
  EXPECT_EQ(dashboard.postLogData({}, archive).body.rfind("/logdata/", 0), 0U);
}

TEST_F(DashboardTest, RefusesWhatIsNoLogData) {
  for (const std::string& wire : {std::string(), std::string("bplist00"), archived("text"),
                                  archived(PropertyDictionary{{"a", 1}}), std::string("[1]")}) {
    EXPECT_EQ(dashboard.postLogData({}, wire).status, 400);
    EXPECT_EQ(*lastObject().string("event"), "refused");
  }
}

TEST_F(DashboardTest, WithoutStoreCounts) {
  Dashboard counting(nullptr, announcer, clock);
  const std::string archive = archived(PropertyArray{});
  EXPECT_EQ(counting.postLogData({}, archive).body, "/logdata/1");
  EXPECT_EQ(counting.postLogData({}, archive).body, "/logdata/2");
  EXPECT_EQ(counting.logData("1").status, 404);
}

TEST_F(DashboardTest, KeepsItsFilesFromOthers) {
  dashboard.take(someDatagram());
  using std::filesystem::perms;
  for (const auto& entry : std::filesystem::directory_iterator(directory.path())) {
    EXPECT_EQ(entry.status().permissions(), perms::owner_read | perms::owner_write) << entry.path();
  }
}

TEST(DashboardStoreFile, GoesOnWhereAnEarlierRunStopped) {
  const test::TemporaryDirectory directory;
  const std::string path = directory.path() + "/dashboard.sqlite";
  EXPECT_EQ((*DashboardStore::open(path))->addLogData("one", 1, {1, 0}), 1);
  EXPECT_EQ((*DashboardStore::open(path))->addLogData("two", 1, {2, 0}), 2);
  EXPECT_EQ((*DashboardStore::open(path))->logData(1), "one");
}

TEST(DashboardStoreFile, IsRefusedWhenItIsNoDatabase) {
  const test::TemporaryDirectory directory;
  EXPECT_FALSE(DashboardStore::open(directory.write("dashboard.sqlite", std::string(5000, 'x'))));
  EXPECT_FALSE(DashboardStore::open(directory.path() + "/nowhere/dashboard.sqlite"));
}

}  // namespace
}  // namespace velk::collector
