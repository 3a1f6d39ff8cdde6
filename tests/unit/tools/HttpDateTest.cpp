#include "tools/collector/HttpDate.h"

#include <gtest/gtest.h>

namespace velk::collector {
namespace {

TEST(HttpDate, WritesTheFixedForm) {
  EXPECT_EQ(httpDate(784111777), "Sun, 06 Nov 1994 08:49:37 GMT");
  EXPECT_EQ(httpDate(0), "Thu, 01 Jan 1970 00:00:00 GMT");
  EXPECT_EQ(httpDate(-1), "Wed, 31 Dec 1969 23:59:59 GMT");
}

TEST(HttpDate, ReadsWhatItWrites) {
  for (const std::int64_t seconds : {0LL, 784111777LL, 1709164800LL, 4102444799LL}) {
    EXPECT_EQ(secondsFromHttpDate(httpDate(seconds)), seconds);
  }
}

TEST(HttpDate, RefusesEverythingElse) {
  for (const char* text : {"", "yesterday", "Sun, 06 Nov 1994 08:49:37 CET", "Sun, 06 Nov 1994 08:49:37 GMT ",
                           "Sun, 31 Feb 1994 08:49:37 GMT", "Sun, 06 Foo 1994 08:49:37 GMT",
                           "Sun, 06 Nov 1994 24:49:37 GMT", "Sun, -6 Nov 1994 08:49:37 GMT"}) {
    EXPECT_EQ(secondsFromHttpDate(text), std::nullopt) << text;
  }
}

}  // namespace
}  // namespace velk::collector
