#include "tests/integration/ChildProcess.h"

#include <fcntl.h>
#include <grp.h>
#include <poll.h>
#include <signal.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <stdexcept>
#include <string_view>

namespace velk::test {

void LineCollector::add(std::string line) {
  Guard guard(_lock);
  _lines.push_back(std::move(line));
  _changed.notifyAll();
}

void LineCollector::end() {
  Guard guard(_lock);
  _ended = true;
  _changed.notifyAll();
}

std::vector<std::string> LineCollector::lines() const {
  Guard guard(_lock);
  return _lines;
}

std::optional<std::string> LineCollector::waitFor(const std::function<bool(const std::string&)>& matches,
                                                  std::size_t from, std::chrono::milliseconds patience) const {
  const auto deadline = std::chrono::steady_clock::now() + patience;
  Guard guard(_lock);
  for (std::size_t at = from;;) {
    for (; at < _lines.size(); ++at) {
      if (matches(_lines[at])) return _lines[at];
    }
    if (_ended || (!_changed.waitUntil(_lock, deadline) && at >= _lines.size())) return std::nullopt;
  }
}

bool LineCollector::waitForPart(const std::string& part, std::size_t from, std::chrono::milliseconds patience) const {
  return waitFor([&](const std::string& line) { return line.find(part) != std::string::npos; }, from, patience)
      .has_value();
}

void LineCollector::waitForEnd() const {
  static_cast<void>(waitFor([](const std::string&) { return false; }));
}

std::size_t LineCollector::count(const std::string& part) const {
  std::size_t found = 0;
  for (const auto& line : lines()) found += line.find(part) != std::string::npos ? 1 : 0;
  return found;
}

std::size_t LineCollector::countOnceThereAre(std::size_t expected, const std::string& part) const {
  std::size_t found = 0;
  static_cast<void>(waitFor([&](const std::string& line) {
    found += line.find(part) != std::string::npos ? 1 : 0;
    return found >= expected;
  }));
  return count(part);
}

namespace {

struct Pipe {
  FileDescriptor reading;
  FileDescriptor writing;
};

Pipe makePipe() {
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) throw std::runtime_error("pipe2 failed");
  return {FileDescriptor(ends[0]), FileDescriptor(ends[1])};
}

void readLines(FileDescriptor file, LineCollector& lines) {
  std::string pending;
  char buffer[4096];
  for (;;) {
    const ssize_t count = read(file.get(), buffer, sizeof(buffer));
    if (count <= 0) break;
    pending.append(buffer, static_cast<std::size_t>(count));
    std::size_t start = 0;
    for (std::size_t end; (end = pending.find('\n', start)) != std::string::npos; start = end + 1) {
      lines.add(pending.substr(start, end - start));
    }
    pending.erase(0, start);
  }
  if (!pending.empty()) lines.add(pending);
  lines.end();
}

/// What the new program is started with. Made before the fork: other threads may hold the locks of the heap and of the
/// environment at that moment, and in the child nobody would ever give them back.
struct Start {
  explicit Start(const ChildProcess::Options& options) : user(options.user) {
    for (char** variable = environ; *variable != nullptr; ++variable) {
      const std::string text = *variable;
      if (options.environment.count(text.substr(0, text.find('='))) == 0) variables.push_back(text);
    }
    for (const auto& [name, value] : options.environment) {
      if (!value.empty()) variables.push_back(name + "=" + value);
    }
    words = options.command;
    arguments = pointersTo(words);
    environment = pointersTo(variables);
  }
  Start(const Start&) = delete;
  Start& operator=(const Start&) = delete;

  static std::vector<char*> pointersTo(std::vector<std::string>& texts) {
    std::vector<char*> pointers;
    for (auto& text : texts) pointers.push_back(text.data());
    pointers.push_back(nullptr);
    return pointers;
  }

  std::vector<std::string> words;
  std::vector<std::string> variables;
  std::vector<char*> arguments;
  std::vector<char*> environment;
  std::optional<uid_t> user;
};

/// In the child: nothing but system calls.
[[noreturn]] void become(const Start& start, int in, int out, int err) {
  dup2(in, 0);
  dup2(out, 1);
  dup2(err, 2);
  ::signal(SIGPIPE, SIG_DFL);
  if (start.user && (setgroups(0, nullptr) != 0 || setgid(*start.user) != 0 || setuid(*start.user) != 0)) _exit(126);
  execve(start.arguments[0], start.arguments.data(), start.environment.data());
  constexpr std::string_view kProblem = "the program cannot be started\n";
  static_cast<void>(!::write(2, kProblem.data(), kProblem.size()));
  _exit(127);
}

}  // namespace

ChildProcess::ChildProcess(const Options& options) {
  ::signal(SIGPIPE, SIG_IGN);  // a child that has gone is seen by its missing answers
  Pipe in = makePipe();
  Pipe out = makePipe();
  Pipe err = makePipe();
  const Start start(options);
  _pid = fork();
  if (_pid < 0) throw std::runtime_error("fork failed");
  if (_pid == 0) become(start, in.reading.get(), out.writing.get(), err.writing.get());
  _input = std::move(in.writing);
  _readers.emplace_back([file = std::move(out.reading), this]() mutable { readLines(std::move(file), _output); });
  _readers.emplace_back([file = std::move(err.reading), this]() mutable { readLines(std::move(file), _errors); });
}

ChildProcess::~ChildProcess() {
  if (!_status) {
    signal(SIGKILL);
    static_cast<void>(wait());
  }
  for (auto& reader : _readers) reader.join();
}

void ChildProcess::write(const std::string& text) {
  std::size_t at = 0;
  while (at < text.size()) {
    const ssize_t count = ::write(_input.get(), text.data() + at, text.size() - at);
    if (count <= 0) return;  // it has gone; whoever waits for its answer will see
    at += static_cast<std::size_t>(count);
  }
}

void ChildProcess::signal(int number) const {
  if (_pid > 0 && !_status) kill(_pid, number);
}

std::optional<int> ChildProcess::wait(std::chrono::milliseconds patience) {
  if (_status) return _status;
  const FileDescriptor process(static_cast<int>(syscall(SYS_pidfd_open, _pid, 0)));
  pollfd ended{process.get(), POLLIN, 0};
  if (poll(&ended, 1, static_cast<int>(patience.count())) != 1) return std::nullopt;
  int status = 0;
  waitpid(_pid, &status, 0);
  _status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  return _status;
}

}  // namespace velk::test
