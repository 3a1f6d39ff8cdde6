#include "bench/ChildProgram.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <fstream>

extern char** environ;

namespace velk::bench {

namespace {

std::vector<std::string> environmentWith(const std::map<std::string, std::string>& additions) {
  std::vector<std::string> all;
  for (char** entry = environ; *entry != nullptr; ++entry) {
    const std::string text = *entry;
    if (additions.count(text.substr(0, text.find('='))) == 0) all.push_back(text);
  }
  for (const auto& [name, value] : additions) all.push_back(name + "=" + value);
  return all;
}

std::vector<char*> pointersTo(std::vector<std::string>& texts) {
  std::vector<char*> pointers;
  for (auto& text : texts) pointers.push_back(text.data());
  pointers.push_back(nullptr);
  return pointers;
}

[[noreturn]] void fail(const std::string& what) {
  std::perror(("bench: " + what).c_str());
  std::exit(71);
}

}  // namespace

ChildProgram::ChildProgram(const Options& options) {
  int toChild[2];
  int fromChild[2];
  if (::pipe2(toChild, O_CLOEXEC) != 0 || ::pipe2(fromChild, O_CLOEXEC) != 0) fail("making pipes");
  auto command = options.command;
  auto environment = environmentWith(options.environment);
  const auto arguments = pointersTo(command);
  const auto variables = pointersTo(environment);
  const char* errorFile = options.errorFile.empty() ? nullptr : options.errorFile.c_str();
  _pid = ::fork();
  if (_pid < 0) fail("starting " + command.front());
  if (_pid == 0) {
    ::dup2(toChild[0], STDIN_FILENO);
    ::dup2(fromChild[1], STDOUT_FILENO);
    if (errorFile != nullptr) ::dup2(::open(errorFile, O_WRONLY | O_CREAT | O_APPEND, 0600), STDERR_FILENO);
    ::execve(arguments[0], arguments.data(), variables.data());
    ::_exit(127);
  }
  ::close(toChild[0]);
  ::close(fromChild[1]);
  _input = toChild[1];
  _output = fromChild[0];
}

ChildProgram::~ChildProgram() {
  if (_pid > 0) {
    signal(SIGKILL);
    wait();
  }
  ::close(_input);
  ::close(_output);
}

double ChildProgram::cpuSeconds() const {
  clockid_t clock{};
  timespec time{};
  if (::clock_getcpuclockid(_pid, &clock) != 0 || ::clock_gettime(clock, &time) != 0) return 0;
  return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}

double ChildProgram::status(const char* field) const {
  std::ifstream file("/proc/" + std::to_string(_pid) + "/status");
  std::string name;
  while (file >> name) {
    double kilobytes = 0;
    if (name == field && file >> kilobytes) return kilobytes / 1024;
  }
  return 0;
}

void ChildProgram::signal(int number) const {
  if (_pid > 0) ::kill(_pid, number);
}

int ChildProgram::wait() {
  int status = 0;
  while (::waitpid(_pid, &status, 0) < 0 && errno == EINTR) {
  }
  _pid = -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

}  // namespace velk::bench
