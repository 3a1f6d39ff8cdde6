#include "tools/collector/Gzip.h"

#include <gtest/gtest.h>

#include "tests/unit/tools/Packing.h"

namespace velk::collector {
namespace {

using test::packed;

TEST(Gzip, UnpacksWhatWasPacked) {
  const std::string plain(100'000, 'x');
  const auto unpacked = unpackGzip(packed(plain), plain.size());
  ASSERT_TRUE(unpacked) << unpacked.error().description;
  EXPECT_EQ(*unpacked, plain);
}

TEST(Gzip, UnpacksAnEmptyBody) {
  const auto unpacked = unpackGzip(packed(""), 10);
  ASSERT_TRUE(unpacked);
  EXPECT_EQ(*unpacked, "");
}

TEST(Gzip, StopsABombAtTheBound) {
  const std::string bomb = packed(std::string(64 * 1024 * 1024, '\0'));
  ASSERT_LT(bomb.size(), 100'000u);
  const auto unpacked = unpackGzip(bomb, 1024 * 1024);
  ASSERT_FALSE(unpacked);
  EXPECT_EQ(unpacked.error().description, "the body unpacks to more than is taken");
}

TEST(Gzip, TakesExactlyTheBoundAndNotOneByteMore) {
  const std::string body = packed(std::string(50'000, 'a'));
  EXPECT_TRUE(unpackGzip(body, 50'000));
  EXPECT_FALSE(unpackGzip(body, 49'999));
}

TEST(Gzip, RefusesEveryTruncation) {
  const std::string whole = packed("{\"postTime\":1,\"clientId\":\"c\",\"events\":[]}");
  for (std::size_t length = 0; length < whole.size(); ++length) {
    EXPECT_FALSE(unpackGzip(std::string_view(whole).substr(0, length), 1000)) << length;
  }
}

TEST(Gzip, RefusesBytesAfterTheBody) { EXPECT_FALSE(unpackGzip(packed("abc") + "x", 1000)); }

TEST(Gzip, RefusesOtherForms) {
  EXPECT_FALSE(unpackGzip("hello", 1000));
  EXPECT_FALSE(unpackGzip(packed("hello", 15), 1000));
  EXPECT_FALSE(unpackGzip(packed("hello", -15), 1000));
}

TEST(Gzip, RefusesADamagedChecksum) {
  std::string body = packed("hello");
  body[body.size() - 5] = static_cast<char>(body[body.size() - 5] ^ 1);
  EXPECT_FALSE(unpackGzip(body, 1000));
}

}  // namespace
}  // namespace velk::collector
