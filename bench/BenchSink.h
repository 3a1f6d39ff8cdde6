// The HTTPS server at the end of a measured pipeline: serves a signed storebag, takes posts, and does as little as it
// can with them while the clock runs. What arrived is counted afterwards.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/Lock.h"

namespace velk::bench {

/// One thread a connection. Lives as long as a measurement; made, asked and destroyed on one thread.
class BenchSink {
 public:
  /// Listens on a port of loopback's; writes the authority of its certificate to `caFile`.
  explicit BenchSink(const std::string& caFile);
  ~BenchSink();
  BenchSink(const BenchSink&) = delete;
  BenchSink& operator=(const BenchSink&) = delete;

  [[nodiscard]] std::string url(const std::string& path) const;
  /// Before the first request: the answer to every GET.
  void setStorebag(std::string envelope) { _storebag = std::move(envelope); }

  [[nodiscard]] std::uint64_t postCount() const { return _posts.load(); }
  /// Of posts: request heads and bodies, within the encryption.
  [[nodiscard]] std::uint64_t bytesReceived() const { return _bytes.load(); }
  [[nodiscard]] int connectionCount() const { return _connections.load(); }

  struct Counted {
    std::uint64_t events = 0;
    std::uint64_t duplicates = 0;
    std::uint64_t jsonBytes = 0;
    double lastArrival = 0;         ///< steadySeconds
    std::vector<double> latencies;  ///< seconds from an event's "sentAt" to the arrival of its post
  };
  /// Unzips what arrived so far and counts the sample events in it, each once.
  [[nodiscard]] Counted count() const;

  struct Server;  // BenchSink.cpp

 private:
  friend struct Server;
  struct Arrival {
    std::string body;
    bool isCompressed = false;
    double at = 0;
  };
  void take(Arrival arrival, std::size_t headBytes);

  std::string _storebag;  // constant once requests come
  std::atomic<std::uint64_t> _posts{0};
  std::atomic<std::uint64_t> _bytes{0};
  std::atomic<int> _connections{0};
  mutable Lock _lock;
  std::vector<Arrival> _arrivals VELK_GUARDED_BY(_lock);
  std::unique_ptr<Server> _server;  // last: its threads use everything above
};

}  // namespace velk::bench
