#include "tools/collector/Dashboard.h"

#include <algorithm>
#include <charconv>

#include "platform/PropertyList.h"
#include "tools/JsonLines.h"

namespace velk::collector {
namespace {

constexpr std::string_view kLogDataPath = "/logdata/";
constexpr std::size_t kLongestHost = 255;

bool isHostCharacter(char character) {
  return (character >= 'a' && character <= 'z') || (character >= 'A' && character <= 'Z') ||
         (character >= '0' && character <= '9') || std::string_view(".-:[]").find(character) != std::string_view::npos;
}

/// By the name under which the sender knows this collector.
std::string locationOf(std::int64_t number, const HeaderList& headers) {
  const std::string path = std::string(kLogDataPath) + std::to_string(number);
  const std::string* host = headerValue(headers, "Host");
  const bool usable = host != nullptr && !host->empty() && host->size() <= kLongestHost &&
                      std::all_of(host->begin(), host->end(), isHostCharacter);
  return usable ? "https://" + *host + path : path;
}

Answer sentence(int status, const std::string& text) {
  return {status, tools::jsonText({{"error", text}}) + "\n", "application/json", {}};
}

}  // namespace

Dashboard::Dashboard(DashboardStore* store, Announcer& announcer, const Clock& clock)
    : _store(store), _announcer(announcer), _clock(clock) {}

void Dashboard::take(const ReceivedDatagram& datagram) {
  if (_store != nullptr && datagram.fate != DatagramFate::dropped) {
    if (const auto kept = _store->add(datagram, _clock.wallTime()); !kept) {
      _announcer.refused("dashboard", 500, kept.error().description);
    }
  }
  _announcer.datagram(datagram);
}

Answer Dashboard::postLogData(const HeaderList& headers, std::string_view archive) {
  const auto read = propertylist::parse({reinterpret_cast<const std::uint8_t*>(archive.data()), archive.size()});
  if (!read) return refuse(400, read.error().description);
  const PropertyArray* entries = read->array();
  if (entries == nullptr) return refuse(400, "log data is an array");
  Result<std::int64_t> number = _logDataTaken + 1;
  if (_store != nullptr) number = _store->addLogData(archive, entries->size(), _clock.wallTime());
  if (!number) {
    // Senders are not told where things stand on this machine.
    (void)refuse(500, number.error().description);
    return sentence(500, "the log data cannot be kept");
  }
  ++_logDataTaken;
  const std::string location = locationOf(*number, headers);
  _announcer.logData(*number, entries->size(), archive.size(), location);
  return {200, location, "text/plain", {}};
}

Answer Dashboard::logData(const std::string& number) {
  std::int64_t value = 0;
  const char* end = number.data() + number.size();
  const auto read = std::from_chars(number.data(), end, value);
  if (_store == nullptr || read.ec != std::errc() || read.ptr != end) return sentence(404, "there is no such log data");
  auto archive = _store->logData(value);
  if (!archive) return sentence(404, archive.error().description);
  return {200, std::move(*archive), "application/octet-stream", {}};
}

Answer Dashboard::refuse(int status, const std::string& reason) {
  _announcer.refused(std::string(kLogDataPath), status, reason);
  return sentence(status, reason);
}

}  // namespace velk::collector
