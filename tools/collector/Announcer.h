// What the collector tells the person or program that started it: JSON lines, or words.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "foundation/PropertyValue.h"
#include "tools/JsonLines.h"
#include "tools/collector/DashboardListener.h"
#include "tools/collector/ReceivedPost.h"

namespace velk::collector {

struct Totals {
  std::uint64_t posts = 0;
  std::uint64_t events = 0;
  /// Of the JSON texts, and as they came over the wire.
  std::uint64_t bytes = 0;
  std::uint64_t wireBytes = 0;
  std::uint64_t refused = 0;
  std::uint64_t storebags = 0;
};
[[nodiscard]] PropertyDictionary dictionaryOf(const Totals& totals);

/// Any thread; the lines of one call stay together. `json`: one JSON object a line, else words. `quiet`: only the first
/// line, the last one, and what went wrong.
class Announcer {
 public:
  Announcer(tools::JsonLines& lines, bool json, bool quiet) : _lines(lines), _json(json), _quiet(quiet) {}

  void listening(const std::string& url, int port, const std::string& caPath, const std::string& databasePath,
                 std::optional<int> dashboardPort = std::nullopt);
  void post(std::int64_t number, const std::string& path, const ReceivedPost& post, bool digestChecked);
  void upload(std::int64_t number, const std::string& name, std::uint64_t fileBytes, std::uint64_t wireBytes);
  /// A post that was not taken, and the sentence that its sender was told.
  void refused(const std::string& path, int status, const std::string& reason);
  void storebag(const std::string& name, int status);
  /// Every one that arrived, those included that a bad link was to lose.
  void datagram(const ReceivedDatagram& datagram);
  void logData(std::int64_t number, std::size_t entries, std::size_t bytes, const std::string& location);
  void stopped(const Totals& totals);

 private:
  void say(const PropertyDictionary& object, const std::string& words);

  tools::JsonLines& _lines;
  const bool _json;
  const bool _quiet;
};

}  // namespace velk::collector
