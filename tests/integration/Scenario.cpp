#include "tests/integration/Scenario.h"

#include <algorithm>
#include <cstdlib>
#include <fstream>
#include <iostream>
#include <random>
#include <sstream>

#include "foundation/Json.h"

namespace velk {

void PrintTo(const PropertyValue& value, std::ostream* stream) {
  std::string text;
  *stream << (json::write(value, text, json::Extensions::tagged) ? text : "(no JSON)");
}

void PrintTo(const PropertyDictionary& value, std::ostream* stream) { PrintTo(PropertyValue(value), stream); }
void PrintTo(const PropertyArray& value, std::ostream* stream) { PrintTo(PropertyValue(value), stream); }

}  // namespace velk

namespace velk::test {

PropertyDictionary clientEntry(const ReportingServer& server, const PropertyDictionary& more) {
  PropertyDictionary entry{{"locale_whitelist", PropertyArray{"US"}},
                           {"filters", PropertyArray{}},
                           {"sampling_threshold", 1.0},
                           {"post_url", server.url("/post")}};
  for (const auto& [key, value] : more) {
    if (value.isNull()) {
      entry.remove(key);
    } else {
      entry.set(key, value);
    }
  }
  return entry;
}

PropertyDictionary postBackend(const ReportingServer& server, const PropertyDictionary& more) {
  return {{"clients", PropertyArray{clientEntry(server, more)}}};
}

PropertyDictionary storebagOf(const PropertyDictionary& section) {
  return {{"version", "1.0.0-test"},
          {"refresh_cycle", 600},
          {"seed", section},
          {"release", section},
          {"tavrin_internal", section}};
}

PropertyDictionary storebagWith(const ReportingServer& server, const PropertyDictionary& more) {
  return storebagOf({{"splunk", postBackend(server, more)}});
}

std::vector<PropertyDictionary> eventsOf(const ReportingServer& server, int method) {
  std::vector<PropertyDictionary> found;
  for (const auto& event : server.events()) {
    if (integerValue(event.find("_method")) == method) found.push_back(event);
  }
  return found;
}

std::vector<std::string> keysOf(const PropertyDictionary& dictionary) {
  std::vector<std::string> keys;
  for (const auto& entry : dictionary) keys.push_back(entry.key);
  return keys;
}

std::vector<std::int64_t> sortedNumbers(const PropertyValue& list) {
  std::vector<std::int64_t> numbers;
  if (list.array() == nullptr) return numbers;
  for (const auto& number : *list.array()) numbers.push_back(integerValue(number));
  std::sort(numbers.begin(), numbers.end());
  return numbers;
}

std::optional<std::filesystem::path> fileNamed(const std::string& directory, const std::string& name) {
  for (const auto& entry : std::filesystem::recursive_directory_iterator(directory)) {
    if (entry.is_regular_file() && entry.path().filename() == name) return entry.path();
  }
  return std::nullopt;
}

std::string contentsOf(const std::filesystem::path& file) {
  std::ostringstream contents;
  contents << std::ifstream(file, std::ios::binary).rdbuf();
  return contents.str();
}

void writeContents(const std::filesystem::path& file, const std::string& contents) {
  std::ofstream(file, std::ios::binary | std::ios::trunc) << contents;
}

std::vector<std::string> linesWith(const LineCollector& log, const std::string& part) {
  std::vector<std::string> found;
  for (const auto& line : log.lines()) {
    if (line.find(part) != std::string::npos) found.push_back(line);
  }
  return found;
}

unsigned testSeed() {
  const char* given = std::getenv("VELK_TEST_SEED");
  const unsigned seed =
      given != nullptr ? static_cast<unsigned>(std::strtoul(given, nullptr, 10)) : std::random_device()();
  std::cout << "VELK_TEST_SEED=" << seed << std::endl;
  return seed;
}

PropertyArray noLists() { return {PropertyValue(), PropertyValue(), PropertyValue()}; }

}  // namespace velk::test
