#include "tools/collector/PostStore.h"

#include <sqlite3.h>

#include "foundation/Json.h"
#include "platform/Files.h"
#include "tools/JsonLines.h"

namespace velk::collector {
namespace {

constexpr int kBusyTimeoutMs = 5000;

constexpr const char* kSchema = R"(
PRAGMA journal_mode = WAL;
PRAGMA synchronous = NORMAL;
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

// Texts outlive the step that uses them, so SQLite need not copy them.
void bind(sqlite3_stmt* statement, int column, const std::string& text) {
  sqlite3_bind_text64(statement, column, text.data(), text.size(), SQLITE_STATIC, SQLITE_UTF8);
}

void bind(sqlite3_stmt* statement, int column, std::int64_t number) { sqlite3_bind_int64(statement, column, number); }

void bind(sqlite3_stmt* statement, int column, double number) { sqlite3_bind_double(statement, column, number); }

template <class Value>
void bind(sqlite3_stmt* statement, int column, const std::optional<Value>& value) {
  if (value) {
    bind(statement, column, *value);
  } else {
    sqlite3_bind_null(statement, column);
  }
}

std::string jsonOfHeaders(const HeaderList& headers) {
  PropertyDictionary dictionary;
  for (const auto& header : headers) dictionary.set(header.first, header.second);
  return tools::jsonText(dictionary);
}

}  // namespace

void PostStore::DatabaseClose::operator()(sqlite3* database) const noexcept { sqlite3_close(database); }

void PostStore::StatementFinalize::operator()(sqlite3_stmt* statement) const noexcept { sqlite3_finalize(statement); }

PostStore::PostStore() = default;

PostStore::~PostStore() = default;

Result<std::unique_ptr<PostStore>> PostStore::open(const std::string& path) {
  std::unique_ptr<PostStore> store(new PostStore);
  if (Result<void> prepared = store->prepare(path); !prepared) return Failure(std::move(prepared).error());
  return store;
}

Result<void> PostStore::prepare(const std::string& path) {
  // SQLite would make the file readable for others, and its journal files take the mode of the first.
  if (!files::exists(path)) {
    if (Result<void> made = files::writeAtomically(path, {}, 0600); !made) return made;
  }
  Guard guard(_lock);
  sqlite3* database = nullptr;
  const int opened = sqlite3_open_v2(path.c_str(), &database, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  _database.reset(database);
  if (opened != SQLITE_OK) return problemLocked("open the database");
  sqlite3_busy_timeout(database, kBusyTimeoutMs);
  if (Result<void> made = runLocked(kSchema); !made) return made;

  Result<Statement> post = statementLocked(kInsertPost);
  if (!post) return Failure(std::move(post).error());
  _insertPost = std::move(*post);
  Result<Statement> event = statementLocked(kInsertEvent);
  if (!event) return Failure(std::move(event).error());
  _insertEvent = std::move(*event);
  return {};
}

Result<std::int64_t> PostStore::add(const ReceivedPost& post, const std::string& path, const HeaderList& headers,
                                    TimeValue received) {
  Guard guard(_lock);
  if (Result<void> begun = runLocked("BEGIN IMMEDIATE"); !begun) return Failure(std::move(begun).error());
  Result<std::int64_t> number = insertAllLocked(post, path, headers, received);
  if (number) {
    Result<void> committed = runLocked("COMMIT");
    if (committed) return number;
    number = Failure(std::move(committed).error());
  }
  // Fails when SQLite has rolled back by itself; the first error is the one to tell.
  (void)runLocked("ROLLBACK");
  return number;
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
  bind(statement, 1, secondsFromTimeValue(received));
  bind(statement, 2, path);
  bind(statement, 3, headerText);
  bind(statement, 4, post.clientId);
  bind(statement, 5, post.postTime);
  bind(statement, 6, static_cast<std::int64_t>(post.events.size()));
  bind(statement, 7, static_cast<std::int64_t>(post.wireBytes));
  bind(statement, 8, static_cast<std::int64_t>(post.bodyBytes));
  if (Result<void> stepped = stepLocked(statement); !stepped) return Failure(std::move(stepped).error());
  return sqlite3_last_insert_rowid(_database.get());
}

Result<void> PostStore::insertEventLocked(std::int64_t post, const PropertyDictionary& event) {
  sqlite3_stmt* statement = _insertEvent.get();
  const EventFields fields = eventFields(event);
  const std::string text = tools::jsonText(event);
  bind(statement, 1, post);
  bind(statement, 2, fields.method);
  bind(statement, 3, fields.status);
  bind(statement, 4, fields.eventNumber);
  bind(statement, 5, fields.sender);
  bind(statement, 6, fields.session);
  bind(statement, 7, text);
  return stepLocked(statement);
}

Result<void> PostStore::stepLocked(sqlite3_stmt* statement) {
  const int stepped = sqlite3_step(statement);
  sqlite3_reset(statement);
  sqlite3_clear_bindings(statement);
  if (stepped != SQLITE_DONE) return problemLocked("write to the database");
  return {};
}

Result<void> PostStore::runLocked(const char* sql) {
  if (sqlite3_exec(_database.get(), sql, nullptr, nullptr, nullptr) != SQLITE_OK) {
    return problemLocked("use the database");
  }
  return {};
}

Result<PostStore::Statement> PostStore::statementLocked(const char* sql) {
  sqlite3_stmt* statement = nullptr;
  if (sqlite3_prepare_v3(_database.get(), sql, -1, SQLITE_PREPARE_PERSISTENT, &statement, nullptr) != SQLITE_OK) {
    return problemLocked("use the database");
  }
  return Statement(statement);
}

Failure PostStore::problemLocked(const char* doing) {
  return failure("database", sqlite3_errcode(_database.get()),
                 std::string("cannot ") + doing + ": " + sqlite3_errmsg(_database.get()));
}

}  // namespace velk::collector
