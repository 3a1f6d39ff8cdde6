#include "tools/ctl/InputLines.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <utility>

namespace velk::ctl {
namespace {

constexpr std::size_t kReadBytes = 64 * 1024;
constexpr std::chrono::milliseconds kLongestPoll = std::chrono::hours(1);

}  // namespace

InputLines::InputLines(int descriptor, std::size_t maximumLineBytes)
    : _descriptor(descriptor), _maximumLineBytes(maximumLineBytes), _wakeUp(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {}

void InputLines::wake() {
  const std::uint64_t one = 1;
  // Fails only when it has been woken very often already.
  (void)!::write(_wakeUp.get(), &one, sizeof(one));
}

bool InputLines::waitForInput() {
  std::array<pollfd, 2> waits = {{{_wakeUp.get(), POLLIN, 0}, {_descriptor, POLLIN, 0}}};
  while (::poll(waits.data(), waits.size(), -1) < 0 && errno == EINTR) {
  }
  return waits[0].revents == 0;
}

bool InputLines::sleep(std::chrono::duration<double> time) {
  using Clock = std::chrono::steady_clock;
  const auto deadline = Clock::now() + std::chrono::duration_cast<Clock::duration>(time);
  for (auto now = Clock::now(); now < deadline; now = Clock::now()) {
    const auto left = std::min<Clock::duration>(deadline - now, kLongestPoll);
    pollfd wait{_wakeUp.get(), POLLIN, 0};
    const auto milliseconds = std::chrono::ceil<std::chrono::milliseconds>(left).count();
    if (::poll(&wait, 1, static_cast<int>(milliseconds)) > 0) return false;
  }
  return true;
}

std::optional<InputLines::Event> InputLines::takeLine(std::string& line) {
  const std::size_t end = _buffer.find('\n', _searched);
  if (end == std::string::npos && _buffer.size() > _maximumLineBytes) {
    // What is in the buffer belongs to the line that is too long, and so does what follows up to its end.
    _skipping = true;
    _buffer.clear();
  }
  if (end == std::string::npos) {
    _searched = _buffer.size();
    return std::nullopt;
  }
  line.assign(_buffer, 0, end);
  _buffer.erase(0, end + 1);
  _searched = 0;
  const bool tooLong = std::exchange(_skipping, false) || line.size() > _maximumLineBytes;
  return tooLong ? Event::tooLong : Event::line;
}

InputLines::Event InputLines::next(std::string& line) {
  for (;;) {
    if (const auto event = takeLine(line)) return *event;
    if (_ended) {
      line = std::move(_buffer);
      _buffer.clear();
      _searched = 0;
      if (std::exchange(_skipping, false)) return Event::tooLong;
      return line.empty() ? Event::end : Event::line;
    }
    if (!waitForInput()) return Event::woken;
    std::array<char, kReadBytes> bytes;
    const ssize_t count = ::read(_descriptor, bytes.data(), bytes.size());
    if (count < 0 && errno != EINTR && errno != EAGAIN) return Event::failed;
    if (count == 0) _ended = true;
    if (count > 0) _buffer.append(bytes.data(), static_cast<std::size_t>(count));
  }
}

}  // namespace velk::ctl
