#include "backends/Compression.h"

#include <string>

#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {
namespace {

std::span<const std::uint8_t> bytes(const std::string& text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

std::uint8_t byteAt(const std::string& text, std::size_t at) { return static_cast<std::uint8_t>(text.at(at)); }

TEST(Compression, RefusesEmptyInput) {
  RecordingLog log;
  EXPECT_FALSE(compressDataWithZlibOrGzip(true, {}));
  EXPECT_FALSE(gzipDeflate(std::string_view()));
  EXPECT_EQ(log.count(log::Level::standard, "compressDataWithZlibOrGzip: Cannot compress empty ByteBuffer"), 2);
}

TEST(Compression, MakesAWholeGzipMemberOfOneByte) {
  const auto member = gzipDeflate(std::string_view("x"));
  ASSERT_TRUE(member);
  EXPECT_EQ(byteAt(*member, 0), 0x1f);
  EXPECT_EQ(byteAt(*member, 1), 0x8b);
  EXPECT_EQ(byteAt(*member, 2), 8);
  // CRC-32 of "x" and the length, little-endian.
  const std::string trailer = member->substr(member->size() - 8);
  EXPECT_EQ(trailer, std::string("\x83\x16\xdc\x8c\x01\x00\x00\x00", 8));
  EXPECT_EQ(inflated(*member), "x");
}

TEST(Compression, WritesAZlibHeaderWithoutTheGzipFlag) {
  const auto stream = compressDataWithZlibOrGzip(false, bytes("hello hello hello"));
  ASSERT_TRUE(stream);
  EXPECT_EQ(byteAt(*stream, 0), 0x78);
  EXPECT_EQ(inflated(*stream), "hello hello hello");
}

TEST(Compression, SaysHowMuchItSaved) {
  RecordingLog log;
  const std::string input(100'000, 'a');
  const auto member = gzipDeflate(input);
  ASSERT_TRUE(member);
  EXPECT_LT(member->size(), 1000U);
  EXPECT_EQ(inflated(*member), input);
  EXPECT_EQ(log.count(log::Level::standard, formatText("compressDataWithZlibOrGzip: Compressed file from %u to %u",
                                                       {input.size(), member->size()})),
            1);
}

TEST(Compression, SurvivesInputThatCannotShrink) {
  std::string noise;
  std::uint32_t state = 1;
  for (int at = 0; at < 70'000; ++at) {
    state = state * 1'664'525 + 1'013'904'223;
    noise.push_back(static_cast<char>(state >> 24));
  }
  const auto member = gzipDeflate(noise);
  ASSERT_TRUE(member);
  EXPECT_EQ(inflated(*member), noise);
}

TEST(Compression, NamesTheResultsOfSettingUp) {
  const char* unknown = "Unknown error code.";
  EXPECT_STREQ(deflateSetupErrorText(-6), "The version of zlib.h and the version of the library linked do not match.");
  EXPECT_STREQ(deflateSetupErrorText(-4), "Insufficient memory.");
  EXPECT_STREQ(deflateSetupErrorText(-2), "Invalid parameter passed in to function.");
  for (const int code : {-5, -3, -1, 7}) EXPECT_STREQ(deflateSetupErrorText(code), unknown);
}

TEST(Compression, NamesTheResultsOfCompressing) {
  EXPECT_STREQ(deflateErrorText(-6), "The version of zlib.h and the version of the library linked do not match.");
  EXPECT_STREQ(deflateErrorText(-5), "Ran out of output buffer for writing compressed bytes.");
  EXPECT_STREQ(deflateErrorText(-4), "Memory could not be allocated for processing.");
  EXPECT_STREQ(deflateErrorText(-3), "The deflate data was invalid or incomplete.");
  EXPECT_STREQ(deflateErrorText(-2), "The stream state was inconsistent (e.g., next_in or next_out was NULL).");
  EXPECT_STREQ(deflateErrorText(-1), "Error occured while reading file.");
  EXPECT_STREQ(deflateErrorText(42), "Unknown error code.");
}

}  // namespace
}  // namespace velk::test
