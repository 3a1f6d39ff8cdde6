// What a host process finds out about itself, and does to itself: descriptors, threads, signals.
#pragma once

#include <dirent.h>
#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <fstream>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <thread>

namespace host {

inline std::atomic<int> brokenPipes{0};
inline std::atomic<int> endedChildren{0};

inline std::string descriptors() {
  std::string list;
  DIR* const directory = opendir("/proc/self/fd");
  while (const dirent* entry = readdir(directory)) {
    if (entry->d_name[0] == '.' || std::atoi(entry->d_name) == dirfd(directory)) continue;
    char target[256] = {};
    const std::string path = std::string("/proc/self/fd/") + entry->d_name;
    static_cast<void>(!readlink(path.c_str(), target, sizeof target - 1));
    list += std::string(" ") + entry->d_name + "=" + target;
  }
  closedir(directory);
  return list;
}

inline std::string threadNames() {
  std::string names;
  DIR* const tasks = opendir("/proc/self/task");
  while (const dirent* task = readdir(tasks)) {
    std::string name;
    std::ifstream file(std::string("/proc/self/task/") + task->d_name + "/comm");
    if (task->d_name[0] != '.' && std::getline(file, name)) names += " " + name;
  }
  closedir(tasks);
  return names;
}

/// The handlers and flags of all signals, and this thread's mask.
inline std::string actions() {
  std::ostringstream text;
  for (int number = 1; number < 32; ++number) {
    struct sigaction action {};
    if (sigaction(number, nullptr, &action) != 0) continue;
    text << " " << number << ":" << reinterpret_cast<const void*>(action.sa_handler) << ":" << action.sa_flags;
  }
  sigset_t mask;
  pthread_sigmask(SIG_BLOCK, nullptr, &mask);
  for (int number = 1; number < 32; ++number) text << (sigismember(&mask, number) == 1 ? " blocked" : "");
  return text.str();
}

/// Signals for the process while its own thread takes none: they wait, unless another thread takes them, for which
/// there is time. Those that were taken.
inline std::string signalItself() {
  const std::set<int> numbers{SIGHUP,  SIGINT,  SIGUSR1,   SIGUSR2, SIGPIPE, SIGALRM,
                              SIGTERM, SIGCHLD, SIGVTALRM, SIGPROF, SIGIO,   SIGRTMIN + 1};
  std::map<int, struct sigaction> former;
  struct sigaction doingNothing {};
  doingNothing.sa_handler = [](int) {};
  sigset_t all;
  sigset_t formerMask;
  sigfillset(&all);
  pthread_sigmask(SIG_SETMASK, &all, &formerMask);
  for (const int number : numbers) {
    sigaction(number, &doingNothing, &former[number]);
    kill(getpid(), number);
  }
  std::this_thread::sleep_for(std::chrono::milliseconds(100));
  std::string taken;
  for (const int number : numbers) {
    sigset_t one;
    sigemptyset(&one);
    sigaddset(&one, number);
    constexpr timespec kNow{};
    if (sigtimedwait(&one, nullptr, &kNow) != number) taken += " " + std::to_string(number);
    sigaction(number, &former[number], nullptr);
  }
  pthread_sigmask(SIG_SETMASK, &formerMask, nullptr);
  return taken;
}

/// Whoever read the standard error stream is gone.
inline void breakErrorStream() {
  int ends[2] = {};
  if (pipe(ends) != 0 || dup2(ends[1], STDERR_FILENO) < 0) std::abort();
  close(ends[0]);
  close(ends[1]);
}

inline void handleSignals() {
  struct sigaction action {};
  action.sa_handler = [](int number) { ++(number == SIGPIPE ? brokenPipes : endedChildren); };
  sigaction(SIGPIPE, &action, nullptr);
  action.sa_flags = SA_RESTART;
  sigaction(SIGCHLD, &action, nullptr);
}

}  // namespace host
