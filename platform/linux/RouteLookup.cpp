#include "platform/linux/RouteLookup.h"

#include <cerrno>
#include <utility>

#include "platform/NativeThread.h"

namespace velk {

RouteLookup::RouteLookup(Look look, Answer answer) : _look(std::move(look)), _answer(std::move(answer)) {}

RouteLookup::~RouteLookup() { stop(); }

void RouteLookup::ask(std::uint64_t generation) {
  if (handOver(generation)) return;
  DefaultRoutes unknown;
  unknown.failure = EAGAIN;
  _answer(generation, unknown);
}

bool RouteLookup::handOver(std::uint64_t generation) {
  Guard guard(_lock);
  if (_stopping) return true;
  if (!_thread.joinable()) {
    auto thread = startThread("routes", [this] { run(); });
    if (!thread) return false;
    _thread = std::move(*thread);
  }
  _question = generation;
  _changed.notifyAll();
  return true;
}

void RouteLookup::run() {
  while (const auto generation = nextQuestion()) _answer(*generation, _look());
}

std::optional<std::uint64_t> RouteLookup::nextQuestion() {
  Guard guard(_lock);
  while (!_question && !_stopping) _changed.wait(_lock);
  if (_stopping) return std::nullopt;
  return std::exchange(_question, std::nullopt);
}

void RouteLookup::stop() {
  {
    Guard guard(_lock);
    _stopping = true;
    _changed.notifyAll();
  }
  if (_thread.joinable()) _thread.join();
}

}  // namespace velk
