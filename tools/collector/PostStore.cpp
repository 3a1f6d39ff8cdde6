#include "tools/collector/PostStore.h"

#include "foundation/Json.h"
#include "tools/JsonLines.h"

namespace velk::collector {
namespace {

constexpr const char* kSchema = R"(
CREATE TABLE IF NOT EXISTS posts (
  id INTEGER PRIMARY KEY, received REAL NOT NULL, path TEXT NOT NULL, headers TEXT NOT NULL, client_id TEXT NOT NULL,
  post_time REAL NOT NULL, events INTEGER NOT NULL, wire_bytes INTEGER NOT NULL, body_bytes INTEGER NOT NULL);
CREATE TABLE IF NOT EXISTS events (
  id INTEGER PRIMARY KEY, post INTEGER NOT NULL REFERENCES posts (id), method INTEGER, status INTEGER,
  event_number INTEGER, sender TEXT, session TEXT, json TEXT NOT NULL);
CREATE INDEX IF NOT EXISTS events_of_post ON events (post);
)";

constexpr const char* kInsertPost =
    "INSERT INTO posts (received, path, headers, client_id, post_time, events, wire_bytes, body_bytes)"
    " VALUES (?, ?, ?, ?, ?, ?, ?, ?)";
constexpr const char* kInsertEvent =
    "INSERT INTO events (post, method, status, event_number, sender, session, json) VALUES (?, ?, ?, ?, ?, ?, ?)";

std::string jsonOfHeaders(const HeaderList& headers) {
  PropertyDictionary dictionary;
  for (const auto& header : headers) dictionary.set(header.first, header.second);
  return tools::jsonText(dictionary);
}

}  // namespace

PostStore::PostStore() = default;

PostStore::~PostStore() = default;

Result<std::unique_ptr<PostStore>> PostStore::open(const std::string& path) {
  std::unique_ptr<PostStore> store(new PostStore);
  if (Result<void> prepared = store->prepare(path); !prepared) return Failure(std::move(prepared).error());
  return store;
}

Result<void> PostStore::prepare(const std::string& path) {
  Guard guard(_lock);
  if (Result<void> opened = _database.open(path, kSchema); !opened) return opened;
  Result<Statement> post = _database.statement(kInsertPost);
  if (!post) return Failure(std::move(post).error());
  _insertPost = std::move(*post);
  Result<Statement> event = _database.statement(kInsertEvent);
  if (!event) return Failure(std::move(event).error());
  _insertEvent = std::move(*event);
  return {};
}

Result<std::int64_t> PostStore::add(const ReceivedPost& post, const std::string& path, const HeaderList& headers,
                                    TimeValue received) {
  Guard guard(_lock);
  if (Result<void> begun = _database.begin(); !begun) return Failure(std::move(begun).error());
  return _database.end(insertAllLocked(post, path, headers, received));
}

Result<std::int64_t> PostStore::insertAllLocked(const ReceivedPost& post, const std::string& path,
                                                const HeaderList& headers, TimeValue received) {
  const Result<std::int64_t> number = insertPostLocked(post, path, headers, received);
  if (!number) return number;
  for (const PropertyDictionary& event : post.events) {
    if (Result<void> inserted = insertEventLocked(*number, event); !inserted) {
      return Failure(std::move(inserted).error());
    }
  }
  return number;
}

Result<std::int64_t> PostStore::insertPostLocked(const ReceivedPost& post, const std::string& path,
                                                 const HeaderList& headers, TimeValue received) {
  sqlite3_stmt* statement = _insertPost.get();
  const std::string headerText = jsonOfHeaders(headers);
  bindColumn(statement, 1, secondsFromTimeValue(received));
  bindColumn(statement, 2, path);
  bindColumn(statement, 3, headerText);
  bindColumn(statement, 4, post.clientId);
  bindColumn(statement, 5, post.postTime);
  bindColumn(statement, 6, static_cast<std::int64_t>(post.events.size()));
  bindColumn(statement, 7, static_cast<std::int64_t>(post.wireBytes));
  bindColumn(statement, 8, static_cast<std::int64_t>(post.bodyBytes));
  if (Result<void> stepped = _database.step(statement); !stepped) return Failure(std::move(stepped).error());
  return _database.lastRow();
}

Result<void> PostStore::insertEventLocked(std::int64_t post, const PropertyDictionary& event) {
  sqlite3_stmt* statement = _insertEvent.get();
  const EventFields fields = eventFields(event);
  const std::string text = tools::jsonText(event);
  bindColumn(statement, 1, post);
  bindColumn(statement, 2, fields.method);
  bindColumn(statement, 3, fields.status);
  bindColumn(statement, 4, fields.eventNumber);
  bindColumn(statement, 5, fields.sender);
  bindColumn(statement, 6, fields.session);
  bindColumn(statement, 7, text);
  return _database.step(statement);
}

}  // namespace velk::collector
