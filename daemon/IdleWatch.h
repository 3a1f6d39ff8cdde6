// The process's keep-alive transaction, and the decision to go when it has not been held for a while. The agent begins
// and ends the transaction (under its lock); the daemon's process makes the watch and asks it whether to go.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>

#include "foundation/TimeValue.h"
#include "platform/Lock.h"
#include "platform/Platform.h"
#include "platform/Queue.h"

namespace velk {

/// Any thread; the transaction's methods never block.
class IdleWatch final : public KeepAlive {
 public:
  /// Without a limit the process never goes by itself. `isOccupied` tells whether a connection is open or waiting to
  /// be accepted: while it says so the process stays, and is looked at again after another limit. `whenIdle` is called
  /// on the watch's own queue; it may be called again if the process is still there after another limit.
  IdleWatch(Scheduler& scheduler, std::optional<Duration> limit, std::function<bool()> isOccupied,
            std::function<void()> whenIdle);
  ~IdleWatch() override;

  /// Begins to count. The callbacks are not called before.
  void start();
  /// No callback begins after this has returned. Waits for one that runs, and for nothing else: not for a thread.
  void stop();

  void beginTransaction() override;
  void endTransaction() override;

  [[nodiscard]] bool isReleased() const;
  /// False when the transaction was still held after `limit`.
  [[nodiscard]] bool waitUntilReleased(Duration limit);

 private:
  void arm();
  void limitPassed();

  // Constant after construction.
  const std::optional<Duration> _limit;
  const std::function<bool()> _isOccupied;
  const std::function<void()> _whenIdle;
  const std::shared_ptr<Queue> _queue;
  const std::unique_ptr<Timer> _timer;

  // Guarded by _lock.
  mutable Lock _lock;
  /// The transaction has ended, or a callback.
  Condition _changed;
  bool _held VELK_GUARDED_BY(_lock) = false;
  bool _started VELK_GUARDED_BY(_lock) = false;
  bool _calling VELK_GUARDED_BY(_lock) = false;
};

}  // namespace velk
