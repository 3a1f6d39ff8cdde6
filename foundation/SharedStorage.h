// Copy-on-write storage of the property containers. Private to foundation/.
#pragma once

#include <atomic>
#include <cstdint>
#include <utility>

namespace velk {

/// A reference-counted value that is shared by copies until one of them writes. Several threads may hold copies
/// and read them at once; one copy object is used by one thread at a time, as with any value.
template <class Value>
class SharedStorage {
 public:
  SharedStorage() noexcept = default;
  SharedStorage(const SharedStorage& other) noexcept : _node(other._node) {
    if (_node != nullptr) _node->references.fetch_add(1, std::memory_order_relaxed);
  }
  SharedStorage(SharedStorage&& other) noexcept : _node(std::exchange(other._node, nullptr)) {}
  SharedStorage& operator=(SharedStorage other) noexcept {
    std::swap(_node, other._node);
    return *this;
  }
  ~SharedStorage() {
    if (_node != nullptr && _node->references.fetch_sub(1, std::memory_order_acq_rel) == 1) delete _node;
  }

  /// The value, or null when nothing was ever written.
  [[nodiscard]] const Value* read() const noexcept { return _node != nullptr ? &_node->value : nullptr; }

  /// The value for writing: made when absent, copied first when another copy shares it.
  [[nodiscard]] Value& write() {
    if (_node == nullptr) {
      _node = new Node;
    } else if (_node->references.load(std::memory_order_acquire) != 1) {
      SharedStorage detached;
      detached._node = new Node(_node->value);
      std::swap(_node, detached._node);
    }
    return _node->value;
  }

  [[nodiscard]] bool sharesWith(const SharedStorage& other) const noexcept { return _node == other._node; }

 private:
  struct Node {
    Node() = default;
    explicit Node(const Value& from) : value(from) {}
    std::atomic<std::uint32_t> references{1};
    Value value;
  };

  Node* _node = nullptr;
};

}  // namespace velk
