// The floor that the pipeline is measured against: the least that a sender and an agent with the same wire, the same
// JSON, the same compression and the same kind of post can do. No sessions, no configuration, no filters, no lists, no
// logs, no bounds, no second thread.
#pragma once

#include <cstdint>
#include <string>

namespace velk::bench {

/// What the daemon is told its device is, so that its events and the floor's are the same JSON.
[[nodiscard]] std::string deviceConfiguration();

/// Reads frames of any number of senders, writes the payload and the fields of an event as JSON, gzips `batch` events
/// of one sender at a time and posts them. Runs until its standard input ends.
int runFloorAgent(const std::string& socketPath, const std::string& url, const std::string& caFile,
                  std::uint64_t batch);

/// Encodes and writes each event by itself, on the calling thread. Talks to its parent as ClientReport.h says.
int runFloorSender(const std::string& socketPath, std::uint32_t client, std::uint64_t events, double rate);

}  // namespace velk::bench
