#include "platform/linux/RequestLine.h"

#include <algorithm>
#include <utility>

#include "platform/linux/CurlSession.h"

namespace velk {

void RequestLine::add(std::shared_ptr<CurlTask> task) {
  auto& tasks = _senders[task->request().sender];
  tasks.emplace(task->place().number, std::move(task));
}

const CurlTask& RequestLine::next() const { return *_senders.at(nextSender()).begin()->second; }

std::shared_ptr<CurlTask> RequestLine::takeNext() {
  _lastSender = nextSender();
  return takeFirst(_lastSender);
}

std::uint64_t RequestLine::oldestNumber() const { return _senders.at(oldestSender()).begin()->first; }

std::shared_ptr<CurlTask> RequestLine::takeOldest() { return takeFirst(oldestSender()); }

RequestLine::Tasks RequestLine::takeIf(const std::function<bool(const CurlTask&)>& matches) {
  Tasks taken;
  for (auto& [sender, tasks] : _senders) {
    for (auto entry = tasks.begin(); entry != tasks.end();) {
      const auto current = entry++;
      if (matches(*current->second)) taken.insert(tasks.extract(current));
    }
  }
  std::erase_if(_senders, [](const auto& entry) { return entry.second.empty(); });
  return taken;
}

std::uint64_t RequestLine::nextSender() const {
  const auto sender = _senders.upper_bound(_lastSender);
  return (sender != _senders.end() ? sender : _senders.begin())->first;
}

std::uint64_t RequestLine::oldestSender() const {
  const auto oldest = std::min_element(_senders.begin(), _senders.end(), [](const auto& left, const auto& right) {
    return left.second.begin()->first < right.second.begin()->first;
  });
  return oldest->first;
}

std::shared_ptr<CurlTask> RequestLine::takeFirst(std::uint64_t sender) {
  const auto tasks = _senders.find(sender);
  auto task = std::move(tasks->second.begin()->second);
  tasks->second.erase(tasks->second.begin());
  if (tasks->second.empty()) _senders.erase(tasks);
  return task;
}

}  // namespace velk
