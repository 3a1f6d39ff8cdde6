#include "foundation/DashboardDatagram.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <numeric>
#include <vector>

namespace velk::dashboard {
namespace {

std::vector<std::uint8_t> counted(std::size_t size) {
  std::vector<std::uint8_t> bytes(size);
  std::iota(bytes.begin(), bytes.end(), std::uint8_t{0});
  return bytes;
}

TEST(DashboardDatagram, ReadsEveryFieldFromItsPlace) {
  const auto bytes = counted(70);
  const auto header = readHeader(bytes);
  ASSERT_TRUE(header);
  EXPECT_EQ(header->majorVersion, 0);
  EXPECT_EQ(header->component, 1);
  EXPECT_EQ(header->fourMilliseconds, 3);
  EXPECT_EQ(header->seconds, 0x04050607U);
  EXPECT_EQ(header->sessionID, 0xF7F6F5F4U) << "0x08090A0B, complemented";
  EXPECT_EQ(header->clientVersion, 0xF3F2);
  EXPECT_EQ(header->length, 0xF1F0);
  EXPECT_EQ(header->method, 0x1011);
  EXPECT_EQ(header->respCode, 0x1213);
  EXPECT_TRUE(std::equal(header->deviceIdentifier.begin(), header->deviceIdentifier.end(), bytes.begin() + 20));
  EXPECT_EQ(header->eventNumber, 0x3C3D);
  EXPECT_EQ(header->flags, 0x3E3F);
}

TEST(DashboardDatagram, WritesWhatItReads) {
  auto bytes = counted(64);
  bytes[2] = 1;  // the one byte that is always the same
  std::vector<std::uint8_t> again(64, 0xEE);
  writeHeader(*readHeader(bytes), std::span(again).first<kHeaderBytes>());
  EXPECT_EQ(again, bytes);
}

TEST(DashboardDatagram, ReadsNoHeaderFromLess) {
  EXPECT_FALSE(readHeader({}));
  EXPECT_FALSE(readHeader(counted(63)));
  EXPECT_TRUE(readHeader(counted(64)));
}

TEST(DashboardDatagram, ReadsAcknowledgementsThatReachTheEventNumber) {
  EXPECT_FALSE(acknowledgedEventNumber({}));
  EXPECT_FALSE(acknowledgedEventNumber(counted(61)));
  EXPECT_EQ(acknowledgedEventNumber(counted(62)), 0x3C3D);
  EXPECT_EQ(acknowledgedEventNumber(counted(200)), 0x3C3D);
}

}  // namespace
}  // namespace velk::dashboard
