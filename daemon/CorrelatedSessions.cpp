#include "daemon/CorrelatedSessions.h"

#include <algorithm>
#include <cstddef>
#include <iterator>

#include "daemon/LogTexts.h"
#include "platform/Log.h"
#include "session/ReportingdSession.h"

namespace velk {

namespace {

using SessionList = CorrelatedSessions::SessionList;

constexpr std::uint32_t kEveryLevel = UINT32_MAX;

void removeFrom(SessionList& list, const ReportingdSession& session) {
  std::erase_if(list, [&](const auto& listed) { return listed.get() == &session; });
}

constexpr auto isBelow = [](const auto& left, const auto& right) { return left.level < right.level; };

}  // namespace

/// First session of each level below `level`, from the root on. A level that a client made up (they go to four thousand
/// million) costs no more than the sessions that there are. Asked for every event of a tree, under the agent's lock: a
/// few passes over the list.
std::vector<CorrelatedSessions::LevelledSession> CorrelatedSessions::firstSessionsBelow(std::uint32_t level,
                                                                                        const SessionList& list) {
  std::vector<LevelledSession> first;
  first.reserve(list.size());
  for (const auto& session : list) {
    const auto its = session->hierarchyLevel();
    if (its < level || level == kEveryLevel) first.push_back({its, &session});
  }
  if (!std::is_sorted(first.begin(), first.end(), isBelow)) std::stable_sort(first.begin(), first.end(), isBelow);
  first.erase(std::unique(first.begin(), first.end(),
                          [](const auto& left, const auto& right) { return left.level == right.level; }),
              first.end());
  return first;
}

void CorrelatedSessions::makeIndex(const std::string& token) {
  const auto* list = sessions(token);
  if (list == nullptr) return;
  Index index{list, {}, firstSessionsBelow(kEveryLevel, *list)};
  index.members.reserve(list->size());
  for (const auto& session : *list) index.members.insert(session.get());
  _index = std::move(index);
}

const CorrelatedSessions::Index* CorrelatedSessions::indexOf(const SessionList& list) const {
  return _index && _index->list == &list ? &*_index : nullptr;
}

bool CorrelatedSessions::contains(const SessionList& list, const ReportingdSession& session) const {
  if (const auto* index = indexOf(list)) return index->members.contains(&session);
  return std::any_of(list.begin(), list.end(), [&](const auto& listed) { return listed.get() == &session; });
}

std::shared_ptr<ReportingdSession> CorrelatedSessions::firstSession(std::uint32_t level,
                                                                    const SessionList& list) const {
  const auto* index = indexOf(list);
  if (index == nullptr) return getFirstSessionWithHierarchy(level, list);
  const auto& first = index->firstSessions;
  const auto found = std::lower_bound(first.begin(), first.end(), LevelledSession{level, nullptr}, isBelow);
  return found != first.end() && found->level == level ? *found->session : nullptr;
}

template <class Use>
auto CorrelatedSessions::withFirstSessionsBelow(std::uint32_t level, const SessionList& list, Use use) const {
  if (const auto* index = indexOf(list)) {
    const auto& first = index->firstSessions;
    return use(first.begin(), std::lower_bound(first.begin(), first.end(), LevelledSession{level, nullptr}, isBelow));
  }
  const auto first = firstSessionsBelow(level, list);
  return use(first.begin(), first.end());
}

std::vector<std::string> CorrelatedSessions::add(ReportingdSession& session) {
  const auto token = session.hierarchyToken();
  if (!token) {
    log::standard(daemontexts::kStandaloneSession, session.sessionID());
    return {};
  }
  _index.reset();
  std::size_t deserted = 0;
  for (auto& [otherToken, list] : _sessions) {
    removeFrom(list, session);
    if (list.empty() && otherToken != *token) ++deserted;
  }
  auto& list = _sessions[*token];
  log::standard(daemontexts::kAddingCorrelatedSession, session.sessionID(), *token, session.hierarchyLevel());
  list.push_back(session.shared_from_this());
  return deserted > kMaximumDesertedLists ? dropEmptyLists() : std::vector<std::string>();
}

std::vector<std::string> CorrelatedSessions::remove(const ReportingdSession& session) {
  _index.reset();
  // Under every token: the session may have forgotten its own since it registered.
  for (auto& [token, list] : _sessions) removeFrom(list, session);
  return dropEmptyLists();
}

std::vector<std::string> CorrelatedSessions::dropEmptyLists() {
  std::vector<std::string> dropped;
  for (const auto& [token, list] : _sessions) {
    if (list.empty()) dropped.push_back(token);
  }
  for (const auto& token : dropped) _sessions.erase(token);
  return dropped;
}

const SessionList* CorrelatedSessions::sessions(const std::string& token) const {
  const auto found = _sessions.find(token);
  return found != _sessions.end() && !found->second.empty() ? &found->second : nullptr;
}

std::shared_ptr<ReportingdSession> CorrelatedSessions::getFirstSessionWithHierarchy(std::uint32_t level,
                                                                                    const SessionList& sessionList) {
  for (const auto& session : sessionList) {
    if (session->hierarchyLevel() == level) return session;
  }
  return nullptr;
}

std::optional<std::string> CorrelatedSessions::parentSessionIDString(const ReportingdSession& session) const {
  const auto level = session.hierarchyLevel();
  const auto token = session.hierarchyToken();
  if (level == 0 || !token) return std::nullopt;
  log::standard(daemontexts::kCheckingChain, *token, session.sessionID());
  const auto* list = sessions(*token);
  if (list == nullptr) {
    log::error(daemontexts::kNoSessionsForChain, *token);
    return std::nullopt;
  }
  if (!contains(*list, session)) {
    log::standard(daemontexts::kNotFoundForChain, session.sessionID(), *token);
    return std::nullopt;
  }
  return withFirstSessionsBelow(level, *list, [level](auto begin, auto end) {
    // From the parent up to the root, or to the first gap.
    auto top = end;
    while (top != begin && std::prev(top)->level + static_cast<std::uint32_t>(end - top) + 1 == level) --top;
    std::optional<std::string> chain;
    for (auto ancestor = top; ancestor != end; ++ancestor) {
      if (chain) {
        *chain += '.';
        *chain += (*ancestor->session)->sessionIDString();
      } else {
        chain = (*ancestor->session)->sessionIDString();
      }
    }
    if (end - top != static_cast<std::ptrdiff_t>(level)) log::standard(daemontexts::kGapInChain, chain);
    return chain;
  });
}

std::shared_ptr<ReportingdSession> CorrelatedSessions::parent(const ReportingdSession& session) const {
  const auto level = session.hierarchyLevel();
  const auto token = session.hierarchyToken();
  if (level == 0 || !token) return nullptr;
  log::standard(daemontexts::kCheckingParent, *token, session.sessionID());
  const auto* list = sessions(*token);
  if (list == nullptr) {
    log::error(daemontexts::kNoSessionsForParent, *token);
    return nullptr;
  }
  if (!contains(*list, session)) {
    log::error(daemontexts::kNotFoundForParent, session.sessionID(), *token);
    return nullptr;
  }
  auto found = firstSession(level - 1, *list);
  if (!found) log::standard(daemontexts::kNoParentAtLevel, level - 1, *token);
  return found;
}

std::shared_ptr<ReportingdSession> CorrelatedSessions::ancestorWithAggregator(const ReportingdSession& session) const {
  const auto token = session.hierarchyToken();
  const auto* list = token ? sessions(*token) : nullptr;
  if (list == nullptr) return nullptr;
  // Asked for every event: most hierarchies have nobody who aggregates.
  if (std::none_of(list->begin(), list->end(), [](const auto& listed) { return listed->hasAggregator(); })) {
    return nullptr;
  }
  return withFirstSessionsBelow(
      session.hierarchyLevel(), *list, [](auto begin, auto end) -> std::shared_ptr<ReportingdSession> {
        const auto found =
            std::find_if(begin, end, [](const auto& ancestor) { return (*ancestor.session)->hasAggregator(); });
        return found != end ? *found->session : nullptr;
      });
}

SessionList CorrelatedSessions::descendants(const ReportingdSession& session) const {
  const auto token = session.hierarchyToken();
  const auto* list = token ? sessions(*token) : nullptr;
  SessionList deeper;
  if (list == nullptr) return deeper;
  std::copy_if(list->begin(), list->end(), std::back_inserter(deeper),
               [&](const auto& other) { return other->hierarchyLevel() > session.hierarchyLevel(); });
  return deeper;
}

}  // namespace velk
