#include "examples/MachineFacts.h"

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

namespace velk::examples {

PropertyDictionary loadFacts() {
  PropertyDictionary facts;
  double one = 0;
  double five = 0;
  double fifteen = 0;
  std::string tasks;
  std::ifstream("/proc/loadavg") >> one >> five >> fifteen >> tasks;
  facts.set("load1", one);
  facts.set("load5", five);
  facts.set("load15", fifteen);
  facts.set("tasks", tasks);
  double uptime = 0;
  std::ifstream("/proc/uptime") >> uptime;
  facts.set("uptimeSeconds", uptime);
  return facts;
}

PropertyDictionary memoryFacts() {
  PropertyDictionary facts;
  std::ifstream file("/proc/meminfo");
  std::string name;
  std::int64_t kibibytes = 0;
  for (std::string line; std::getline(file, line);) {
    std::istringstream fields(line);
    if (!(fields >> name >> kibibytes)) continue;
    if (name == "MemTotal:") facts.set("totalKiB", kibibytes);
    if (name == "MemAvailable:") facts.set("availableKiB", kibibytes);
    if (name == "Cached:") facts.set("cachedKiB", kibibytes);
    if (name == "SwapFree:") facts.set("swapFreeKiB", kibibytes);
  }
  return facts;
}

PropertyDictionary diskFacts() {
  PropertyDictionary facts;
  std::error_code error;
  const auto space = std::filesystem::space("/", error);
  if (!error) {
    facts.set("sizeBytes", static_cast<std::int64_t>(space.capacity));
    facts.set("freeBytes", static_cast<std::int64_t>(space.available));
  }
  std::ifstream file("/proc/diskstats");
  std::int64_t read = 0;
  std::int64_t written = 0;
  for (std::string line; std::getline(file, line);) {
    std::istringstream fields(line);
    std::string device;
    std::int64_t major = 0, minor = 0, reads = 0, merged = 0, sectorsRead = 0, time = 0, writes = 0, sectorsWritten = 0;
    if (!(fields >> major >> minor >> device >> reads >> merged >> sectorsRead >> time >> writes >> merged >>
          sectorsWritten)) {
      continue;
    }
    read += sectorsRead;
    written += sectorsWritten;
  }
  facts.set("sectorsRead", read);
  facts.set("sectorsWritten", written);
  return facts;
}

PropertyDictionary networkFacts() {
  PropertyDictionary facts;
  std::ifstream file("/proc/net/dev");
  std::int64_t received = 0, receivedPackets = 0, sent = 0, sentPackets = 0, interfaces = 0;
  for (std::string line; std::getline(file, line);) {
    const std::size_t colon = line.find(':');
    if (colon == std::string::npos || line.compare(0, colon, "    lo") == 0) continue;
    std::istringstream fields(line.substr(colon + 1));
    std::int64_t values[16] = {};
    for (auto& value : values) fields >> value;
    received += values[0];
    receivedPackets += values[1];
    sent += values[8];
    sentPackets += values[9];
    ++interfaces;
  }
  facts.set("interfaces", interfaces);
  facts.set("bytesReceived", received);
  facts.set("packetsReceived", receivedPackets);
  facts.set("bytesSent", sent);
  facts.set("packetsSent", sentPackets);
  return facts;
}

}  // namespace velk::examples
