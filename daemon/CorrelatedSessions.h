// The sessions of each hierarchy token, in the order in which they registered, and the questions that sessions ask
// about their relatives. Part of the agent, whose lock guards every call.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <unordered_set>
#include <utility>
#include <vector>

namespace velk {

class ReportingdSession;

/// The session at a level always means the first one in the token's list with exactly that level: levels may be
/// shared, and may be missing.
class CorrelatedSessions {
 public:
  using SessionList = std::vector<std::shared_ptr<ReportingdSession>>;

  /// Lists that the last session left for another token stay until a session ends, but no more than this many: a
  /// client may make up tokens for as long as it likes.
  static constexpr std::size_t kMaximumDesertedLists = 16;

  /// Puts the session at the end of its token's list, out of any other. Standalone sessions are not listed. Returns
  /// the tokens whose deserted lists were dropped for it.
  [[nodiscard]] std::vector<std::string> add(ReportingdSession& session);
  /// Takes the session out of the list where it stands, under whatever token. Returns the tokens that are now without
  /// sessions; they have been dropped.
  [[nodiscard]] std::vector<std::string> remove(const ReportingdSession& session);

  /// The identifier strings of the ancestors from the root to the parent, joined by "."; those above a gap are missing.
  [[nodiscard]] std::optional<std::string> parentSessionIDString(const ReportingdSession& session) const;
  [[nodiscard]] std::shared_ptr<ReportingdSession> parent(const ReportingdSession& session) const;
  /// The ancestor nearest to the root that aggregates.
  [[nodiscard]] std::shared_ptr<ReportingdSession> ancestorWithAggregator(const ReportingdSession& session) const;
  /// Every deeper session of the token, in list order.
  [[nodiscard]] SessionList descendants(const ReportingdSession& session) const;

  /// While it lives, questions about sessions of this token are answered from an index, as of its making: for asking
  /// about every session of a tree, which would otherwise walk the whole list for each. Made under the agent's lock,
  /// which is held for as long as it lives. A session that registers or leaves meanwhile ends the index.
  class Survey {
   public:
    Survey(CorrelatedSessions& sessions, const std::string& token) : _sessions(sessions) { _sessions.makeIndex(token); }
    ~Survey() { _sessions._index.reset(); }
    Survey(const Survey&) = delete;
    Survey& operator=(const Survey&) = delete;

   private:
    CorrelatedSessions& _sessions;
  };

  [[nodiscard]] std::size_t tokenCount() const noexcept { return _sessions.size(); }
  /// Every token with its sessions in list order; deserted lists are there as well.
  [[nodiscard]] std::vector<std::pair<std::string, SessionList>> snapshot() const {
    return {_sessions.begin(), _sessions.end()};
  }

  [[nodiscard]] static std::shared_ptr<ReportingdSession> getFirstSessionWithHierarchy(std::uint32_t level,
                                                                                       const SessionList& sessionList);

 private:
  struct LevelledSession {
    std::uint32_t level;
    /// In a list that outlives it.
    const std::shared_ptr<ReportingdSession>* session;
  };
  struct Index {
    const SessionList* list;
    std::unordered_set<const ReportingdSession*> members;
    /// Of each level, from the root on.
    std::vector<LevelledSession> firstSessions;
  };

  [[nodiscard]] static std::vector<LevelledSession> firstSessionsBelow(std::uint32_t level, const SessionList& list);
  void makeIndex(const std::string& token);
  /// The index, if there is one of this list; else null.
  [[nodiscard]] const Index* indexOf(const SessionList& list) const;
  [[nodiscard]] bool contains(const SessionList& list, const ReportingdSession& session) const;
  [[nodiscard]] std::shared_ptr<ReportingdSession> firstSession(std::uint32_t level, const SessionList& list) const;
  /// Calls `use` with the first sessions of the levels below `level`, from the root on: two iterators.
  template <class Use>
  [[nodiscard]] auto withFirstSessionsBelow(std::uint32_t level, const SessionList& list, Use use) const;

  [[nodiscard]] std::vector<std::string> dropEmptyLists();
  /// Null when the token has no list or an empty one.
  [[nodiscard]] const SessionList* sessions(const std::string& token) const;

  std::map<std::string, SessionList, std::less<>> _sessions;
  std::optional<Index> _index;
};

}  // namespace velk
