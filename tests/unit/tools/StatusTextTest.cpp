#include "tools/ctl/StatusText.h"

#include <gtest/gtest.h>

#include "foundation/Text.h"

namespace velk::ctl {
namespace {

PropertyDictionary backend(const char* name, int state, int events = 0, int bytes = 0) {
  return {{"name", name}, {"state", state}, {"batchedEvents", events}, {"batchedBytes", bytes}};
}

PropertyDictionary session(int number, const PropertyDictionary& more = {}) {
  PropertyDictionary row{{"sessionID", number},    {"sessionIDString", "id" + std::to_string(number)},
                         {"described", true},      {"clientType", 9},
                         {"clientVersion", 3},     {"clientName", "Media"},
                         {"serviceName", "Calls"}, {"level", 0},
                         {"token", nullptr},       {"finished", false},
                         {"hasAggregator", false}, {"backends", PropertyArray()}};
  row.merge(more);
  return row;
}

PropertyDictionary statusWith(PropertyArray sessions) {
  const auto count = sessions.size();
  return {{"version", "8.0.0"},
          {"processMemory", 3'145'728},
          {"keepAliveCount", 2},
          {"sessionCount", count},
          {"sessions", std::move(sessions)}};
}

TEST(StatusText, TellsOfAnEmptyDaemon) {
  EXPECT_EQ(statusText(statusWith({})),
            "velkreportingd 8.0.0, 3.0 MiB of memory, keep-alive references: 2\n"
            "\n"
            "Sessions: 0\n"
            "\n"
            "Transports: 0\n"
            "\n"
            "Storebags: 0");
}

TEST(StatusText, ShowsSessionsInColumns) {
  const PropertyArray backends{backend("splunk", 2, 12, 4200), backend("quill", 1), backend("korrin", 3, 1, 99),
                               backend("power", 0), backend("odd", 9)};
  const auto text = statusText(statusWith(
      {session(7, {{"backends", backends}, {"hasAggregator", true}, {"finished", true}, {"token", "T"}, {"level", 2}}),
       session(123456, {{"clientName", "Conferencing"},
                        {"serviceName", nullptr},
                        {"clientType", nullptr},
                        {"described", false}})}));
  EXPECT_NE(text.find("Sessions: 2\n"
                      "      ID  TYPE  VERSION  CLIENT        SERVICE  LEVEL  NOTES                 BACKENDS\n"
                      "       7     9        3  Media         Calls        2  aggregates, finished  "
                      "splunk enabled (12 events, 4.1 KiB), quill disabled, korrin waiting (1 event, 99 B), "
                      "power not configured, odd state 9\n"
                      "  123456     -        3  Conferencing  -            -  not described         -\n"),
            std::string::npos)
      << text;
}

TEST(StatusText, ShowsTransportsStorebagsAndCounts) {
  auto status = statusWith({});
  const auto helper = [](const char* key, int users, int timeout, const PropertyValue& left) {
    return PropertyDictionary{
        {"key", key},     {"usageCount", users},       {"totalSessionsServedCount", 4}, {"runningTasks", 1},
        {"active", true}, {"releaseTimeout", timeout}, {"releaseInSeconds", left}};
  };
  status.set("helperCount", 3);
  status.set("helpers", PropertyArray{helper("media:calls", 2, 30, nullptr), helper("a:b", 0, 30, 12.4),
                                      helper(":", 0, 0, nullptr)});
  status.set("storebags", PropertyArray{PropertyDictionary{{"name", "heather"},
                                                           {"version", "7"},
                                                           {"state", "Fetch Successful"},
                                                           {"ageSeconds", 12.3},
                                                           {"maxAgeSeconds", 600},
                                                           {"available", true}},
                                        PropertyDictionary{{"name", "sorrel"},
                                                           {"state", "Fetch Failure"},
                                                           {"ageSeconds", 1.0},
                                                           {"maxAgeSeconds", 0},
                                                           {"available", false}}});
  status.set("activeClients", PropertyDictionary{{"9", 5}});
  const auto text = statusText(status);
  EXPECT_NE(text.find("Transports: 3\n"
                      "  CLIENT:SERVICE  USERS  SERVED  TASKS  RELEASE          STATE\n"
                      "  media:calls         2       4      1  after 30 s       active\n"
                      "  a:b                 0       4      1  in 12 s of 30 s  active\n"
                      "  :                   0       4      1  never            active\n"),
            std::string::npos)
      << text;
  EXPECT_NE(text.find("Storebags: 2\n"
                      "  NAME     VERSION   AGE  MAX AGE  STATE\n"
                      "  heather  7        12 s    600 s  Fetch Successful\n"
                      "  sorrel   -         1 s      0 s  Fetch Failure, there is none to serve\n"),
            std::string::npos)
      << text;
  EXPECT_NE(text.find("Active client types: 1\n  CLIENT TYPE  SESSIONS\n            9         5"), std::string::npos)
      << text;
}

TEST(StatusText, SaysWhenRowsWereLeftOut) {
  auto status = statusWith({session(1)});
  status.set("sessionCount", 1201);
  EXPECT_NE(statusText(status).find("Sessions: 1201\n"), std::string::npos);
  EXPECT_NE(statusText(status).find("  (1200 more not shown)\n"), std::string::npos);
  EXPECT_NE(statusTree(status).find("  (1200 more not shown)"), std::string::npos);
}

const char* const kHostileNames[] = {"\x1b[2J\x1b]0;owned\x07", "a\nSessions: 0\r", "\u009b31m", "\u202edrowssap\u2069",
                                     "\u2028new line",          "a\u200b\ufeffb",   "tab\tbed",  "\x7f\x08\x08"};

bool isHarmless(const std::string& text) {
  for (const char byte : text) {
    const auto number = static_cast<unsigned char>(byte);
    if ((number < 0x20 && byte != '\n') || number == 0x7F) return false;
  }
  for (const char* sign : {"\u009b", "\u202e", "\u2069", "\u2028", "\u200b", "\ufeff"}) {
    if (text.find(sign) != std::string::npos) return false;
  }
  return isUtf8(text);
}

TEST(StatusText, LetsNoNameSteerTheTerminalNorForgeALine) {
  for (const std::string name : kHostileNames) {
    const PropertyDictionary hostile =
        session(1, {{"clientName", name},
                    {"serviceName", name},
                    {"token", name},
                    {"clientType", name},
                    {"backends", PropertyArray{PropertyDictionary{{"name", name}, {"state", 2}}}}});
    auto status = statusWith({hostile});
    status.set("version", name);
    status.set("helpers", PropertyArray{PropertyDictionary{{"key", name}}});
    status.set("storebags", PropertyArray{PropertyDictionary{{"name", name}, {"version", name}, {"state", name}}});
    status.set("activeClients", PropertyDictionary{{name, name}});
    status.set("hierarchies", PropertyArray{PropertyDictionary{
                                  {"token", name}, {"sessionCount", 1}, {"sessions", PropertyArray{"id1"}}}});
    const auto text = statusText(status);
    EXPECT_TRUE(isHarmless(text)) << text;
    EXPECT_EQ(text.find("\nSessions: 0"), std::string::npos);
    EXPECT_TRUE(isHarmless(statusTree(status))) << statusTree(status);
  }
}

TEST(StatusText, KeepsColumnsReadableWhateverPeopleCallThemselves) {
  const auto text = statusText(statusWith({session(1, {{"clientName", std::string(200, 'x')}}),
                                           session(2, {{"clientName", "\u65e5\u672c\u8a9e"}}),
                                           session(3, {{"clientName", "e\u0301te\u0301"}})}));
  EXPECT_NE(text.find(std::string(39, 'x') + "\u2026  Calls"), std::string::npos) << text;
  EXPECT_NE(text.find("\u65e5\u672c\u8a9e" + std::string(34, ' ') + "  Calls"), std::string::npos) << text;
  EXPECT_NE(text.find("e\u0301te\u0301" + std::string(37, ' ') + "  Calls"), std::string::npos) << text;
}

TEST(StatusText, TakesAnotherVersionsStatusAsItIs) {
  EXPECT_NE(statusText({}).find("Sessions: 0"), std::string::npos);
  EXPECT_EQ(statusTree({}), "no sessions");
  const PropertyDictionary odd{{"sessions", PropertyArray{1, "two", PropertyDictionary{{"backends", 3}}}},
                               {"hierarchies", PropertyArray{4, PropertyDictionary{{"sessions", PropertyArray{5}}}}},
                               {"helpers", "none"},
                               {"storebags", PropertyDictionary()},
                               {"activeClients", 6}};
  EXPECT_NE(statusText(odd).find("  ID  TYPE"), std::string::npos);
  EXPECT_NE(statusTree(odd).find("session "), std::string::npos);
}

PropertyDictionary hierarchy(const char* token, const PropertyArray& identifiers) {
  return {{"token", token}, {"sessionCount", identifiers.size()}, {"sessions", identifiers}};
}

PropertyDictionary relative(int number, std::int64_t level) {
  return session(number, {{"token", "T"}, {"level", level}});
}

TEST(StatusTree, DrawsTheFirstOfALevelAsTheParentOfTheNext) {
  auto status = statusWith({relative(1, 0), relative(2, 1), relative(3, 2), relative(4, 1), session(5)});
  status.set("hierarchies", PropertyArray{hierarchy("T", {"id1", "id4", "id3", "id2"})});
  EXPECT_EQ(statusTree(status),
            "token T (4 sessions)\n"
            "  level 0: session 1, type 9, Media / Calls\n"
            "    level 1: session 4, type 9, Media / Calls\n"
            "      level 2: session 3, type 9, Media / Calls\n"
            "    level 1: session 2, type 9, Media / Calls\n"
            "without a hierarchy\n"
            "  session 5, type 9, Media / Calls");
}

TEST(StatusTree, TellsOfLevelsWithNobody) {
  auto status = statusWith({relative(1, 1), relative(2, 4'294'967'295), relative(3, 3)});
  status.set("hierarchies", PropertyArray{hierarchy("T", {"id1", "id2", "id3"})});
  EXPECT_EQ(statusTree(status),
            "token T (3 sessions)\n"
            "  (nobody at level 0)\n"
            "    level 1: session 1, type 9, Media / Calls\n"
            "      (nobody at level 2)\n"
            "        level 3: session 3, type 9, Media / Calls\n"
            "          (nobody at levels 4 to 4294967294)\n"
            "            level 4294967295: session 2, type 9, Media / Calls");
}

TEST(StatusTree, SaysWhatASessionIsAndHas) {
  auto status = statusWith({session(1, {{"token", "T"},
                                        {"hasAggregator", true},
                                        {"serviceName", nullptr},
                                        {"backends", PropertyArray{backend("splunk", 2, 2, 20)}}})});
  status.set("hierarchies", PropertyArray{hierarchy("T", {"id1"})});
  EXPECT_EQ(statusTree(status),
            "token T (1 session)\n"
            "  level 0: session 1, type 9, Media / -, aggregates: splunk enabled (2 events, 20 B)");
}

TEST(StatusTree, MovesNothingBeyondTheRightEdge) {
  PropertyArray sessions;
  PropertyArray identifiers;
  for (int level = 0; level < 500; ++level) {
    sessions.append(relative(level, level));
    identifiers.append("id" + std::to_string(level));
  }
  auto status = statusWith(sessions);
  status.set("hierarchies", PropertyArray{hierarchy("T", identifiers)});
  for (const auto line : split(statusTree(status), '\n')) EXPECT_LT(line.size(), 120U);
}

TEST(StatusTree, SaysWhichSessionsAreNotListed) {
  auto status = statusWith({relative(1, 0)});
  status.set("hierarchies", PropertyArray{hierarchy("T", {"id1", "id2", "id3"}), hierarchy("empty", {})});
  status.set("hierarchyCount", 5);
  EXPECT_EQ(statusTree(status),
            "token T (3 sessions)\n"
            "  level 0: session 1, type 9, Media / Calls\n"
            "  (2 more not shown)\n"
            "token empty (0 sessions)\n"
            "  (3 more not shown)");
}

}  // namespace
}  // namespace velk::ctl
