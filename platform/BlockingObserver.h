// How a pool learns that one of its threads is about to wait. The other side of BlockingScope; for pools alone.
#pragma once

namespace velk {

/// Called on the thread that blocks, at the outermost BlockingScope only. Both calls are short and never block.
class BlockingObserver {
 public:
  virtual ~BlockingObserver() = default;
  virtual void willBlock() noexcept = 0;
  virtual void didBlock() noexcept = 0;
};

/// Whom BlockingScopes of the current thread tell from now on (null: nobody). Not within a BlockingScope.
void setBlockingObserver(BlockingObserver* observer) noexcept;

}  // namespace velk
