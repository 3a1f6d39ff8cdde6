// The daemon as a whole: makes everything in order, keeps it together, and takes it apart again. Made and used by the
// main function, on the main thread.
#pragma once

#include <memory>

#include "daemon/DaemonOptions.h"
#include "foundation/Error.h"

namespace velk {

namespace process {
class RunLoop;
}

class DaemonProcess {
 public:
  /// The parts, none of which does anything yet. The error's code is the status to exit with, its text says what an
  /// administrator can do. `runLoop` outlives the process object and is woken when the daemon may want to go.
  [[nodiscard]] static Result<std::unique_ptr<DaemonProcess>> make(const DaemonOptions& options,
                                                                   process::RunLoop& runLoop);
  ~DaemonProcess();

  /// Takes connections from the moment it returns. The error is of the same kind as that of `make`; `stop` is to
  /// follow.
  [[nodiscard]] Result<void> resume();
  /// Reads the entitlements again (and keeps the old ones when they cannot be read) and lets the storebags be fetched
  /// afresh. Only posts; what is asked for while it waits for its turn is done once.
  void reload();
  /// Takes no further connection if nothing has needed the process for as long as the idle limit says and nobody is at
  /// the door; false, and nothing has happened, otherwise. After true `stop` is to follow.
  [[nodiscard]] bool stopsListeningIfIdle();
  /// Orderly end: no new connections, sessions torn down, what they posted delivered. Takes five seconds at the worst:
  /// a wait that takes its bound is named in a line, and when a thread of the process does not return even then, the
  /// process ends here, with `kExitSoftware`.
  void stop();

 private:
  struct Parts;
  explicit DaemonProcess(std::unique_ptr<Parts> parts);

  const std::unique_ptr<Parts> _parts;
};

}  // namespace velk
