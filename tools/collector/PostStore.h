// The collector's database: every post that was taken, and its events, in one SQLite file.
//   posts  (id, received, path, headers, client_id, post_time, events, wire_bytes, body_bytes)
//   events (id, post, method, status, event_number, sender, session, json)
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "foundation/Error.h"
#include "foundation/TimeValue.h"
#include "platform/Lock.h"
#include "tools/collector/ReceivedPost.h"

struct sqlite3;
struct sqlite3_stmt;

namespace velk::collector {

/// Any thread; posts are written one after the other. Several collectors may not share a file for long: a writer
/// that waits more than five seconds for another fails.
class PostStore {
 public:
  /// Opens or makes the file (0600). Fails with a sentence when it is no database or cannot be written.
  [[nodiscard]] static Result<std::unique_ptr<PostStore>> open(const std::string& path);
  ~PostStore();
  PostStore(const PostStore&) = delete;
  PostStore& operator=(const PostStore&) = delete;

  /// One transaction: the post is there with all its events, or not at all. Answers its number.
  [[nodiscard]] Result<std::int64_t> add(const ReceivedPost& post, const std::string& path, const HeaderList& headers,
                                         TimeValue received);

 private:
  struct DatabaseClose {
    void operator()(sqlite3* database) const noexcept;
  };
  struct StatementFinalize {
    void operator()(sqlite3_stmt* statement) const noexcept;
  };
  using Statement = std::unique_ptr<sqlite3_stmt, StatementFinalize>;

  PostStore();
  [[nodiscard]] Result<void> prepare(const std::string& path);
  [[nodiscard]] Result<void> runLocked(const char* sql) VELK_REQUIRES(_lock);
  [[nodiscard]] Result<Statement> statementLocked(const char* sql) VELK_REQUIRES(_lock);
  [[nodiscard]] Result<std::int64_t> insertPostLocked(const ReceivedPost& post, const std::string& path,
                                                      const HeaderList& headers, TimeValue received)
      VELK_REQUIRES(_lock);
  [[nodiscard]] Result<void> insertEventLocked(std::int64_t post, const PropertyDictionary& event) VELK_REQUIRES(_lock);
  [[nodiscard]] Result<std::int64_t> insertAllLocked(const ReceivedPost& post, const std::string& path,
                                                     const HeaderList& headers, TimeValue received)
      VELK_REQUIRES(_lock);
  [[nodiscard]] Result<void> stepLocked(sqlite3_stmt* statement) VELK_REQUIRES(_lock);
  [[nodiscard]] Failure problemLocked(const char* doing) VELK_REQUIRES(_lock);

  // Held while SQLite writes: that is what it is for.
  Lock _lock;
  std::unique_ptr<sqlite3, DatabaseClose> _database VELK_GUARDED_BY(_lock);
  Statement _insertPost VELK_GUARDED_BY(_lock);
  Statement _insertEvent VELK_GUARDED_BY(_lock);
};

}  // namespace velk::collector
