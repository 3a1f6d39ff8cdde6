#include "tools/collector/DigestKey.h"

#include <gtest/gtest.h>

#include "tests/support/TemporaryDirectory.h"

namespace velk::collector {
namespace {

// RFC 2202, test case 2.
const ByteData kKey = {'J', 'e', 'f', 'e'};
constexpr const char* kText = "what do ya want for nothing?";
const std::string kDigest = "effcdf6ae5eb2fa2d27416d5f184df9c259a7c79";

TEST(DigestKey, AcceptsTheRightDigest) { EXPECT_TRUE(checkDigest(kKey, kText, &kDigest)); }

TEST(DigestKey, RefusesAnotherDigestAnotherFormAndNone) {
  const std::string upper = "EFFCDF6AE5EB2FA2D27416D5F184DF9C259A7C79";
  const std::string other = "effcdf6ae5eb2fa2d27416d5f184df9c259a7c78";
  const std::string longer = kDigest + " ";
  const std::string empty;
  EXPECT_FALSE(checkDigest(kKey, kText, &upper));
  EXPECT_FALSE(checkDigest(kKey, kText, &other));
  EXPECT_FALSE(checkDigest(kKey, kText, &longer));
  EXPECT_FALSE(checkDigest(kKey, kText, &empty));
  EXPECT_FALSE(checkDigest(kKey, kText, nullptr));
}

TEST(DigestKey, TakesHexadecimalDigits) {
  const auto key = digestKeyFromArgument("4a656Fff");
  ASSERT_TRUE(key);
  EXPECT_EQ(*key, (ByteData{0x4a, 0x65, 0x6f, 0xff}));
}

TEST(DigestKey, TakesTheBytesOfAFile) {
  const test::TemporaryDirectory directory;
  const auto key = digestKeyFromArgument(directory.write("key", "Jefe"));
  ASSERT_TRUE(key) << key.error().description;
  EXPECT_EQ(*key, kKey);
}

TEST(DigestKey, RefusesAnEmptyOrMissingFile) {
  const test::TemporaryDirectory directory;
  EXPECT_FALSE(digestKeyFromArgument(directory.write("empty", "")));
  EXPECT_FALSE(digestKeyFromArgument(directory.path() + "/none"));
}

}  // namespace
}  // namespace velk::collector
