// Two ends to test with: a real connection, and a bare socket that speaks bytes.
#pragma once

#include <dirent.h>
#include <gtest/gtest.h>

#include <deque>
#include <functional>
#include <string>
#include <vector>

#include "ipc/CborReader.h"
#include "ipc/Connection.h"
#include "ipc/FrameHeader.h"
#include "ipc/Limits.h"
#include "platform/Entitlements.h"
#include "platform/EventLoop.h"
#include "platform/LocalSocket.h"
#include "platform/Semaphore.h"

namespace velk::test {

inline constexpr auto kPatience = std::chrono::seconds(20);

inline std::size_t openDescriptors() {
  std::size_t count = 0;
  auto* directory = ::opendir("/proc/self/fd");
  while (::readdir(directory) != nullptr) ++count;
  ::closedir(directory);
  return count;
}

/// A condition that other threads bring about.
class Event {
 public:
  void happen() { _semaphore.signal(); }
  [[nodiscard]] bool wait() { return _semaphore.waitFor(kPatience); }

 private:
  Semaphore _semaphore;
};

/// Dispatches to a function.
class FunctionDispatcher final : public CallDispatcher {
 public:
  using Function = std::function<Result<void>(IncomingCall&)>;
  explicit FunctionDispatcher(Function function) : _function(std::move(function)) {}
  Result<void> dispatch(IncomingCall& call) override { return _function(call); }

 private:
  const Function _function;
};

inline constexpr auto encodeNothing = [](CborWriter&) {};

/// The bytes of a frame.
inline std::vector<std::uint8_t> frameBytes(ipc::FrameKind kind, std::uint64_t serial,
                                            const std::vector<std::uint8_t>& body, std::uint16_t descriptors = 0) {
  std::vector<std::uint8_t> bytes(ipc::kFrameHeaderBytes);
  ipc::writeFrameHeader({static_cast<std::uint32_t>(body.size()), ipc::kProtocolVersion, kind, descriptors, serial},
                        bytes.data());
  bytes.insert(bytes.end(), body.begin(), body.end());
  return bytes;
}

inline std::vector<std::uint8_t> body(std::size_t count, const std::function<void(CborWriter&)>& encode) {
  std::vector<std::uint8_t> bytes;
  CborWriter writer(bytes, ipc::kMaximumFrameBytes);
  writer.beginArray(count);
  encode(writer);
  return bytes;
}

/// The bytes of a call.
inline std::vector<std::uint8_t> callBytes(std::uint32_t method, std::uint64_t serial, const PropertyArray& arguments) {
  return frameBytes(ipc::FrameKind::call, serial, body(arguments.size() + 1, [&](CborWriter& writer) {
                      writer.unsignedInteger(method);
                      for (const auto& argument : arguments) writer.value(argument);
                    }));
}

/// The other end of a connection, in bytes. Blocks while it waits for them.
class RawPeer {
 public:
  struct Frame {
    ipc::FrameHeader header;
    PropertyValue body;
  };

  explicit RawPeer(FileDescriptor socket) : _socket(std::move(socket)) {}

  void send(const std::vector<std::uint8_t>& bytes, std::vector<FileDescriptor> descriptors = {}) {
    std::span<const std::uint8_t> rest(bytes);
    while (!rest.empty()) {
      const auto sent = sendToLocalSocket(_socket.get(), rest, descriptors);
      if (sent.status == Transfer::Status::failed) return;
      rest = rest.subspan(sent.bytes);
      if (sent.bytes != 0) descriptors.clear();
    }
  }
  /// What fits without waiting.
  std::size_t sendSome(std::span<const std::uint8_t> bytes) {
    return sendToLocalSocket(_socket.get(), bytes, {}).bytes;
  }

  /// The next frame, or nothing at the end.
  std::optional<Frame> receive() {
    if (!fill(ipc::kFrameHeaderBytes)) return std::nullopt;
    Frame received{ipc::readFrameHeader(_bytes.data()), nullptr};
    if (!fill(ipc::kFrameHeaderBytes + received.header.length)) return std::nullopt;
    if (received.header.length != 0) {
      CborReader reader(std::span<const std::uint8_t>(_bytes).subspan(ipc::kFrameHeaderBytes, received.header.length));
      EXPECT_TRUE(reader.readValue(received.body)) << reader.fault();
    }
    _bytes.erase(_bytes.begin(),
                 _bytes.begin() + static_cast<std::ptrdiff_t>(ipc::kFrameHeaderBytes + received.header.length));
    return received;
  }

  void hangUp() { _socket = FileDescriptor(); }
  [[nodiscard]] int descriptor() const { return _socket.get(); }
  std::vector<FileDescriptor> descriptors;

 private:
  bool fill(std::size_t size) {
    std::vector<std::uint8_t> buffer(4096);
    while (_bytes.size() < size) {
      const auto received = receiveFromLocalSocket(_socket.get(), buffer, descriptors);
      if (received.status == Transfer::Status::ended || received.status == Transfer::Status::failed) return false;
      if (received.status == Transfer::Status::wouldBlock) continue;
      _bytes.insert(_bytes.end(), buffer.begin(), buffer.begin() + static_cast<std::ptrdiff_t>(received.bytes));
    }
    return true;
  }

  FileDescriptor _socket;
  std::vector<std::uint8_t> _bytes;
};

/// A queue that runs its tasks when the test says so.
class HandQueue final : public Queue {
 public:
  [[nodiscard]] std::string_view label() const override { return "hand"; }
  void async(Task task) override {
    Guard guard(_lock);
    _tasks.push_back(std::move(task));
    _arrived.notifyAll();
  }
  void asyncAfter(Duration, Task task) override { async(std::move(task)); }
  [[nodiscard]] bool isCurrent() const override { return true; }

  /// Waits for a task and runs it. False when none comes.
  bool runOne() {
    Task task;
    {
      Guard guard(_lock);
      const auto deadline = std::chrono::steady_clock::now() + kPatience;
      while (_tasks.empty()) {
        if (!_arrived.waitUntil(_lock, deadline) && _tasks.empty()) return false;
      }
      task = std::move(_tasks.front());
      _tasks.pop_front();
    }
    task();
    return true;
  }
  /// Drops what was not run: such tasks keep connections, and those keep this queue.
  void dropTasks() {
    for (;;) {
      std::deque<Task> dropped;
      {
        Guard guard(_lock);
        dropped.swap(_tasks);
      }
      if (dropped.empty()) return;
    }
  }
  void runUntil(const std::function<bool()>& done) {
    while (!done()) {
      if (!runOne()) {
        ADD_FAILURE() << "nothing more to run";
        return;
      }
    }
  }

 protected:
  void runSync(void (*work)(void*), void* context) override { work(context); }

 private:
  Lock _lock;
  Condition _arrived;
  std::deque<Task> _tasks VELK_GUARDED_BY(_lock);
};

inline PeerCredentials self() {
  PeerCredentials peer;
  peer.uid = 1000;
  peer.pid = 345;
  return peer;
}

}  // namespace velk::test
