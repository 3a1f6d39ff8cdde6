// A move-only callable, for work that owns what it needs (descriptors, completions, buffers).
// Used by every queue and callback of the system. Not synchronised: one thread at a time.
#pragma once

#include <cstddef>
#include <new>
#include <type_traits>
#include <utility>

namespace velk {

template <class Signature>
class UniqueFunction;

/// Owns a callable of the given signature. Callables of up to six pointers live inside the object, so that
/// handing over ordinary work allocates nothing of its own. Calling an empty function is a programming error.
template <class Result, class... Arguments>
class UniqueFunction<Result(Arguments...)> {
 public:
  UniqueFunction() noexcept = default;
  UniqueFunction(std::nullptr_t) noexcept {}

  template <class Callable, class Stored = std::decay_t<Callable>,
            class = std::enable_if_t<!std::is_same_v<Stored, UniqueFunction> &&
                                     std::is_invocable_r_v<Result, Stored&, Arguments...>>>
  UniqueFunction(Callable&& callable) {
    if constexpr (storedInline<Stored>()) {
      ::new (static_cast<void*>(_storage)) Stored(std::forward<Callable>(callable));
      _operations = &inlineOperations<Stored>;
    } else {
      ::new (static_cast<void*>(_storage)) Stored*(new Stored(std::forward<Callable>(callable)));
      _operations = &heapOperations<Stored>;
    }
  }

  UniqueFunction(UniqueFunction&& other) noexcept { takeFrom(other); }
  UniqueFunction& operator=(UniqueFunction&& other) noexcept {
    if (this != &other) {
      reset();
      takeFrom(other);
    }
    return *this;
  }
  UniqueFunction(const UniqueFunction&) = delete;
  UniqueFunction& operator=(const UniqueFunction&) = delete;
  ~UniqueFunction() { reset(); }

  explicit operator bool() const noexcept { return _operations != nullptr; }

  Result operator()(Arguments... arguments) {
    return _operations->call(_storage, std::forward<Arguments>(arguments)...);
  }

 private:
  static constexpr std::size_t kInlineSize = 6 * sizeof(void*);

  struct Operations {
    Result (*call)(void*, Arguments&&...);
    void (*move)(void* from, void* to) noexcept;
    void (*destroy)(void*) noexcept;
  };

  template <class Stored>
  static constexpr bool storedInline() {
    return sizeof(Stored) <= kInlineSize && alignof(Stored) <= alignof(std::max_align_t) &&
           std::is_nothrow_move_constructible_v<Stored>;
  }

  template <class Stored>
  static constexpr Operations inlineOperations{
      [](void* storage, Arguments&&... arguments) -> Result {
        return (*static_cast<Stored*>(storage))(std::forward<Arguments>(arguments)...);
      },
      [](void* from, void* to) noexcept {
        auto* stored = static_cast<Stored*>(from);
        ::new (to) Stored(std::move(*stored));
        stored->~Stored();
      },
      [](void* storage) noexcept { static_cast<Stored*>(storage)->~Stored(); }};

  template <class Stored>
  static constexpr Operations heapOperations{
      [](void* storage, Arguments&&... arguments) -> Result {
        return (**static_cast<Stored**>(storage))(std::forward<Arguments>(arguments)...);
      },
      [](void* from, void* to) noexcept { ::new (to) Stored*(*static_cast<Stored**>(from)); },
      [](void* storage) noexcept { delete *static_cast<Stored**>(storage); }};

  void takeFrom(UniqueFunction& other) noexcept {
    if (other._operations == nullptr) return;
    other._operations->move(other._storage, _storage);
    _operations = std::exchange(other._operations, nullptr);
  }

  void reset() noexcept {
    if (_operations != nullptr) std::exchange(_operations, nullptr)->destroy(_storage);
  }

  alignas(std::max_align_t) unsigned char _storage[kInlineSize];
  const Operations* _operations = nullptr;
};

}  // namespace velk
