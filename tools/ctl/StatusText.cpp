#include "tools/ctl/StatusText.h"

#include <cmath>
#include <vector>

#include "foundation/Format.h"
#include "tools/ctl/PrintableText.h"
#include "tools/ctl/TextTable.h"

namespace velk::ctl {
namespace {

using Align = TextTable::Align;

/// The dictionaries of a list.
std::vector<const PropertyDictionary*> rowsOf(const PropertyDictionary& status, std::string_view list) {
  std::vector<const PropertyDictionary*> rows;
  if (const PropertyArray* array = status.array(list)) {
    for (const PropertyValue& element : *array) {
      if (const PropertyDictionary* row = element.dictionary()) rows.push_back(row);
    }
  }
  return rows;
}

std::string bytesText(double bytes) {
  if (bytes < 1024) return formatText("%d B", {static_cast<std::int64_t>(bytes)});
  if (bytes < 1024 * 1024) return formatText("%.1f KiB", {bytes / 1024});
  return formatText("%.1f MiB", {bytes / (1024 * 1024)});
}

std::string secondsText(const PropertyDictionary& row, std::string_view key) {
  const PropertyValue* value = row.find(key);
  if (value == nullptr || !value->isNumber()) return {};
  const double seconds = doubleValue(value);
  return std::isfinite(seconds) ? formatText("%.0f s", {seconds}) : std::string();
}

std::string heading(const PropertyDictionary& status) {
  return "velkreportingd " + printable(plainText(status, "version"), TextTable::kMaximumColumns) + ", " +
         bytesText(doubleValue(status.find("processMemory"))) +
         formatText(" of memory, keep-alive references: %d\n", {integerValue(status.find("keepAliveCount"))});
}

std::string section(const std::string& name, const PropertyDictionary& status, std::string_view count,
                    std::string_view list, const TextTable& table) {
  const auto total =
      count.empty() ? static_cast<std::int64_t>(rowsOf(status, list).size()) : integerValue(status.find(count));
  return formatText("\n%@: %d\n", {name, total}) + table.text(2) + omissionText(status, count, list);
}

std::string sessions(const PropertyDictionary& status) {
  TextTable table({{"ID", Align::right},
                   {"TYPE", Align::right},
                   {"VERSION", Align::right},
                   {"CLIENT"},
                   {"SERVICE"},
                   {"LEVEL", Align::right},
                   {"NOTES"},
                   {"BACKENDS"}});
  for (const auto* row : rowsOf(status, "sessions")) {
    const bool isRelated = row->string("token") != nullptr;
    table.addRow({plainText(*row, "sessionID"), plainText(*row, "clientType"), plainText(*row, "clientVersion"),
                  plainText(*row, "clientName"), plainText(*row, "serviceName"),
                  isRelated ? plainText(*row, "level") : std::string(), notesText(*row), backendsText(*row)});
  }
  return section("Sessions", status, "sessionCount", "sessions", table);
}

std::string releaseText(const PropertyDictionary& helper) {
  const std::string timeout = secondsText(helper, "releaseTimeout");
  if (const std::string left = secondsText(helper, "releaseInSeconds"); !left.empty()) {
    return "in " + left + " of " + timeout;
  }
  if (timeout.empty()) return {};
  return integerValue(helper.find("releaseTimeout")) == 0 ? "never" : "after " + timeout;
}

std::string helpers(const PropertyDictionary& status) {
  TextTable table({{"CLIENT:SERVICE"},
                   {"USERS", Align::right},
                   {"SERVED", Align::right},
                   {"TASKS", Align::right},
                   {"RELEASE"},
                   {"STATE"}});
  for (const auto* row : rowsOf(status, "helpers")) {
    table.addRow({plainText(*row, "key"), plainText(*row, "usageCount"), plainText(*row, "totalSessionsServedCount"),
                  plainText(*row, "runningTasks"), releaseText(*row),
                  booleanValue(row->find("active")) ? "active" : "inactive"});
  }
  return section("Transports", status, "helperCount", "helpers", table);
}

std::string storebags(const PropertyDictionary& status) {
  TextTable table({{"NAME"}, {"VERSION"}, {"AGE", Align::right}, {"MAX AGE", Align::right}, {"STATE"}});
  for (const auto* row : rowsOf(status, "storebags")) {
    const bool isServed = booleanValue(row->find("available"));
    table.addRow({plainText(*row, "name"), plainText(*row, "version"), secondsText(*row, "ageSeconds"),
                  secondsText(*row, "maxAgeSeconds"),
                  plainText(*row, "state") + (isServed ? "" : ", there is none to serve")});
  }
  return section("Storebags", status, {}, "storebags", table);
}

std::string activeClients(const PropertyDictionary& status) {
  const PropertyDictionary* counts = status.dictionary("activeClients");
  if (counts == nullptr || counts->empty()) return {};
  TextTable table({{"CLIENT TYPE", Align::right}, {"SESSIONS", Align::right}});
  for (const auto& entry : *counts) table.addRow({entry.key, plainText(*counts, entry.key)});
  return formatText("\nActive client types: %d\n", {counts->size()}) + table.text(2);
}

std::string stateText(const PropertyDictionary& backend) {
  const PropertyValue* state = backend.find("state");
  if (state == nullptr || state->integer() == nullptr) return "-";
  switch (*state->integer()) {
    case 0:
      return "not configured";
    case 1:
      return "disabled";
    case 2:
      return "enabled";
    case 3:
      return "waiting";
    default:
      return formatText("state %d", {*state->integer()});
  }
}

std::string batchText(const PropertyDictionary& backend) {
  const auto events = integerValue(backend.find("batchedEvents"));
  if (events == 0) return {};
  return formatText(" (%d %@, ", {events, events == 1 ? "event" : "events"}) +
         bytesText(doubleValue(backend.find("batchedBytes"))) + ")";
}

}  // namespace

std::string plainText(const PropertyDictionary& dictionary, std::string_view key) {
  const PropertyValue* value = dictionary.find(key);
  if (value == nullptr || value->isNull()) return {};
  if (const std::string* text = value->string()) return *text;
  return value->isNumber() ? description(value) : std::string();
}

std::string omissionText(const PropertyDictionary& status, std::string_view count, std::string_view list) {
  const PropertyArray* array = status.array(list);
  const auto listed = array != nullptr ? static_cast<std::int64_t>(array->size()) : 0;
  const auto total = integerValue(status.find(count));
  return total > listed ? formatText("  (%d more not shown)\n", {total - listed}) : std::string();
}

std::string clientText(const PropertyDictionary& session) {
  const auto named = [&](std::string_view key) {
    const std::string name = plainText(session, key);
    return name.empty() ? "-" : printable(name, TextTable::kMaximumColumns);
  };
  return named("clientName") + " / " + named("serviceName");
}

std::string backendsText(const PropertyDictionary& session) {
  std::string text;
  for (const auto* backend : rowsOf(session, "backends")) {
    text += text.empty() ? "" : ", ";
    text += printable(plainText(*backend, "name"), TextTable::kMaximumColumns) + " " + stateText(*backend) +
            batchText(*backend);
  }
  return text;
}

std::string notesText(const PropertyDictionary& session) {
  std::string text;
  const auto add = [&text](std::string_view note) { text += (text.empty() ? "" : ", ") + std::string(note); };
  const PropertyValue* described = session.find("described");
  if (described != nullptr && !booleanValue(described)) add("not described");
  if (booleanValue(session.find("hasAggregator"))) add("aggregates");
  if (booleanValue(session.find("finished"))) add("finished");
  return text;
}

std::string statusText(const PropertyDictionary& status) {
  std::string text = heading(status) + sessions(status) + helpers(status) + storebags(status) + activeClients(status);
  text.pop_back();
  return text;
}

}  // namespace velk::ctl
