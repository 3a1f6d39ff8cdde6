// A log that remembers its lines, for tests that look at what was said and at which level.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "foundation/TimeValue.h"
#include "platform/Lock.h"
#include "platform/Log.h"

namespace velk::test {

/// While one lives it is the process's log, at every level. Any thread may write to it.
class RecordingLog {
 public:
  struct Line {
    log::Level level;
    std::string text;
    bool operator==(const Line&) const = default;
  };

  RecordingLog();
  ~RecordingLog();
  RecordingLog(const RecordingLog&) = delete;
  RecordingLog& operator=(const RecordingLog&) = delete;

  [[nodiscard]] std::vector<Line> lines() const;
  /// How many lines equal `text`.
  [[nodiscard]] int count(std::string_view text) const;
  [[nodiscard]] int count(log::Level level, std::string_view text) const;
  [[nodiscard]] bool contains(std::string_view part) const;
  /// Waits until `count` lines hold `part`, in tests on real queues. False when they do not come in time.
  [[nodiscard]] bool waitFor(std::string_view part, int count = 1, Duration limit = std::chrono::seconds(20)) const;
  void clear();

 private:
  class Recorder;
  std::shared_ptr<Recorder> _recorder;
};

/// What a line shows of a value of single-byte characters: the log cuts long ones and names their length.
[[nodiscard]] std::string asLoggedValue(const std::string& value);

}  // namespace velk::test
