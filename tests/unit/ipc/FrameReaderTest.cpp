#include <fcntl.h>

#include "ipc/FrameReader.h"
#include "tests/unit/ipc/WireHarness.h"

namespace velk::ipc {
namespace {

using test::frameBytes;
using Bytes = std::vector<std::uint8_t>;

FileDescriptor someDescriptor() { return FileDescriptor(::open("/dev/null", O_RDONLY | O_CLOEXEC)); }

Bytes header(std::uint32_t length, std::uint8_t version, std::uint8_t kind, std::uint16_t descriptors,
             std::uint64_t serial) {
  Bytes bytes(kFrameHeaderBytes);
  writeFrameHeader({length, version, static_cast<FrameKind>(kind), descriptors, serial}, bytes.data());
  return bytes;
}

std::string faultOf(const Bytes& bytes) {
  FrameReader reader;
  FrameBatch batch;
  const char* fault = reader.consume(bytes, batch);
  return fault != nullptr ? fault : "";
}

TEST(FrameReader, CutsFramesWhereverTheBytesAreSplit) {
  Bytes stream = frameBytes(FrameKind::call, 7, {1, 2, 3});
  const auto second = frameBytes(FrameKind::reply, 8, {});
  const auto third = frameBytes(FrameKind::call, 0, Bytes(300, 9));
  stream.insert(stream.end(), second.begin(), second.end());
  stream.insert(stream.end(), third.begin(), third.end());
  for (std::size_t step = 1; step <= stream.size(); ++step) {
    FrameReader reader;
    FrameBatch batch;
    for (std::size_t at = 0; at < stream.size(); at += step) {
      ASSERT_EQ(reader.consume(std::span(stream).subspan(at, std::min(step, stream.size() - at)), batch), nullptr);
    }
    ASSERT_EQ(batch.frames.size(), 3U);
    EXPECT_EQ(batch.frames[0].header.serial, 7U);
    EXPECT_EQ(batch.body(batch.frames[0])[2], 3);
    EXPECT_EQ(batch.body(batch.frames[2]).size(), 300U);
    EXPECT_FALSE(reader.hasPartialFrame());
  }
}

TEST(FrameReader, FindsFaultsInTheHeaderBeforeTheBodyArrives) {
  EXPECT_EQ(faultOf(header(1, 2, 1, 0, 0)), "unknown protocol version");
  EXPECT_EQ(faultOf(header(1, 1, 0, 0, 0)), "unknown kind of frame");
  EXPECT_EQ(faultOf(header(1, 1, 5, 0, 0)), "unknown kind of frame");
  EXPECT_EQ(faultOf(header(kMaximumFrameBytes + 1, 1, 1, 0, 0)), "frame too large");
  EXPECT_EQ(faultOf(header(kMaximumFrameBytes, 1, 1, 0, 0)), "");
  EXPECT_EQ(faultOf(header(1, 1, 1, 5, 0)), "too many descriptors in a frame");
  EXPECT_EQ(faultOf(header(1, 1, 2, 1, 3)), "descriptors in a frame that takes none");
  EXPECT_EQ(faultOf(header(1, 1, 2, 0, 0)), "reply without a serial");
  EXPECT_EQ(faultOf(header(1, 1, 3, 0, 0)), "reply without a serial");
}

TEST(FrameReader, KeepsTheFramesBeforeAFault) {
  FrameReader reader;
  FrameBatch batch;
  Bytes stream = frameBytes(FrameKind::call, 7, {1});
  const auto bad = header(1, 9, 1, 0, 0);
  stream.insert(stream.end(), bad.begin(), bad.end());
  EXPECT_NE(reader.consume(stream, batch), nullptr);
  EXPECT_EQ(batch.frames.size(), 1U);
}

TEST(FrameReader, IgnoresWhatFollowsAGoodbye) {
  FrameReader reader;
  FrameBatch batch;
  Bytes stream = frameBytes(FrameKind::goodbye, 0, {});
  stream.resize(stream.size() + 40, 0xFF);
  EXPECT_EQ(reader.consume(stream, batch), nullptr);
  EXPECT_TRUE(reader.sawGoodbye());
  EXPECT_TRUE(batch.empty());
}

TEST(FrameReader, GivesEachFrameItsDescriptors) {
  FrameReader reader;
  FrameBatch batch;
  reader.arrivedDescriptors().push_back(someDescriptor());
  const auto stream = frameBytes(FrameKind::call, 0, {1}, 1);
  EXPECT_EQ(reader.consume(std::span(stream).first(5), batch), nullptr);
  EXPECT_EQ(reader.consume(std::span(stream).subspan(5), batch), nullptr);
  EXPECT_EQ(batch.descriptors.size(), 1U);
}

TEST(FrameReader, RefusesFewerOrMoreDescriptorsThanTheFrameSays) {
  EXPECT_EQ(faultOf(frameBytes(FrameKind::call, 0, {1}, 1)), "fewer descriptors than the frame says");
  FrameReader reader;
  FrameBatch batch;
  reader.arrivedDescriptors().push_back(someDescriptor());
  EXPECT_STREQ(reader.consume(frameBytes(FrameKind::call, 0, {1}), batch), "more descriptors than the frames say");
}

}  // namespace
}  // namespace velk::ipc
