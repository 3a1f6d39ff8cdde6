// Datagram sockets without a network: they remember what was sent, and receive what the test lets arrive.
#pragma once

#include <deque>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "foundation/PropertyValue.h"
#include "platform/UdpSocket.h"

namespace velk::test {

/// For tests on one thread. The settings hold for all sockets, from the next call on.
class FakeUdpSockets : public UdpSocketService {
 public:
  struct ReadSourceParts;

  struct Arrival {
    bool isFailure = false;
    ByteData datagram;
  };

  /// What became of one socket. Stays when the socket has gone.
  struct Record {
    bool isOpen = true;
    bool isBound = false;
    std::string address;
    std::uint16_t port = 0;
    /// What left whole.
    std::vector<ByteData> sent;
    /// Called with each of them, after it was noted.
    std::function<void(const ByteData&)> onSent;
    std::deque<Arrival> arriving;
    std::weak_ptr<ReadSourceParts> source;

    [[nodiscard]] bool isRead() const { return !source.expired(); }
  };

  [[nodiscard]] Result<std::unique_ptr<UdpSocket>> makeSocket() override;

  /// In the order in which they were made.
  [[nodiscard]] std::size_t count() const { return _records.size(); }
  [[nodiscard]] Record& socket(std::size_t number) { return *_records.at(number); }
  [[nodiscard]] Record& last() { return *_records.back(); }
  [[nodiscard]] int openSockets() const;

  /// Lets a datagram arrive, or a failure, as of a port that refused; who reads the socket is told on his queue.
  static void deliver(Record& record, ByteData datagram);
  static void deliverFailure(Record& record);
  /// Tells who reads the socket that it cannot be watched after all.
  static void failReadSource(Record& record);

  // Error numbers; 0: it works.
  int makeError = 0;
  int bindError = 0;
  int connectError = 0;
  int sendError = 0;
  /// Sends one byte less than it was given.
  bool sendsShort = false;
  bool makesReadSources = true;

 private:
  std::vector<std::shared_ptr<Record>> _records;
};

}  // namespace velk::test
