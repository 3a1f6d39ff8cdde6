// A host process: makes one client of the library and sends events through it, as fast as they are taken or at a rate.
// Started by bench_pipeline with the number of the client, of its events, and of events a second (0: no pace).
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <future>
#include <thread>

#include "bench/ClientReport.h"
#include "bench/SampleEvents.h"
#include "client/VelkReporting.h"

namespace {

using namespace velk::bench;
using velk::VelkReporting;

constexpr int kOutboxFull = 8;
constexpr auto kPatience = std::chrono::seconds(60);
/// How long an event that found the outbox full waits for room.
constexpr auto kPause = std::chrono::microseconds(500);

std::shared_ptr<VelkReporting> open(std::uint32_t number) {
  auto client = VelkReporting::initWithSessionInfo(sampleSessionInfo(number), sampleUserInfo(), {});
  if (!client) return nullptr;
  auto configured = std::make_shared<std::promise<bool>>();
  client->startConfigurationWithCompletionHandler(
      [configured](const auto& backends) { configured->set_value(backends && !backends->empty()); });
  auto answer = configured->get_future();
  if (answer.wait_for(kPatience) != std::future_status::ready || !answer.get()) return nullptr;
  return client;
}

std::uint32_t nanosecondsBetween(const timespec& from, const timespec& to) {
  return static_cast<std::uint32_t>((to.tv_sec - from.tv_sec) * 1'000'000'000L + to.tv_nsec - from.tv_nsec);
}

/// Sends one event, again and again until it is taken; the time of the call that took it.
std::uint32_t send(VelkReporting& client, std::uint32_t number, std::uint64_t sequence, std::uint64_t& refusals) {
  const auto message = sampleMessage(number, sequence, steadySeconds());
  for (;;) {
    velk::Error error;
    timespec before{};
    timespec after{};
    ::clock_gettime(CLOCK_MONOTONIC, &before);
    const bool taken = client.sendMessageWithDictionary(message, &error);
    ::clock_gettime(CLOCK_MONOTONIC, &after);
    if (taken) return nanosecondsBetween(before, after);
    if (error.code != kOutboxFull) {
      std::fprintf(stderr, "bench_client: an event was refused: %d %s\n", error.code, error.description.c_str());
      std::exit(70);
    }
    ++refusals;
    std::this_thread::sleep_for(kPause);
  }
}

void flush(VelkReporting& client) {
  auto flushed = std::make_shared<std::promise<void>>();
  auto done = flushed->get_future();
  client.flushMessagesWithCompletion([flushed](const auto&) { flushed->set_value(); });
  done.wait_for(kPatience);
}

}  // namespace

int main(int argumentCount, char** arguments) {
  if (argumentCount != 4) return 64;
  const auto number = static_cast<std::uint32_t>(std::strtoul(arguments[1], nullptr, 10));
  const std::uint64_t events = std::strtoull(arguments[2], nullptr, 10);
  const double rate = std::strtod(arguments[3], nullptr);
  auto client = open(number);
  if (!client) {
    std::fprintf(stderr, "bench_client: no backend is enabled\n");
    return 69;
  }
  ClientReport report;
  report.sendNanoseconds.assign(events, 0);  // written now, so that no page is new while the clock runs
  if (!writeByte(STDOUT_FILENO, kReady) || readByte(STDIN_FILENO) != kGo) return 70;

  report.cpuSecondsBefore = cpuSecondsOfProcess();
  report.begun = steadySeconds();
  for (std::uint64_t event = 0; event < events; ++event) {
    waitForTurn(report.begun, event, rate);
    report.sendNanoseconds[event] = send(*client, number, event, report.refusals);
  }
  report.ended = steadySeconds();
  report.accepted = events;
  flush(*client);
  report.cpuSecondsAfter = cpuSecondsOfProcess();
  if (!writeReport(STDOUT_FILENO, report)) return 70;
  while (readByte(STDIN_FILENO) == kAgain) {
    flush(*client);
    if (!writeByte(STDOUT_FILENO, kReady)) return 70;
  }
  client->finishSession();
  return 0;
}
