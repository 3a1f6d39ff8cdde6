// Threads of the operating system, for the few facilities that own one. Everything else uses queues.
#pragma once

#include <string_view>
#include <thread>

#include "foundation/Error.h"
#include "foundation/Function.h"

namespace velk {

/// Starts a thread that receives no signals meant for the process (those that report its own faults excepted), so that
/// a host's handlers never run on a thread of ours. The error says why the system refused. `body` must not throw.
[[nodiscard]] Result<std::thread> startThread(std::string_view name, UniqueFunction<void()> body);

/// Names the current thread for debuggers; the first 15 bytes count. A system call: skip it when nothing changed.
void setCurrentThreadName(std::string_view name) noexcept;

}  // namespace velk
