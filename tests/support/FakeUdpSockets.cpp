#include "tests/support/FakeUdpSockets.h"

#include <algorithm>
#include <cerrno>

namespace velk::test {

struct FakeUdpSockets::ReadSourceParts {
  std::shared_ptr<Queue> queue;
  Task readable;
  Task failed;
};

namespace {

using Record = FakeUdpSockets::Record;

class FakeReadSource final : public ReadSource {
 public:
  explicit FakeReadSource(std::shared_ptr<FakeUdpSockets::ReadSourceParts> parts) : _parts(std::move(parts)) {}

 private:
  const std::shared_ptr<FakeUdpSockets::ReadSourceParts> _parts;
};

class FakeUdpSocket final : public UdpSocket {
 public:
  FakeUdpSocket(FakeUdpSockets& service, std::shared_ptr<Record> record)
      : _service(service), _record(std::move(record)) {}
  ~FakeUdpSocket() override { close(); }

  int bindToAnyPort() override {
    _record->isBound = _service.bindError == 0;
    return _service.bindError;
  }

  int connectTo(std::string_view address, std::uint16_t port) override {
    _record->address = address;
    _record->port = port;
    return _service.connectError;
  }

  Transfer send(std::span<const std::uint8_t> datagram) override {
    if (!_record->isOpen) return {Transfer::Status::failed, 0, EBADF};
    if (_service.sendError != 0) return {Transfer::Status::failed, 0, _service.sendError};
    if (_service.sendsShort) return {Transfer::Status::moved, datagram.size() - 1, 0};
    _record->sent.emplace_back(datagram.begin(), datagram.end());
    if (_record->onSent) _record->onSent(_record->sent.back());
    return {Transfer::Status::moved, datagram.size(), 0};
  }

  Transfer receive(std::span<std::uint8_t> buffer) override {
    if (!_record->isOpen) return {Transfer::Status::failed, 0, EBADF};
    if (_record->arriving.empty()) return {Transfer::Status::wouldBlock, 0, 0};
    const FakeUdpSockets::Arrival arrival = std::move(_record->arriving.front());
    _record->arriving.pop_front();
    if (arrival.isFailure) return {Transfer::Status::failed, 0, ECONNREFUSED};
    const auto size = std::min(arrival.datagram.size(), buffer.size());
    std::copy_n(arrival.datagram.begin(), size, buffer.begin());
    return {Transfer::Status::moved, size, 0};
  }

  std::unique_ptr<ReadSource> makeReadSource(std::shared_ptr<Queue> queue, Task readable, Task failed) override {
    if (!_service.makesReadSources) return nullptr;
    auto parts = std::make_shared<FakeUdpSockets::ReadSourceParts>();
    parts->queue = std::move(queue);
    parts->readable = std::move(readable);
    parts->failed = std::move(failed);
    _record->source = parts;
    return std::make_unique<FakeReadSource>(std::move(parts));
  }

  void close() override { _record->isOpen = false; }

 private:
  FakeUdpSockets& _service;
  const std::shared_ptr<Record> _record;
};

void tell(Record& record) {
  const auto parts = record.source.lock();
  if (!parts) return;
  parts->queue->async([&record] {
    const auto current = record.source.lock();
    if (!current || record.arriving.empty()) return;
    current->readable();
    if (!record.arriving.empty()) tell(record);
  });
}

}  // namespace

Result<std::unique_ptr<UdpSocket>> FakeUdpSockets::makeSocket() {
  if (makeError != 0) return failure(kUdpSocketErrorDomain, makeError, "no socket");
  _records.push_back(std::make_shared<Record>());
  return std::make_unique<FakeUdpSocket>(*this, _records.back());
}

int FakeUdpSockets::openSockets() const {
  return static_cast<int>(
      std::count_if(_records.begin(), _records.end(), [](const auto& record) { return record->isOpen; }));
}

void FakeUdpSockets::deliver(Record& record, ByteData datagram) {
  record.arriving.push_back({false, std::move(datagram)});
  tell(record);
}

void FakeUdpSockets::deliverFailure(Record& record) {
  record.arriving.push_back({true, {}});
  tell(record);
}

void FakeUdpSockets::failReadSource(Record& record) {
  const auto parts = record.source.lock();
  if (!parts) return;
  parts->queue->async([parts] { parts->failed(); });
}

}  // namespace velk::test
