#include "tools/collector/Database.h"

#include <sqlite3.h>

#include "platform/Files.h"

namespace velk::collector {
namespace {

constexpr int kBusyTimeoutMs = 5000;
constexpr const char* kSettings = "PRAGMA journal_mode = WAL; PRAGMA synchronous = NORMAL;";

}  // namespace

void DatabaseClose::operator()(sqlite3* database) const noexcept { sqlite3_close(database); }

void StatementFinalize::operator()(sqlite3_stmt* statement) const noexcept { sqlite3_finalize(statement); }

void bindColumn(sqlite3_stmt* statement, int column, std::string_view text) {
  sqlite3_bind_text64(statement, column, text.data(), text.size(), SQLITE_STATIC, SQLITE_UTF8);
}

void bindColumn(sqlite3_stmt* statement, int column, Blob blob) {
  sqlite3_bind_blob64(statement, column, blob.bytes.data(), blob.bytes.size(), SQLITE_STATIC);
}

void bindColumn(sqlite3_stmt* statement, int column, std::int64_t number) {
  sqlite3_bind_int64(statement, column, number);
}

void bindColumn(sqlite3_stmt* statement, int column, double number) { sqlite3_bind_double(statement, column, number); }

Result<void> Database::open(const std::string& path, const char* schema) {
  _path = path;
  // SQLite would make the file readable for others, and its journal files take the mode of the first.
  if (!files::exists(path)) {
    if (Result<void> made = files::writeAtomically(path, {}, 0600); !made) return made;
  }
  sqlite3* database = nullptr;
  const int opened = sqlite3_open_v2(path.c_str(), &database, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  _handle.reset(database);
  if (opened != SQLITE_OK) return problem("open the database");
  sqlite3_busy_timeout(database, kBusyTimeoutMs);
  if (Result<void> set = run(kSettings); !set) return set;
  return run(schema);
}

Result<void> Database::run(const char* sql) {
  if (sqlite3_exec(_handle.get(), sql, nullptr, nullptr, nullptr) == SQLITE_OK) return {};
  return problem("use the database");
}

Result<Statement> Database::statement(const char* sql) {
  sqlite3_stmt* statement = nullptr;
  if (sqlite3_prepare_v3(_handle.get(), sql, -1, SQLITE_PREPARE_PERSISTENT, &statement, nullptr) != SQLITE_OK) {
    return problem("use the database");
  }
  return Statement(statement);
}

Result<void> Database::step(sqlite3_stmt* statement) {
  const int stepped = sqlite3_step(statement);
  sqlite3_reset(statement);
  sqlite3_clear_bindings(statement);
  if (stepped != SQLITE_DONE) return problem("write to the database");
  return {};
}

Result<std::int64_t> Database::end(Result<std::int64_t> outcome) {
  if (outcome) {
    Result<void> committed = run("COMMIT");
    if (committed) return outcome;
    outcome = Failure(std::move(committed).error());
  }
  // Fails when SQLite has rolled back by itself; the first error is the one to tell.
  (void)run("ROLLBACK");
  return outcome;
}

std::int64_t Database::lastRow() const { return sqlite3_last_insert_rowid(_handle.get()); }

Failure Database::problem(const char* doing) const {
  const int code = sqlite3_errcode(_handle.get());
  std::string sentence = std::string("cannot ") + doing + " " + _path + ": " + sqlite3_errmsg(_handle.get());
  if (code == SQLITE_NOTADB || code == SQLITE_CORRUPT) sentence += ". Put it aside, and a new one is begun";
  return failure("database", code, std::move(sentence));
}

}  // namespace velk::collector
