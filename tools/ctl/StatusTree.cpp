// The status as the trees that sessions form.
#include <algorithm>
#include <cstdint>
#include <map>
#include <set>
#include <vector>

#include "foundation/Format.h"
#include "tools/ctl/PrintableText.h"
#include "tools/ctl/StatusText.h"

namespace velk::ctl {
namespace {

using Row = const PropertyDictionary*;

// A client chooses its level; what stands deeper than this is not moved further to the right.
constexpr std::size_t kMaximumDepth = 20;
constexpr std::size_t kMaximumTokenColumns = 64;

std::string sessionText(const PropertyDictionary& session) {
  const std::string type = plainText(session, "clientType");
  const std::string notes = notesText(session);
  const std::string backends = backendsText(session);
  return "session " + printable(plainText(session, "sessionID")) + ", type " + (type.empty() ? "-" : printable(type)) +
         ", " + clientText(session) + (notes.empty() ? "" : ", " + notes) + (backends.empty() ? "" : ": " + backends) +
         "\n";
}

std::string margin(std::size_t depth) { return std::string(2 * (1 + std::min(depth, kMaximumDepth)), ' '); }

std::string gapText(std::uint64_t first, std::uint64_t last) {
  if (first == last) return formatText("(nobody at level %d)\n", {first});
  return formatText("(nobody at levels %d to %d)\n", {first, last});
}

/// The sessions of one token by level, in the order in which they registered.
class Tree {
 public:
  void add(Row session) {
    const auto level = std::max<std::int64_t>(integerValue(session->find("level")), 0);
    _levels[static_cast<std::uint64_t>(level)].push_back(session);
  }

  // Downwards the first session of each level, which is the parent of those below it; then upwards its siblings.
  [[nodiscard]] std::string text() const {
    struct Siblings {
      std::uint64_t level;
      std::size_t depth;
      const std::vector<Row>* sessions;
    };
    std::vector<Siblings> left;
    std::string text;
    std::uint64_t expected = 0;
    std::size_t depth = 0;
    for (const auto& [level, sessions] : _levels) {
      if (level > expected) text += margin(depth++) + gapText(expected, level - 1);
      text += line(level, depth, *sessions.front());
      left.push_back({level, depth++, &sessions});
      expected = level + 1;
    }
    for (auto siblings = left.rbegin(); siblings != left.rend(); ++siblings) {
      for (std::size_t number = 1; number < siblings->sessions->size(); ++number) {
        text += line(siblings->level, siblings->depth, *(*siblings->sessions)[number]);
      }
    }
    return text;
  }

 private:
  static std::string line(std::uint64_t level, std::size_t depth, const PropertyDictionary& session) {
    return margin(depth) + formatText("level %d: ", {level}) + sessionText(session);
  }

  std::map<std::uint64_t, std::vector<Row>> _levels;
};

std::map<std::string, Row> sessionsByIdentifier(const PropertyDictionary& status) {
  std::map<std::string, Row> sessions;
  if (const PropertyArray* rows = status.array("sessions")) {
    for (const PropertyValue& row : *rows) {
      const PropertyDictionary* session = row.dictionary();
      if (session != nullptr) sessions.emplace(plainText(*session, "sessionIDString"), session);
    }
  }
  return sessions;
}

std::string hierarchyText(const PropertyDictionary& hierarchy, const std::map<std::string, Row>& sessions,
                          std::set<Row>& drawn) {
  const auto count = integerValue(hierarchy.find("sessionCount"));
  Tree tree;
  std::int64_t found = 0;
  if (const PropertyArray* identifiers = hierarchy.array("sessions")) {
    for (const PropertyValue& identifier : *identifiers) {
      const auto session = identifier.string() != nullptr ? sessions.find(*identifier.string()) : sessions.end();
      if (session == sessions.end() || !drawn.insert(session->second).second) continue;
      tree.add(session->second);
      ++found;
    }
  }
  return "token " + printable(plainText(hierarchy, "token"), kMaximumTokenColumns) +
         formatText(" (%d %@)\n", {count, count == 1 ? "session" : "sessions"}) + tree.text() +
         (count > found ? formatText("  (%d more not shown)\n", {count - found}) : std::string());
}

std::string othersText(const PropertyDictionary& status, const std::set<Row>& drawn) {
  std::string text;
  for (const PropertyValue& row : *status.array("sessions")) {
    const PropertyDictionary* session = row.dictionary();
    if (session == nullptr || drawn.count(session) > 0) continue;
    text += "  " + sessionText(*session);
  }
  return text.empty() ? text : "without a hierarchy\n" + text;
}

}  // namespace

std::string statusTree(const PropertyDictionary& status) {
  const auto sessions = sessionsByIdentifier(status);
  std::set<Row> drawn;
  std::string text;
  if (const PropertyArray* hierarchies = status.array("hierarchies")) {
    for (const PropertyValue& row : *hierarchies) {
      if (row.dictionary() != nullptr) text += hierarchyText(*row.dictionary(), sessions, drawn);
    }
  }
  text += omissionText(status, "hierarchyCount", "hierarchies");
  if (status.array("sessions") != nullptr) text += othersText(status, drawn);
  text += omissionText(status, "sessionCount", "sessions");
  if (text.empty()) return "no sessions";
  text.pop_back();
  return text;
}

}  // namespace velk::ctl
