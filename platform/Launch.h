// What the service manager gives to a daemon and hears from it: sockets to listen on, and its state.
// Used by the daemon's entry alone, on its main thread before other threads are started (the environment changes).
#pragma once

#include <string_view>
#include <vector>

#include "platform/FileDescriptor.h"

namespace velk::launch {

/// The listening Unix stream sockets that this process was started with (LISTEN_FDS, LISTEN_PID), close-on-exec set.
/// The variables are removed from the environment, so that children do not take them for theirs. Descriptors of
/// another kind are closed with an error line. Empty when the process was started by hand. Call it once.
[[nodiscard]] std::vector<FileDescriptor> takeActivatedSockets();

// Tell the service manager; nothing happens where there is none. A failure is logged once a call and ignored: the
// daemon works without. `status` is one line for people (line breaks become blanks).
void notifyReady(std::string_view status = {});
void notifyStatus(std::string_view status);
void notifyStopping();

}  // namespace velk::launch
