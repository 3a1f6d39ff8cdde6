#include "tools/collector/DashboardListener.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <asio/io_context.hpp>
#include <asio/ip/udp.hpp>
#include <chrono>
#include <string>
#include <thread>
#include <vector>

#include "platform/Lock.h"

namespace velk::collector {
namespace {

using asio::ip::udp;
using Bytes = std::vector<std::uint8_t>;

Bytes datagram(std::uint16_t eventNumber, std::uint16_t flags, const std::string& text = " a=1") {
  dashboard::Header header;
  header.length = static_cast<std::uint16_t>(64 + text.size());
  header.eventNumber = eventNumber;
  header.flags = flags;
  Bytes bytes(64);
  dashboard::writeHeader(header, std::span(bytes).first<64>());
  bytes.insert(bytes.end(), text.begin(), text.end());
  return bytes;
}

/// A listener, and a sender that waits for its acknowledgements.
class DashboardListenerTest : public ::testing::Test {
 protected:
  void open(const DashboardFaults& faults = {}) {
    auto opened = DashboardListener::open("127.0.0.1", 0, faults, [this](const ReceivedDatagram& received) {
      Guard guard(_lock);
      _received.push_back(received);
      _changed.notifyAll();
    });
    ASSERT_TRUE(opened) << opened.error().description;
    listener = std::move(*opened);
    listener->start();
    _sender.open(udp::v4());
    _sender.connect({asio::ip::make_address("127.0.0.1"), static_cast<std::uint16_t>(listener->port())});
  }
  ~DashboardListenerTest() override {
    if (listener) listener->stop();
  }

  void send(const Bytes& bytes) { EXPECT_EQ(_sender.send(asio::buffer(bytes)), bytes.size()); }
  /// Waits for an acknowledgement.
  Bytes acknowledgement() {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    while (!hasAcknowledgement() && std::chrono::steady_clock::now() < deadline) std::this_thread::yield();
    Bytes bytes(2000);
    bytes.resize(hasAcknowledgement() ? _sender.receive(asio::buffer(bytes)) : 0);
    bytes.resize(std::max<std::size_t>(bytes.size(), 62));
    return bytes;
  }
  [[nodiscard]] bool hasAcknowledgement() { return _sender.available() > 0; }
  /// The fates of all that was received, once there are that many.
  std::string fates(std::size_t count) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    Guard guard(_lock);
    while (_received.size() < count) {
      if (!_changed.waitUntil(_lock, deadline)) break;
    }
    std::string letters;
    for (const auto& each : _received) letters += nameOf(each.fate).front();
    return letters;
  }
  std::vector<ReceivedDatagram> received() {
    Guard guard(_lock);
    return _received;
  }

  std::unique_ptr<DashboardListener> listener;

 private:
  Lock _lock;
  Condition _changed;
  std::vector<ReceivedDatagram> _received VELK_GUARDED_BY(_lock);
  asio::io_context _io;
  udp::socket _sender{_io};
};

TEST_F(DashboardListenerTest, SendsTheHeaderBack) {
  open();
  const Bytes sent = datagram(513, 1);
  send(sent);
  EXPECT_EQ(acknowledgement(), Bytes(sent.begin(), sent.begin() + 64));
  EXPECT_EQ(fates(1), "a");
  EXPECT_EQ(received()[0].header.eventNumber, 513);
  EXPECT_EQ(received()[0].text, " a=1");
}

TEST_F(DashboardListenerTest, AcknowledgesNothingThatNobodyWaitsFor) {
  open();
  send(datagram(1, 0));
  send(datagram(2, 2));
  EXPECT_EQ(fates(2), "rr");
  send(datagram(3, 3));
  const Bytes last = acknowledgement();
  EXPECT_EQ(last[61], 3);
  EXPECT_FALSE(hasAcknowledgement());
}

TEST_F(DashboardListenerTest, PassesOverWhatIsNoDatagram) {
  open();
  send({});
  send(Bytes(63));
  Bytes cut = datagram(1, 1);
  cut.pop_back();
  send(cut);
  Bytes longer = datagram(2, 1);
  longer.push_back('x');
  send(longer);
  send(datagram(3, 1, std::string(1024, 'x')));
  send(datagram(4, 1, std::string(1023, 'x')));
  EXPECT_EQ(fates(1), "a");
  EXPECT_EQ(received()[0].header.eventNumber, 4);
}

TEST_F(DashboardListenerTest, LosesEverythingWhenTold) {
  DashboardFaults faults;
  faults.drop = 1;
  open(faults);
  for (std::uint16_t number = 0; number < 5; ++number) send(datagram(number, 1));
  EXPECT_EQ(fates(5), "ddddd");
  EXPECT_FALSE(hasAcknowledgement());
}

TEST_F(DashboardListenerTest, LosesAcknowledgementsWhenTold) {
  DashboardFaults faults;
  faults.dropAcknowledgements = 1;
  open(faults);
  for (std::uint16_t number = 0; number < 5; ++number) send(datagram(number, 1));
  EXPECT_EQ(fates(5), "uuuuu");
  EXPECT_FALSE(hasAcknowledgement());
}

/// The losses of a link with that seed, in order of arrival.
class SeededLosses : public DashboardListenerTest {
 protected:
  void TestBody() override {}

 public:
  std::string with(std::uint64_t seed) {
    DashboardFaults faults;
    faults.drop = 0.3;
    faults.dropAcknowledgements = 0.3;
    faults.seed = seed;
    open(faults);
    for (std::uint16_t number = 0; number < 100; ++number) send(datagram(number, 1));
    return fates(100);
  }
};

TEST(DashboardListenerLosses, FollowFromTheirSeed) {
  const auto losses = SeededLosses().with(7);
  ASSERT_EQ(losses.size(), 100U);
  EXPECT_EQ(SeededLosses().with(7), losses);
  EXPECT_NE(SeededLosses().with(8), losses);
  EXPECT_GT(std::count(losses.begin(), losses.end(), 'd'), 10);
  EXPECT_GT(std::count(losses.begin(), losses.end(), 'u'), 5);
  EXPECT_GT(std::count(losses.begin(), losses.end(), 'a'), 20);
}

TEST_F(DashboardListenerTest, DelaysAcknowledgementsWhenTold) {
  DashboardFaults faults;
  faults.acknowledgementDelaySeconds = 0.1;
  open(faults);
  const auto start = std::chrono::steady_clock::now();
  for (std::uint16_t number = 0; number < 3; ++number) send(datagram(number, 1));
  for (std::uint8_t number = 0; number < 3; ++number) EXPECT_EQ(acknowledgement()[61], number);
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(100));
}

TEST_F(DashboardListenerTest, StopsWithAcknowledgementsStillDelayed) {
  DashboardFaults faults;
  faults.acknowledgementDelaySeconds = 3600;
  open(faults);
  send(datagram(1, 1));
  EXPECT_EQ(fates(1), "a");
  listener->stop();
  listener->stop();
  EXPECT_FALSE(hasAcknowledgement());
}

TEST(DashboardListenerAddress, MustBeANumberOfThisMachine) {
  for (const char* address : {"localhost", "", "192.0.2.1"}) {
    const auto opened = DashboardListener::open(address, 0, {}, [](const ReceivedDatagram&) {});
    ASSERT_FALSE(opened) << address;
    EXPECT_NE(opened.error().description.find("cannot listen for datagrams on "), std::string::npos);
  }
  EXPECT_TRUE(DashboardListener::open("127.0.0.1", 0, {}, [](const ReceivedDatagram&) {}));
}

}  // namespace
}  // namespace velk::collector
