// What becomes of events that no daemon has been handed yet when the connection they wait in is lost or full.

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>

#include <atomic>
#include <cstdlib>
#include <numeric>
#include <thread>

#include "ipc/CborReader.h"
#include "ipc/FrameHeader.h"
#include "ipc/MethodTable.h"
#include "platform/LocalSocket.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

constexpr int kEvents = 3000;
constexpr int kPollPatience = 30'000;  // milliseconds

/// Takes one connection and reads nothing of it, until it has had enough.
class SilentDaemon {
 public:
  SilentDaemon() : _listening(std::move(bindLocalSocket(std::getenv("VELKREPORTING_SOCKET"), "test").value())) {}

  void accept() {
    ASSERT_TRUE(waitFor(_listening.socket.get()));
    _accepted = FileDescriptor(::accept4(_listening.socket.get(), nullptr, nullptr, SOCK_CLOEXEC));
    ASSERT_TRUE(_accepted);
  }
  /// Waits until the client's events are on their way.
  void waitForBytes() { ASSERT_TRUE(waitFor(_accepted.get())); }
  /// From here on nothing more gets into the socket: the numbers of the events that are in it, whole.
  std::vector<int> takeWhatLeft() {
    ::shutdown(_accepted.get(), SHUT_RD);
    std::vector<std::uint8_t> bytes;
    std::vector<std::uint8_t> part(65'536);
    for (ssize_t count = 1; count > 0;) {
      count = ::recv(_accepted.get(), part.data(), part.size(), 0);
      if (count > 0) bytes.insert(bytes.end(), part.begin(), part.begin() + count);
    }
    return numbersIn(bytes);
  }

 private:
  static bool waitFor(int descriptor) {
    pollfd waiting{descriptor, POLLIN, 0};
    return ::poll(&waiting, 1, kPollPatience) == 1;
  }
  static std::vector<int> numbersIn(std::span<const std::uint8_t> bytes) {
    std::vector<int> numbers;
    while (bytes.size() >= ipc::kFrameHeaderBytes) {
      const auto header = ipc::readFrameHeader(bytes.data());
      if (bytes.size() < ipc::kFrameHeaderBytes + header.length) break;
      CborReader reader(bytes.subspan(ipc::kFrameHeaderBytes, header.length));
      bytes = bytes.subspan(ipc::kFrameHeaderBytes + header.length);
      std::size_t count = 0;
      std::uint64_t method = 0;
      PropertyValue message;
      EXPECT_TRUE(reader.readArrayHead(count) && reader.readUnsigned(method));
      if (method != static_cast<std::uint64_t>(Method::sendMessageWithDictionary)) continue;
      EXPECT_TRUE(reader.readValue(message));
      numbers.push_back(static_cast<int>(integerValue(message.dictionary()->find("ParametersType"))));
    }
    return numbers;
  }

  const BoundLocalSocket _listening;
  FileDescriptor _accepted;
};

/// The events that the log tells the loss of.
struct Losses : log::Sink {
  void write(log::Level, std::string_view line) override {
    constexpr std::string_view kBegin = "aboutToDealloc: ";
    if (!line.starts_with(kBegin) || line.find("events are lost") == std::string_view::npos) return;
    events += std::stoul(std::string(line.substr(kBegin.size())));
    told.signal();
  }
  std::atomic<std::size_t> events{0};
  Semaphore told;
};

class UnsentEventsTest : public VelkReportingTest {
 protected:
  /// More than a connection and the system's buffer hold.
  static void sendMany(VelkReporting& client) {
    const PropertyDictionary payload{{"text", std::string(1000, 'x')}};
    for (int number = 0; number < kEvents; ++number) {
      EXPECT_TRUE(client.sendMessageWithDictionary(
          {{"ParametersCategory", 1}, {"ParametersType", number}, {"ParametersPayload", payload}}));
    }
  }
  [[nodiscard]] std::vector<int> arrived() const {
    std::vector<int> numbers;
    for (const auto& call : _daemon.calls()) {
      if (call.method != "sendMessageWithDictionary") continue;
      numbers.push_back(static_cast<int>(integerValue(call.arguments[0].dictionary()->find("ParametersType"))));
    }
    return numbers;
  }
  static std::vector<int> allNumbers() {
    std::vector<int> numbers(kEvents);
    std::iota(numbers.begin(), numbers.end(), 0);
    return numbers;
  }
};

TEST_F(UnsentEventsTest, GoToTheNextDaemonInTheirOrder) {
  auto silent = std::make_unique<SilentDaemon>();
  const auto client = makeClient();
  silent->accept();
  sendMany(*client);
  silent->waitForBytes();
  auto numbers = silent->takeWhatLeft();
  silent.reset();
  _daemon.start();
  ASSERT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", kEvents - numbers.size()));
  EXPECT_FALSE(flush(*client)) << "nothing comes behind them";
  const auto later = arrived();
  numbers.insert(numbers.end(), later.begin(), later.end());
  EXPECT_EQ(numbers, allNumbers());
}

TEST_F(UnsentEventsTest, GoToADaemonThatComesBackDuringTheLastRelease) {
  auto silent = std::make_unique<SilentDaemon>();
  auto client = makeClient();
  client->setEndOfLifeBound(std::chrono::minutes(1));
  silent->accept();
  sendMany(*client);
  silent->waitForBytes();
  std::thread releasing([&] { client.reset(); });
  auto numbers = silent->takeWhatLeft();
  silent.reset();
  _daemon.start();
  releasing.join();
  EXPECT_TRUE(_daemon.waitForCalls("finishSessionGracefully", 1));
  const auto later = arrived();
  numbers.insert(numbers.end(), later.begin(), later.end());
  EXPECT_EQ(numbers, allNumbers());
  EXPECT_FALSE(_log.contains("events are lost"));
}

TEST_F(UnsentEventsTest, AreCountedWhenTheirClientEndsBeforeTheyLeave) {
  const auto losses = std::make_shared<Losses>();
  log::setSink(losses);
  SilentDaemon silent;
  auto client = makeClient();
  client->setEndOfLifeBound(std::chrono::milliseconds(0));
  silent.accept();
  sendMany(*client);
  client.reset();
  ASSERT_TRUE(losses->told.waitFor(kPatience)) << "of what had no room in the connection";
  ASSERT_TRUE(losses->told.waitFor(kPatience)) << "of what was in it";
  EXPECT_EQ(losses->events, kEvents - silent.takeWhatLeft().size());
}

TEST_F(UnsentEventsTest, AreFollowedByACallThatFillsAFrame) {
  _daemon.start();
  const auto client = makeClient();
  EXPECT_FALSE(flush(*client));
  _daemon.holdCalls(true);
  sendMany(*client);
  const std::string large(900'000, 'y');
  client->updateSharedDataWithDictionary({{"large", large}});
  auto answered = std::make_shared<Semaphore>();
  EXPECT_TRUE(client->uploadDataArray(PropertyArray{PropertyDictionary{{"LogData", large}}},
                                      [answered](bool, const std::optional<Error>&) { answered->signal(); }));
  _daemon.holdCalls(false);
  EXPECT_TRUE(answered->waitFor(kPatience));
  EXPECT_EQ(_daemon.count("updateSharedDataWithDictionary"), 1U);
  EXPECT_EQ(arrived(), allNumbers());
  EXPECT_FALSE(_log.contains("Failed to get remote object proxy"));
}

}  // namespace
}  // namespace velk::test
