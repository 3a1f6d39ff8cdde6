#include "platform/UdpSocket.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "platform/FileDescriptor.h"
#include "platform/Semaphore.h"
#include "platform/ThreadPool.h"

namespace velk {
namespace {

using namespace std::chrono_literals;
constexpr Duration kPatience = 60s;

/// The other end: a plain socket on loopback.
class Peer {
 public:
  /// 0: any port.
  explicit Peer(std::uint16_t wanted = 0) : _socket(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(wanted);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    EXPECT_EQ(::bind(_socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
    socklen_t size = sizeof(address);
    EXPECT_EQ(::getsockname(_socket.get(), reinterpret_cast<sockaddr*>(&address), &size), 0);
    port = ntohs(address.sin_port);
    const timeval limit{60, 0};
    EXPECT_EQ(::setsockopt(_socket.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof(limit)), 0);
  }

  /// Waits for a datagram; "(none)" when there was none.
  std::string receive() {
    std::array<char, 2048> buffer{};
    socklen_t size = sizeof(_sender);
    const auto received =
        ::recvfrom(_socket.get(), buffer.data(), buffer.size(), 0, reinterpret_cast<sockaddr*>(&_sender), &size);
    return received < 0 ? "(none)" : std::string(buffer.data(), static_cast<std::size_t>(received));
  }
  /// To whom the last datagram came from.
  void answer(const std::string& text) {
    EXPECT_EQ(
        ::sendto(_socket.get(), text.data(), text.size(), 0, reinterpret_cast<sockaddr*>(&_sender), sizeof(_sender)),
        static_cast<ssize_t>(text.size()));
  }

  std::uint16_t port = 0;

 private:
  FileDescriptor _socket;
  sockaddr_in _sender{};
};

std::span<const std::uint8_t> bytesOf(const std::string& text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

std::size_t openDescriptors() {
  std::size_t count = 0;
  for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) ++count;
  return count;
}

/// Reads a socket until its end, and counts.
struct Reader {
  explicit Reader(UdpSocket& read) : socket(read) {}
  void start(const std::shared_ptr<Queue>& queue) {
    source = socket.makeReadSource(
        queue, [this] { readAll(); }, [this] { failed.signal(); });
  }
  void readAll() {
    std::array<std::uint8_t, 16> buffer{};
    for (;;) {
      const auto received = socket.receive(buffer);
      if (received.status == Transfer::Status::wouldBlock) return;
      if (received.status == Transfer::Status::failed) {
        lastError = received.error;
        ++failures;
      } else {
        lastText.assign(buffer.begin(), buffer.begin() + static_cast<std::ptrdiff_t>(received.bytes));
      }
      arrived.signal();
    }
  }
  UdpSocket& socket;
  std::unique_ptr<ReadSource> source;
  std::string lastText;
  int lastError = 0;
  std::atomic<int> failures{0};
  Semaphore arrived;
  Semaphore failed;
};

class UdpSocketTest : public ::testing::Test {
 protected:
  ~UdpSocketTest() override { pool->stop(); }

  std::unique_ptr<UdpSocket> connected(std::uint16_t port) {
    auto made = service->makeSocket();
    EXPECT_TRUE(made);
    EXPECT_EQ((*made)->connectTo("127.0.0.1", port), 0);
    return std::move(*made);
  }

  // The service outlives the queues.
  std::unique_ptr<UdpSocketService> service = makeUdpSocketService();
  std::unique_ptr<ThreadPool> pool = makeThreadPool();
  std::shared_ptr<Queue> queue = pool->makeSerialQueue("velk.test.network");
};

TEST_F(UdpSocketTest, SendsWholeDatagrams) {
  Peer peer;
  const auto socket = connected(peer.port);
  const auto sent = socket->send(bytesOf("hello"));
  EXPECT_EQ(sent.status, Transfer::Status::moved);
  EXPECT_EQ(sent.bytes, 5U);
  EXPECT_EQ(peer.receive(), "hello");
  EXPECT_EQ(socket->send(bytesOf(std::string(70'000, 'x'))).error, EMSGSIZE);
}

TEST_F(UdpSocketTest, TellsOnItsQueueWhatArrives) {
  Peer peer;
  const auto socket = connected(peer.port);
  Reader reader(*socket);
  reader.start(queue);
  ASSERT_TRUE(reader.source);
  for (const char* text : {"one", "two", ""}) {
    EXPECT_EQ(socket->send(bytesOf("ask")).status, Transfer::Status::moved);
    EXPECT_EQ(peer.receive(), "ask");
    peer.answer(text);
    ASSERT_TRUE(reader.arrived.waitFor(kPatience));
    queue->sync([&] { EXPECT_EQ(reader.lastText, text); });
  }
  queue->sync([&] { reader.source.reset(); });
}

TEST_F(UdpSocketTest, IsReadOnAfterARefusedPort) {
  std::uint16_t port = 0;
  {
    const Peer gone;
    port = gone.port;
  }
  const auto socket = connected(port);
  Reader reader(*socket);
  reader.start(queue);
  // A refusal shows once, in a send or in a receive; whichever it was, the socket goes on.
  for (int number = 0; number < 100 && reader.failures == 0; ++number) {
    static_cast<void>(socket->send(bytesOf("anybody?")));
    static_cast<void>(reader.arrived.waitFor(100ms));
  }
  EXPECT_GT(reader.failures, 0);
  queue->sync([&] { EXPECT_EQ(reader.lastError, ECONNREFUSED); });
  Peer peer(port);
  while (socket->send(bytesOf("ask")).status != Transfer::Status::moved) {
  }
  EXPECT_EQ(peer.receive(), "ask");
  peer.answer("here");
  for (bool answered = false; !answered;) {
    ASSERT_TRUE(reader.arrived.waitFor(kPatience));
    answered = queue->sync([&] { return reader.lastText == "here"; });
  }
  queue->sync([&] { reader.source.reset(); });
}

TEST_F(UdpSocketTest, TakesAnythingButADottedQuadForAllOnes) {
  for (const char* address : {"localhost", "127.1", "", "127.0.0.1 ", "::1", "256.0.0.1"}) {
    auto made = service->makeSocket();
    ASSERT_TRUE(made);
    EXPECT_EQ((*made)->connectTo(address, 9), EACCES) << address << ": no broadcast without leave";
  }
}

TEST_F(UdpSocketTest, ReceivesWhereItWasBound) {
  auto made = service->makeSocket();
  ASSERT_TRUE(made);
  EXPECT_EQ((*made)->bindToAnyPort(), 0);
  EXPECT_EQ((*made)->bindToAnyPort(), EINVAL);
  std::array<std::uint8_t, 16> buffer{};
  EXPECT_EQ((*made)->receive(buffer).status, Transfer::Status::wouldBlock);
}

TEST_F(UdpSocketTest, ClosedItFails) {
  Peer peer;
  const auto socket = connected(peer.port);
  socket->close();
  socket->close();
  std::array<std::uint8_t, 16> buffer{};
  EXPECT_EQ(socket->send(bytesOf("hello")).error, EBADF);
  EXPECT_EQ(socket->receive(buffer).error, EBADF);
  EXPECT_EQ(socket->bindToAnyPort(), EBADF);
  EXPECT_FALSE(socket->makeReadSource(
      queue, [] {}, [] {}));
}

TEST_F(UdpSocketTest, LeavesNoDescriptorBehind) {
  Peer peer;
  {
    // The threads and descriptors that the service and the pool keep.
    const auto warm = connected(peer.port);
    Reader reader(*warm);
    reader.start(queue);
    static_cast<void>(warm->send(bytesOf("ask")));
    EXPECT_EQ(peer.receive(), "ask");
    peer.answer("x");
    ASSERT_TRUE(reader.arrived.waitFor(kPatience));
    queue->sync([&] { reader.source.reset(); });
  }
  // Watches end on the loop's thread, a moment later.
  const auto settles = [](std::size_t bound) {
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (openDescriptors() > bound && std::chrono::steady_clock::now() < deadline) std::this_thread::yield();
    return openDescriptors();
  };
  // The first source's descriptor among them, if its watch has not ended yet: one more never hurts the comparison.
  const auto start = openDescriptors();
  for (int number = 0; number < 200; ++number) {
    const auto socket = connected(peer.port);
    Reader reader(*socket);
    reader.start(queue);
    queue->sync([&] { reader.source.reset(); });
  }
  EXPECT_LE(settles(start), start);
}

TEST_F(UdpSocketTest, ASourceMayEndInItsOwnHandler) {
  Peer peer;
  const auto socket = connected(peer.port);
  std::unique_ptr<ReadSource> source;
  Semaphore ended;
  std::atomic<int> calls{0};
  queue->sync([&] {
    source = socket->makeReadSource(
        queue,
        [&] {
          ++calls;
          source.reset();
          ended.signal();
        },
        [] {});
  });
  static_cast<void>(socket->send(bytesOf("ask")));
  EXPECT_EQ(peer.receive(), "ask");
  peer.answer("x");
  peer.answer("y");
  ASSERT_TRUE(ended.waitFor(kPatience));
  queue->sync([] {});
  EXPECT_EQ(calls, 1);
}

}  // namespace
}  // namespace velk
