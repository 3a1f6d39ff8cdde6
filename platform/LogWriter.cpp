#include "platform/LogWriter.h"

#include <atomic>
#include <cstdint>
#include <string>
#include <utility>

#include "platform/Lock.h"
#include "platform/LogSinks.h"

namespace velk::log {
namespace {

using SteadyClock = std::chrono::steady_clock;

constexpr std::chrono::milliseconds kNap{2};
constexpr std::chrono::seconds kRetryTime{1};
constexpr std::chrono::milliseconds kNoPatience{0};
/// A buffer that grew beyond this is not kept.
constexpr std::size_t kKeptBytes = 64 * 1024;

void appendLine(std::string& lines, Level level, std::string_view text) {
  const char prefix[] = {'<', static_cast<char>('0' + priorityOf(level)), '>'};
  lines.append(prefix, sizeof prefix).append(text).push_back('\n');
}

}  // namespace

struct LogWriter::State {
  explicit State(std::unique_ptr<LineOutput> lineOutput) : output(std::move(lineOutput)) {}

  [[nodiscard]] bool isEmptyLocked() const VELK_REQUIRES(lock) { return pending.empty() && leftOut == 0; }

  // Constant after construction; used by the thread alone.
  const std::unique_ptr<LineOutput> output;
  // Self-synchronised: bytes taken so far, and those of them that the output has had. Changed under the lock.
  std::atomic<std::uint64_t> accepted{0};
  std::atomic<std::uint64_t> written{0};
  // Guarded by lock.
  Lock lock;
  Condition wanted;   // the thread waits: there are lines, or there will be no more
  Condition drained;  // others wait: a batch was written
  std::string pending VELK_GUARDED_BY(lock);
  /// What the thread is writing still takes its room.
  std::size_t inFlight VELK_GUARDED_BY(lock) = 0;
  std::uint64_t leftOut VELK_GUARDED_BY(lock) = 0;
  bool hasThread VELK_GUARDED_BY(lock) = false;
  SteadyClock::time_point nextStart VELK_GUARDED_BY(lock){};
  bool isOver VELK_GUARDED_BY(lock) = false;
};

LogWriter::LogWriter(std::unique_ptr<LineOutput> output, ThreadStarter starter)
    : _state(std::make_shared<State>(std::move(output))), _starter(starter) {}

LogWriter::~LogWriter() {
  flush();
  {
    Guard guard(_state->lock);
    _state->isOver = true;
  }
  _state->wanted.notifyOne();
}

void LogWriter::write(Level level, std::string_view line) {
  auto& state = *_state;
  const std::size_t limit = level == Level::error ? kMaximumBytes : kMaximumBytes - kReservedForErrors;
  bool hasThread = false;
  {
    Guard guard(state.lock);
    const std::size_t before = state.pending.size();
    if (before + state.inFlight + line.size() > limit) {
      ++state.leftOut;
    } else {
      appendLine(state.pending, level, line);
      state.accepted += state.pending.size() - before;
    }
    hasThread = state.hasThread;
  }
  // No system call while the thread is awake.
  state.wanted.notifyOne();
  if (!hasThread) startThreadIfNone(kNoPatience);
}

void LogWriter::startThreadIfNone(std::chrono::milliseconds patience) {
  const auto now = SteadyClock::now();
  {
    Guard guard(_state->lock);
    if (_state->hasThread || (now < _state->nextStart && patience == kNoPatience)) return;
    _state->hasThread = true;
  }
  if (auto thread = _starter("velk-log", [state = _state] { run(*state); })) return thread->detach();
  writeWithoutThread(patience);
  {
    Guard guard(_state->lock);
    _state->hasThread = false;
    _state->nextStart = now + kRetryTime;
  }
  _state->drained.notifyAll();
}

void LogWriter::writeWithoutThread(std::chrono::milliseconds patience) {
  std::string lines;
  {
    Guard guard(_state->lock);
    lines.swap(_state->pending);
    _state->inFlight = lines.size();
  }
  const std::size_t taken = _state->output->tryWrite(lines, patience);
  Guard guard(_state->lock);
  _state->inFlight = 0;
  _state->written += taken;
  _state->pending.insert(0, lines, taken);
}

void LogWriter::run(State& state) {
  std::string batch;
  for (;;) {
    std::size_t accepted = 0;
    {
      Guard guard(state.lock);
      while (state.isEmptyLocked() && !state.isOver) state.wanted.wait(state.lock);
      if (state.isEmptyLocked()) return;
      if (batch.capacity() > kKeptBytes) batch = std::string();
      batch.clear();
      batch.swap(state.pending);
      accepted = batch.size();
      if (const auto leftOut = std::exchange(state.leftOut, 0); leftOut > 0) {
        appendLine(batch, Level::error,
                   "log: left out " + std::to_string(leftOut) + " lines that nothing read in time");
      }
      state.inFlight = batch.size();
    }
    state.output->write(batch);
    {
      Guard guard(state.lock);
      state.inFlight = 0;
      state.written += accepted;
    }
    state.drained.notifyAll();
    std::this_thread::sleep_for(kNap);
  }
}

bool LogWriter::flush() {
  auto& state = *_state;
  const auto deadline = SteadyClock::now() + kFlushTime;
  startThreadIfNone(kFlushTime);
  Guard guard(state.lock);
  const std::uint64_t target = state.accepted;
  while (state.written < target) {
    if (!state.hasThread || !state.drained.waitUntil(state.lock, deadline)) return state.written >= target;
  }
  return true;
}

bool LogWriter::isWritten() const noexcept { return _state->written >= _state->accepted; }

}  // namespace velk::log
