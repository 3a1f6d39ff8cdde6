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
#include "tools/collector/Database.h"
#include "tools/collector/ReceivedPost.h"

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
  PostStore();
  [[nodiscard]] Result<void> prepare(const std::string& path);
  [[nodiscard]] Result<std::int64_t> insertPostLocked(const ReceivedPost& post, const std::string& path,
                                                      const HeaderList& headers, TimeValue received)
      VELK_REQUIRES(_lock);
  [[nodiscard]] Result<void> insertEventLocked(std::int64_t post, const PropertyDictionary& event) VELK_REQUIRES(_lock);
  [[nodiscard]] Result<std::int64_t> insertAllLocked(const ReceivedPost& post, const std::string& path,
                                                     const HeaderList& headers, TimeValue received)
      VELK_REQUIRES(_lock);

  // Held while SQLite writes: that is what it is for.
  Lock _lock;
  Database _database VELK_GUARDED_BY(_lock);
  Statement _insertPost VELK_GUARDED_BY(_lock);
  Statement _insertEvent VELK_GUARDED_BY(_lock);
};

}  // namespace velk::collector
