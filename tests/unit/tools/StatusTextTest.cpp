#include "tools/ctl/StatusText.h"

#include <gtest/gtest.h>

namespace velk::ctl {
namespace {

TEST(StatusText, ShowsValuesListsAndDictionaries) {
  const PropertyDictionary status{
      {"keepAliveCount", 2},
      {"sessions", PropertyArray{PropertyDictionary{{"number", 7}, {"clientType", 5}}, "odd"}},
      {"storebags", PropertyArray()},
      {"activeClients", PropertyDictionary{{"5", 1}}},
  };
  EXPECT_EQ(statusText(status),
            "Keep alive count: 2\n"
            "Sessions: 2\n  number 7, clientType 5\n  odd\n"
            "Storebags: 0\n"
            "Active clients: 5 1");
}

TEST(StatusText, LetsNobodySteerTheTerminal) {
  EXPECT_EQ(statusText({{"a", "\x1b[2J\n"}}).find('\x1b'), std::string::npos);
}

TEST(StatusText, IsEmptyForNothing) { EXPECT_EQ(statusText({}), ""); }

}  // namespace
}  // namespace velk::ctl
