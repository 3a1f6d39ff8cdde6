// The requests that stand in line for one server. Used by the HTTP engine on its thread.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <vector>

namespace velk {

class CurlTask;

/// Senders are served in turn, the requests of each in the order of their numbers: one that left the line to wait for a
/// route comes back to its old place. Has no bound of its own: the engine bounds what stands in all of its lines.
class RequestLine {
 public:
  using Tasks = std::map<std::uint64_t, std::shared_ptr<CurlTask>>;

  [[nodiscard]] bool empty() const noexcept { return _senders.empty(); }
  void add(std::shared_ptr<CurlTask> task);
  // Of a line that is not empty.
  /// The request whose turn it is.
  [[nodiscard]] const CurlTask& next() const;
  [[nodiscard]] std::shared_ptr<CurlTask> takeNext();
  [[nodiscard]] std::uint64_t oldestNumber() const;
  [[nodiscard]] std::shared_ptr<CurlTask> takeOldest();
  /// Those for which `matches` holds, by their numbers.
  [[nodiscard]] Tasks takeIf(const std::function<bool(const CurlTask&)>& matches);

 private:
  [[nodiscard]] std::uint64_t nextSender() const;
  [[nodiscard]] std::uint64_t oldestSender() const;
  [[nodiscard]] std::shared_ptr<CurlTask> takeFirst(std::uint64_t sender);

  /// Those that have requests here.
  std::map<std::uint64_t, Tasks> _senders;
  /// Whose request was taken last.
  std::uint64_t _lastSender = 0;
};

}  // namespace velk
