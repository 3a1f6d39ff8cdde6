// The send call in the host process, from 1 to 8 threads of one client: how long it takes and what it allocates. The
// other end takes everything at once (DrainingServer), so this is the library's share alone.
//
//   bench_send [EVENTS-A-THREAD]
#include <time.h>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <new>
#include <thread>
#include <vector>

#include "bench/ClientReport.h"
#include "bench/DrainingServer.h"
#include "bench/SampleEvents.h"
#include "client/VelkReporting.h"

namespace {

thread_local std::uint64_t allocationsOfThread = 0;

}  // namespace

// Those of the library as well: a program's operators are everybody's.
void* operator new(std::size_t size) {
  ++allocationsOfThread;
  if (void* const memory = std::malloc(size)) return memory;
  throw std::bad_alloc();
}
void operator delete(void* memory) noexcept { std::free(memory); }
void operator delete(void* memory, std::size_t) noexcept { std::free(memory); }

namespace {

using namespace velk::bench;
using velk::VelkReporting;

constexpr int kOutboxFull = 8;
constexpr auto kPause = std::chrono::microseconds(500);

struct Measured {
  std::vector<std::uint32_t> nanoseconds;
  std::uint64_t allocations = 0;
  std::uint64_t refusals = 0;
};

std::uint32_t nanosecondsBetween(const timespec& from, const timespec& to) {
  return static_cast<std::uint32_t>((to.tv_sec - from.tv_sec) * 1'000'000'000L + to.tv_nsec - from.tv_nsec);
}

/// Each event's dictionary is the caller's own and made before the clock runs.
Measured sendAll(VelkReporting& client, std::uint32_t thread, std::uint64_t events, double rate) {
  Measured measured;
  measured.nanoseconds.reserve(events);
  const double begun = steadySeconds();
  for (std::uint64_t event = 0; event < events; ++event) {
    waitForTurn(begun, event, rate);
    const auto message = sampleMessage(thread, event, begun);
    for (velk::Error error;; std::this_thread::sleep_for(kPause)) {
      timespec before{};
      timespec after{};
      const std::uint64_t allocationsBefore = allocationsOfThread;
      ::clock_gettime(CLOCK_MONOTONIC, &before);
      const bool taken = client.sendMessageWithDictionary(message, &error);
      ::clock_gettime(CLOCK_MONOTONIC, &after);
      if (taken) {
        measured.nanoseconds.push_back(nanosecondsBetween(before, after));
        measured.allocations += allocationsOfThread - allocationsBefore;
        break;
      }
      if (error.code != kOutboxFull) std::exit(70);
      ++measured.refusals;
    }
  }
  return measured;
}

void run(unsigned threads, std::uint64_t events, double rate) {
  auto client = VelkReporting::initWithSessionInfo(sampleSessionInfo(1), sampleUserInfo(), {});
  if (!client) std::exit(69);
  std::vector<Measured> results(threads);
  std::vector<std::thread> senders;
  for (unsigned thread = 0; thread < threads; ++thread) {
    senders.emplace_back([&, thread] { results[thread] = sendAll(*client, thread, events, rate / threads); });
  }
  for (auto& sender : senders) sender.join();
  Measured all;
  for (const auto& result : results) {
    all.nanoseconds.insert(all.nanoseconds.end(), result.nanoseconds.begin(), result.nanoseconds.end());
    all.allocations += result.allocations;
    all.refusals += result.refusals;
  }
  std::sort(all.nanoseconds.begin(), all.nanoseconds.end());
  const auto quantile = [&](double part) {
    return all.nanoseconds[static_cast<std::size_t>(part * static_cast<double>(all.nanoseconds.size() - 1))] / 1000.0;
  };
  std::printf("%-14s %7u | %8.2f %8.2f %10.1f | %12.2f %9llu\n", rate > 0 ? "paced" : "saturated", threads,
              quantile(0.5), quantile(0.99), quantile(1),
              static_cast<double>(all.allocations) / static_cast<double>(all.nanoseconds.size()),
              static_cast<unsigned long long>(all.refusals));
  std::fflush(stdout);
}

}  // namespace

int main(int argumentCount, char** arguments) {
  const std::uint64_t events = argumentCount > 1 ? std::strtoull(arguments[1], nullptr, 10) : 20'000;
  constexpr double kPace = 20'000;  // a second, over all threads
  const pid_t server = startDrainingServer();
  if (server < 0 || events == 0) return 70;
  std::printf("%-14s %7s | %8s %8s %10s | %12s %9s\n", "run", "threads", "p50 us", "p99 us", "max us", "allocations",
              "refusals");
  for (const double rate : {0.0, kPace}) {
    for (const unsigned threads : {1U, 2U, 4U, 8U}) run(threads, events, rate);
  }
  stopDrainingServer(server);
  return 0;
}
