#include "tools/collector/DashboardListener.h"

#include <array>
#include <asio/io_context.hpp>
#include <asio/ip/udp.hpp>
#include <asio/post.hpp>
#include <asio/steady_timer.hpp>
#include <chrono>
#include <deque>
#include <random>
#include <thread>
#include <utility>

namespace velk::collector {
namespace {

using asio::ip::udp;

/// What a link of tests holds back at most; what comes on top is lost, as on any link.
constexpr std::size_t kMostDelayed = 10'000;
/// One more than any sender fills, so that longer ones show.
constexpr std::size_t kReceiveBytes = dashboard::kMostDatagramBytes + 1;

class Listener final : public DashboardListener {
 public:
  Listener(const DashboardFaults& faults, Handler handler)
      : _faults(faults),
        _delay(std::chrono::duration_cast<std::chrono::steady_clock::duration>(
            std::chrono::duration<double>(faults.acknowledgementDelaySeconds))),
        _handler(std::move(handler)),
        _random(faults.seed) {}
  ~Listener() override { stop(); }

  [[nodiscard]] std::error_code open(const udp::endpoint& endpoint) {
    std::error_code error;
    _socket.open(endpoint.protocol(), error);
    if (!error) _socket.bind(endpoint, error);
    if (!error) _port = _socket.local_endpoint(error).port();
    return error;
  }

  [[nodiscard]] int port() const override { return _port; }

  void start() override {
    receive();
    _thread = std::thread([this] { _io.run(); });
  }

  void stop() override {
    if (!_thread.joinable()) return;
    _io.stop();
    _thread.join();
  }

 private:
  struct Acknowledgement {
    std::chrono::steady_clock::time_point due;
    udp::endpoint to;
    std::array<std::uint8_t, dashboard::kHeaderBytes> header;
  };

  void receive() {
    _socket.async_receive_from(asio::buffer(_buffer), _sender, [this](const std::error_code& error, std::size_t bytes) {
      if (error == asio::error::operation_aborted) return;
      // Other errors tell of an acknowledgement that nobody took.
      if (!error) take(std::span(_buffer).first(bytes));
      receive();
    });
  }

  void take(std::span<const std::uint8_t> bytes) {
    auto datagram = readDatagram(bytes);
    if (!datagram) return;
    datagram->fate = fateOf(datagram->header);
    _handler(*datagram);
    if (datagram->fate == DatagramFate::acknowledged) acknowledge(bytes);
  }

  DatagramFate fateOf(const dashboard::Header& header) {
    if (happens(_faults.drop)) return DatagramFate::dropped;
    if ((header.flags & dashboard::kFlagReliable) == 0) return DatagramFate::received;
    if (happens(_faults.dropAcknowledgements) || _delayed.size() >= kMostDelayed) return DatagramFate::unacknowledged;
    return DatagramFate::acknowledged;
  }

  bool happens(double fraction) {
    return fraction > 0 && std::uniform_real_distribution<double>(0, 1)(_random) < fraction;
  }

  void acknowledge(std::span<const std::uint8_t> datagram) {
    Acknowledgement acknowledgement{std::chrono::steady_clock::now() + _delay, _sender, {}};
    std::copy_n(datagram.begin(), dashboard::kHeaderBytes, acknowledgement.header.begin());
    if (_delay <= _delay.zero()) return send(acknowledgement);
    _delayed.push_back(acknowledgement);
    if (_delayed.size() == 1) wait();
  }

  /// All are delayed by the same time, so the first one is the next.
  void wait() {
    _timer.expires_at(_delayed.front().due);
    _timer.async_wait([this](const std::error_code& error) {
      if (error) return;
      const auto now = std::chrono::steady_clock::now();
      for (; !_delayed.empty() && _delayed.front().due <= now; _delayed.pop_front()) send(_delayed.front());
      if (!_delayed.empty()) wait();
    });
  }

  void send(const Acknowledgement& acknowledgement) {
    // One that cannot be sent is lost: its sender tries again.
    std::error_code ignored;
    _socket.send_to(asio::buffer(acknowledgement.header), acknowledgement.to, 0, ignored);
  }

  // Constant after opening.
  const DashboardFaults _faults;
  const std::chrono::steady_clock::duration _delay;
  const Handler _handler;
  int _port = 0;
  asio::io_context _io{1};

  // Used on the listener's thread only, once started.
  udp::socket _socket{_io};
  asio::steady_timer _timer{_io};
  udp::endpoint _sender;
  std::array<std::uint8_t, kReceiveBytes> _buffer{};
  std::deque<Acknowledgement> _delayed;
  std::mt19937_64 _random;

  // Of the one that starts and stops.
  std::thread _thread;
};

}  // namespace

std::string_view nameOf(DatagramFate fate) noexcept {
  switch (fate) {
    case DatagramFate::received:
      return "received";
    case DatagramFate::acknowledged:
      return "acknowledged";
    case DatagramFate::unacknowledged:
      return "unacknowledged";
    case DatagramFate::dropped:
      return "dropped";
  }
  return "";
}

std::optional<ReceivedDatagram> readDatagram(std::span<const std::uint8_t> bytes) {
  const auto header = dashboard::readHeader(bytes);
  if (!header || header->length != bytes.size() || bytes.size() > dashboard::kMostDatagramBytes) return std::nullopt;
  const auto text = bytes.subspan(dashboard::kHeaderBytes);
  return ReceivedDatagram{*header, std::string(text.begin(), text.end()), DatagramFate::received};
}

Result<std::unique_ptr<DashboardListener>> DashboardListener::open(const std::string& address, int port,
                                                                   const DashboardFaults& faults, Handler handler) {
  const auto cannot = [&](const std::string& why) {
    return failure("dashboard", 1,
                   "cannot listen for datagrams on " + address + " port " + std::to_string(port) + ": " + why);
  };
  std::error_code error;
  const auto number = asio::ip::make_address(address, error);
  if (error) return cannot("it takes an address of this machine in numbers");
  auto listener = std::make_unique<Listener>(faults, std::move(handler));
  error = listener->open({number, static_cast<std::uint16_t>(port)});
  if (error) return cannot(error.message());
  return listener;
}

}  // namespace velk::collector
