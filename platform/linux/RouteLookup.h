// Looks the default routes up on a thread of its own: the kernel may take its time. Used by the HTTP engine.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <thread>

#include "platform/Lock.h"
#include "platform/linux/RouteMonitor.h"

namespace velk {

/// The thread starts with the first question and sleeps between questions.
class RouteLookup {
 public:
  using Look = std::function<DefaultRoutes()>;
  /// `generation` is that of the question. Runs on the thread of the look-ups, or on that of `ask` where the system
  /// refuses a thread; then `routes.failure` says so.
  using Answer = std::function<void(std::uint64_t generation, const DefaultRoutes& routes)>;

  RouteLookup(Look look, Answer answer);
  ~RouteLookup();
  RouteLookup(const RouteLookup&) = delete;
  RouteLookup& operator=(const RouteLookup&) = delete;

  /// Each question is answered by a look-up that began after it; only the newest of those that wait. Never blocks.
  void ask(std::uint64_t generation);
  /// No answer comes once this has returned. Waits for a look-up that runs: two seconds at most. Idempotent; not from
  /// an answer.
  void stop();

 private:
  [[nodiscard]] bool handOver(std::uint64_t generation);
  void run();
  [[nodiscard]] std::optional<std::uint64_t> nextQuestion();

  // Constant after construction.
  const Look _look;
  const Answer _answer;
  // Guarded by _lock; the thread is joined by the one `stop`.
  Lock _lock;
  Condition _changed;
  std::optional<std::uint64_t> _question VELK_GUARDED_BY(_lock);
  bool _stopping VELK_GUARDED_BY(_lock) = false;
  std::thread _thread;
};

}  // namespace velk
