#include "tests/support/RecordingLog.h"

#include <algorithm>

namespace velk::test {

class RecordingLog::Recorder : public log::Sink {
 public:
  void write(log::Level level, std::string_view line) override {
    Guard guard(lock);
    lines.push_back(Line{level, std::string(line)});
    added.notifyAll();
  }

  mutable Lock lock;
  Condition added;
  std::vector<Line> lines VELK_GUARDED_BY(lock);
};

RecordingLog::RecordingLog() : _recorder(std::make_shared<Recorder>()) { log::setSink(_recorder, log::Level::debug); }

RecordingLog::~RecordingLog() { log::setSink(nullptr); }

std::vector<RecordingLog::Line> RecordingLog::lines() const {
  Guard guard(_recorder->lock);
  return _recorder->lines;
}

int RecordingLog::count(std::string_view text) const {
  const auto all = lines();
  return static_cast<int>(std::count_if(all.begin(), all.end(), [&](const Line& line) { return line.text == text; }));
}

int RecordingLog::count(log::Level level, std::string_view text) const {
  const auto all = lines();
  return static_cast<int>(std::count_if(all.begin(), all.end(),
                                        [&](const Line& line) { return line.level == level && line.text == text; }));
}

bool RecordingLog::contains(std::string_view part) const {
  const auto all = lines();
  return std::any_of(all.begin(), all.end(),
                     [&](const Line& line) { return line.text.find(part) != std::string::npos; });
}

bool RecordingLog::waitFor(std::string_view part, int count, Duration limit) const {
  const auto deadline = std::chrono::steady_clock::now() + limit;
  Guard guard(_recorder->lock);
  const auto isThere = [&](const std::vector<Line>& all) {
    return std::count_if(all.begin(), all.end(),
                         [&](const Line& line) { return line.text.find(part) != std::string::npos; }) >= count;
  };
  while (!isThere(_recorder->lines)) {
    if (!_recorder->added.waitUntil(_recorder->lock, deadline)) return isThere(_recorder->lines);
  }
  return true;
}

void RecordingLog::clear() {
  Guard guard(_recorder->lock);
  _recorder->lines.clear();
}

std::string asLoggedValue(const std::string& value) {
  constexpr std::size_t kLongest = 1024;
  if (value.size() <= kLongest) return value;
  return value.substr(0, kLongest) + "...(cut, " + std::to_string(value.size()) + " bytes)";
}

}  // namespace velk::test
