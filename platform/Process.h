// The current process: how it is set up, and what its main thread waits for. Used by the daemon's entry.
#pragma once

#include <memory>

#include "foundation/Error.h"
#include "platform/FileDescriptor.h"

namespace velk::process {

/// Removes variables that would steer libraries of this process. Before other threads are started.
void dropFromEnvironment(const char* variable);

/// New files are for this user alone (umask 077).
void restrictNewFiles();

/// The priority of work that nobody waits for: nice 5, the lowest ordinary level of disk access. What the system
/// refuses is left as it is.
void setUtilityPriority();

/// As many open descriptors as the system lets this process have, up to 65,536 (a limit that is higher already stays).
/// What the system refuses is left as it is.
void raiseDescriptorLimit();

/// Few heaps instead of one for every thread that ever allocated: threads come and go here, and what each leaves free
/// stays with its heap. Before other threads are started.
void limitHeaps();
/// Gives memory that is free back to the system. Takes some milliseconds after a busy time.
void returnFreeMemory();

/// Ends the process at once, whatever its threads do: nothing more of it runs, but for the system log's last lines (see
/// `flushSystemLog`).
[[noreturn]] void endNow(int status);

/// The main thread's wait: for the signals that steer a daemon, and for other threads that want it to look.
class RunLoop {
 public:
  enum class Event {
    reload,  ///< SIGHUP
    stop,    ///< SIGTERM or SIGINT
    wakeUp,  ///< somebody called `wakeUp`
  };

  /// Blocks the signals for this thread and for all that are started later, and ignores SIGPIPE. One a process, before
  /// other threads are started.
  [[nodiscard]] static Result<std::unique_ptr<RunLoop>> make();

  /// Blocks until one of the events. On the main thread.
  [[nodiscard]] Event wait();

  /// From here on another SIGINT ends the process at once: for whoever will not wait for an orderly end. On the main
  /// thread, after the last `wait`.
  void letInterruptEndTheProcess() noexcept;

  /// Any thread. Many calls may cause a single event.
  void wakeUp() noexcept;

 private:
  RunLoop(FileDescriptor signals, FileDescriptor wakeUps) noexcept
      : _signals(std::move(signals)), _wakeUps(std::move(wakeUps)) {}

  const FileDescriptor _signals;
  const FileDescriptor _wakeUps;
};

}  // namespace velk::process
