// Where the lines of the system log go: one sink for the programs, one for the library. Each stands in a file of its
// own, so that a host process of the library loads nothing that only the programs' sink needs.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "platform/Log.h"

namespace velk::log {

/// For the programs. Structured journal entries when the standard error stream is the journal's (JOURNAL_STREAM names
/// it) unless `alwaysErrorStream`, otherwise lines on it: "<7>", "<6>" or "<3>" for debug, standard and error, then the
/// line, so that whoever collects the stream knows the level. `identifier` names the program. Callers never wait for
/// the stream or the journal: a thread of the log's own writes (see LogWriter.h). A line that cannot be written is
/// lost.
[[nodiscard]] std::shared_ptr<Sink> makeSystemLogSink(const std::string& identifier, bool alwaysErrorStream = false);

/// Waits until the newest of those sinks has written what it was given, half a second at most: before a process ends.
void flushSystemLog();
/// From here on a fatal signal waits as long before it ends the process, so that its last lines are seen. Signals that
/// have a handler keep it. Once a process.
void flushSystemLogOnFatalSignals();

/// For processes that link the library. Says nothing unless its owner asked for it: VELKREPORTING_LOG (read with
/// secure_getenv) as "debug", "default" or "error" sends lines of that level and above to the standard error stream,
/// as "velkreporting: LINE"; "none" sends none (the sink is null). Without it errors alone go to the system's log, at
/// most kLibraryErrorsPerMinute of them, as "PROGRAM[PROCESS]: velkreporting: LINE". That never blocks: a line that the
/// log daemon does not take at once is lost.
[[nodiscard]] std::shared_ptr<Sink> makeLibrarySink();
/// The same with a log daemon that listens elsewhere.
[[nodiscard]] std::shared_ptr<Sink> makeLibrarySink(std::string_view logDaemonPath);
/// The lowest level that sink has a use for, for `setSink`.
[[nodiscard]] Level librarySinkLevel();
inline constexpr unsigned kLibraryErrorsPerMinute = 60;

/// The priorities of syslog: 7, 6 and 3.
[[nodiscard]] constexpr int priorityOf(Level level) noexcept {
  switch (level) {
    case Level::debug:
      return 7;
    case Level::standard:
      return 6;
    case Level::error:
      return 3;
  }
  return 3;
}

/// Whether `journalStream` ("DEVICE:INODE", the variable's text) names what stands behind `descriptor`.
[[nodiscard]] bool isJournalStream(std::string_view journalStream, int descriptor) noexcept;

}  // namespace velk::log
