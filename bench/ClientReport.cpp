#include "bench/ClientReport.h"

#include <time.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cmath>

#include "bench/SampleEvents.h"

namespace velk::bench {

namespace {

bool writeAll(int descriptor, const void* data, std::size_t size) {
  const auto* from = static_cast<const char*>(data);
  while (size > 0) {
    const auto count = ::write(descriptor, from, size);
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) return false;
    from += count;
    size -= static_cast<std::size_t>(count);
  }
  return true;
}

bool readAll(int descriptor, void* data, std::size_t size) {
  auto* to = static_cast<char*>(data);
  while (size > 0) {
    const auto count = ::read(descriptor, to, size);
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) return false;
    to += count;
    size -= static_cast<std::size_t>(count);
  }
  return true;
}

}  // namespace

bool writeReport(int descriptor, const ClientReport& report) {
  const std::array<double, 4> times{report.cpuSecondsBefore, report.cpuSecondsAfter, report.begun, report.ended};
  const std::array<std::uint64_t, 3> counts{report.accepted, report.refusals, report.sendNanoseconds.size()};
  return writeAll(descriptor, times.data(), sizeof times) && writeAll(descriptor, counts.data(), sizeof counts) &&
         writeAll(descriptor, report.sendNanoseconds.data(), report.sendNanoseconds.size() * sizeof(std::uint32_t));
}

bool readReport(int descriptor, ClientReport& report) {
  std::array<double, 4> times{};
  std::array<std::uint64_t, 3> counts{};
  if (!readAll(descriptor, times.data(), sizeof times) || !readAll(descriptor, counts.data(), sizeof counts)) {
    return false;
  }
  report.cpuSecondsBefore = times[0];
  report.cpuSecondsAfter = times[1];
  report.begun = times[2];
  report.ended = times[3];
  report.accepted = counts[0];
  report.refusals = counts[1];
  report.sendNanoseconds.resize(counts[2]);
  return readAll(descriptor, report.sendNanoseconds.data(), counts[2] * sizeof(std::uint32_t));
}

bool writeByte(int descriptor, char byte) { return writeAll(descriptor, &byte, 1); }

char readByte(int descriptor) {
  char byte = 0;
  return readAll(descriptor, &byte, 1) ? byte : '\0';
}

double cpuSecondsOfProcess() {
  timespec time{};
  ::clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &time);
  return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) / 1e9;
}

void waitForTurn(double begun, std::uint64_t event, double eventsPerSecond) {
  if (eventsPerSecond <= 0) return;
  const double turn = begun + static_cast<double>(event) / eventsPerSecond;
  if (turn <= steadySeconds()) return;
  const double whole = std::floor(turn);
  const timespec until{static_cast<time_t>(whole), static_cast<long>((turn - whole) * 1e9)};
  while (::clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &until, nullptr) == EINTR) {
  }
}

}  // namespace velk::bench
