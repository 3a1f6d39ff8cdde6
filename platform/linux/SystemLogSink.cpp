#include <spdlog/logger.h>
#include <spdlog/sinks/base_sink.h>
#include <spdlog/sinks/systemd_sink.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdint>
#include <cstdlib>
#include <mutex>
#include <utility>

#include "platform/LogSinks.h"

namespace velk::log {
namespace {

spdlog::level::level_enum spdlogLevelOf(Level level) {
  switch (level) {
    case Level::debug:
      return spdlog::level::debug;
    case Level::standard:
      return spdlog::level::info;
    case Level::error:
      return spdlog::level::err;
  }
  return spdlog::level::err;
}

Level levelOf(spdlog::level::level_enum level) {
  if (level >= spdlog::level::err) return Level::error;
  return level == spdlog::level::debug ? Level::debug : Level::standard;
}

/// One line a message on the standard error stream, in one write, so that lines of several processes stay whole.
class PrefixedErrorStream final : public spdlog::sinks::base_sink<std::mutex> {
 protected:
  void sink_it_(const spdlog::details::log_msg& message) override {
    const char prefix[] = {'<', static_cast<char>('0' + priorityOf(levelOf(message.level))), '>'};
    spdlog::memory_buf_t line;
    line.append(prefix, prefix + sizeof prefix);
    line.append(message.payload.data(), message.payload.data() + message.payload.size());
    line.push_back('\n');
    for (std::size_t written = 0; written < line.size();) {
      const auto count = ::write(STDERR_FILENO, line.data() + written, line.size() - written);
      if (count < 0 && errno == EINTR) continue;
      if (count <= 0) return;  // Nobody reads it: there is nowhere to say so.
      written += static_cast<std::size_t>(count);
    }
  }
  void flush_() override {}
};

class SystemLogSink final : public Sink {
 public:
  SystemLogSink(std::string identifier, spdlog::sink_ptr sink) : _logger(std::move(identifier), std::move(sink)) {
    _logger.set_level(spdlog::level::trace);
    // A line that cannot be written is lost; the log is no place to say so.
    _logger.set_error_handler([](const std::string&) {});
  }
  void write(Level level, std::string_view line) override {
    _logger.log(spdlogLevelOf(level), spdlog::string_view_t(line.data(), line.size()));
  }

 private:
  spdlog::logger _logger;
};

}  // namespace

bool isJournalStream(std::string_view journalStream, int descriptor) noexcept {
  const auto colon = journalStream.find(':');
  if (colon == std::string_view::npos) return false;
  const auto parse = [](std::string_view text, std::uint64_t& number) {
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    return error == std::errc() && end == text.data() + text.size();
  };
  std::uint64_t device = 0;
  std::uint64_t inode = 0;
  if (!parse(journalStream.substr(0, colon), device) || !parse(journalStream.substr(colon + 1), inode)) return false;
  struct stat status {};
  return ::fstat(descriptor, &status) == 0 && status.st_dev == device && status.st_ino == inode;
}

std::shared_ptr<Sink> makeSystemLogSink(std::string identifier, bool alwaysErrorStream) {
  const char* const journalStream = std::getenv("JOURNAL_STREAM");
  spdlog::sink_ptr sink;
  if (!alwaysErrorStream && journalStream != nullptr && isJournalStream(journalStream, STDERR_FILENO)) {
    sink = std::make_shared<spdlog::sinks::systemd_sink_st>(identifier);
  } else {
    sink = std::make_shared<PrefixedErrorStream>();
  }
  return std::make_shared<SystemLogSink>(std::move(identifier), std::move(sink));
}

}  // namespace velk::log
