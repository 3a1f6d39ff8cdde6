#include "platform/TimerSchedule.h"

namespace velk {

SteadyTime TimerSchedule::after(SteadyTime base, Duration delay) noexcept {
  if (delay <= Duration::zero()) return base;
  return delay > SteadyTime::max() - base ? SteadyTime::max() : base + delay;
}

TimerSchedule::Identifier TimerSchedule::add(SteadyTime deadline, Duration leeway, Action action) {
  const auto identifier = ++_last;
  const auto latest = after(deadline, leeway);
  _entries.emplace(identifier, Entry{deadline, latest, std::move(action)});
  _byDeadline.emplace(deadline, identifier);
  _byLatest.emplace(latest, identifier);
  return identifier;
}

TimerSchedule::Action TimerSchedule::remove(Identifier identifier) {
  const auto found = _entries.find(identifier);
  if (found == _entries.end()) return {};
  auto action = std::move(found->second.action);
  _byDeadline.erase(Key(found->second.deadline, identifier));
  _byLatest.erase(Key(found->second.latest, identifier));
  _entries.erase(found);
  return action;
}

std::optional<SteadyTime> TimerSchedule::nextWake() const {
  if (_byLatest.empty()) return std::nullopt;
  return _byLatest.begin()->first;
}

std::optional<SteadyTime> TimerSchedule::nextDeadline() const {
  if (_byDeadline.empty()) return std::nullopt;
  return _byDeadline.begin()->first;
}

std::vector<TimerSchedule::Action> TimerSchedule::takeDue(SteadyTime now) {
  std::vector<Action> due;
  while (!_byDeadline.empty() && _byDeadline.begin()->first <= now) due.push_back(remove(_byDeadline.begin()->second));
  return due;
}

std::vector<TimerSchedule::Action> TimerSchedule::takeAll() { return takeDue(SteadyTime::max()); }

}  // namespace velk
