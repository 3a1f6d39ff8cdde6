// What a sending process and the program that started it say to each other, over the sender's standard streams.
//
//   sender: ready -> (go) -> sends -> report -> (again: flushes once more)* -> (quit) -> exits
#pragma once

#include <cstdint>
#include <vector>

namespace velk::bench {

/// Bytes from the sender and to it.
inline constexpr char kReady = 'R';
inline constexpr char kGo = 'G';
inline constexpr char kAgain = 'A';
inline constexpr char kQuit = 'Q';

struct ClientReport {
  double cpuSecondsBefore = 0;  ///< of the process, when it was told to go
  double cpuSecondsAfter = 0;
  double begun = 0;  ///< steadySeconds
  double ended = 0;  ///< when the last event was accepted
  std::uint64_t accepted = 0;
  std::uint64_t refusals = 0;                  ///< how often an event found the outbox full, and was sent again later
  std::vector<std::uint32_t> sendNanoseconds;  ///< one for each accepted event
};

/// Both answer false when the other end has gone.
[[nodiscard]] bool writeReport(int descriptor, const ClientReport& report);
[[nodiscard]] bool readReport(int descriptor, ClientReport& report);
[[nodiscard]] bool writeByte(int descriptor, char byte);
/// The next byte, or 0 when the other end has gone.
[[nodiscard]] char readByte(int descriptor);

/// Of this process, all threads.
[[nodiscard]] double cpuSecondsOfProcess();

/// Sleeps until the moment of the nth event at this rate, or not at all (rate 0, or late already).
void waitForTurn(double begun, std::uint64_t event, double eventsPerSecond);

}  // namespace velk::bench
