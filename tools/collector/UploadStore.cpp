#include "tools/collector/UploadStore.h"

#include <sqlite3.h>

#include "platform/Files.h"

namespace velk::collector {
namespace {

constexpr int kBusyTimeoutMs = 5000;
constexpr std::size_t kLongestFileName = 100;

constexpr const char* kSchema = R"(
PRAGMA journal_mode = WAL;
PRAGMA synchronous = NORMAL;
CREATE TABLE IF NOT EXISTS uploads (
  id INTEGER PRIMARY KEY, received REAL NOT NULL, name TEXT NOT NULL, target TEXT NOT NULL,
  wire_bytes INTEGER NOT NULL, file_bytes INTEGER NOT NULL, file TEXT);
)";
constexpr const char* kInsert =
    "INSERT INTO uploads (received, name, target, wire_bytes, file_bytes, file) VALUES (?, ?, ?, ?, ?,"
    " (SELECT COALESCE(MAX(id), 0) + 1 FROM uploads) || '-' || ?)";

void bind(sqlite3_stmt* statement, int column, const std::string& text) {
  sqlite3_bind_text64(statement, column, text.data(), text.size(), SQLITE_STATIC, SQLITE_UTF8);
}

/// What no file system and no shell takes amiss.
std::string harmless(const std::string& name) {
  std::string safe = name.substr(0, kLongestFileName);
  for (char& character : safe) {
    const bool isLetter = (character >= 'a' && character <= 'z') || (character >= 'A' && character <= 'Z');
    const bool isDigit = character >= '0' && character <= '9';
    if (!isLetter && !isDigit && character != '.' && character != '-') character = '_';
  }
  return safe;
}

}  // namespace

void UploadStore::DatabaseClose::operator()(sqlite3* database) const noexcept { sqlite3_close(database); }

UploadStore::~UploadStore() = default;

Result<std::unique_ptr<UploadStore>> UploadStore::open(const std::string& stateDirectory) {
  std::unique_ptr<UploadStore> store(new UploadStore(stateDirectory + "/uploads"));
  if (auto made = files::createDirectories(store->_directory, 0700); !made) return Failure(std::move(made).error());
  if (auto prepared = store->prepare(stateDirectory + "/uploads.sqlite"); !prepared) {
    return Failure(std::move(prepared).error());
  }
  return store;
}

Result<void> UploadStore::prepare(const std::string& databasePath) {
  if (!files::exists(databasePath)) {
    if (Result<void> made = files::writeAtomically(databasePath, {}, 0600); !made) return made;
  }
  Guard guard(_lock);
  sqlite3* database = nullptr;
  const int opened =
      sqlite3_open_v2(databasePath.c_str(), &database, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX, nullptr);
  _database.reset(database);
  if (opened != SQLITE_OK) return problemLocked("open the database");
  sqlite3_busy_timeout(database, kBusyTimeoutMs);
  return runLocked(kSchema);
}

Result<std::int64_t> UploadStore::keep(const KeptUpload& upload, TimeValue received) {
  Guard guard(_lock);
  if (Result<void> begun = runLocked("BEGIN IMMEDIATE"); !begun) return Failure(std::move(begun).error());
  Result<std::int64_t> number = insertLocked(upload, received);
  if (number) {
    // The file first: a line without a file would promise what is not there.
    const auto moved =
        files::move(upload.path, _directory + "/" + std::to_string(*number) + "-" + harmless(upload.name));
    const auto committed = moved ? runLocked("COMMIT") : moved;
    if (committed) return number;
    number = Failure(committed.error());
  }
  // Fails when SQLite has rolled back by itself; the first error is the one to tell.
  (void)runLocked("ROLLBACK");
  return number;
}

Result<std::int64_t> UploadStore::insertLocked(const KeptUpload& upload, TimeValue received) {
  sqlite3_stmt* statement = nullptr;
  if (sqlite3_prepare_v2(_database.get(), kInsert, -1, &statement, nullptr) != SQLITE_OK) {
    return problemLocked("use the database");
  }
  const std::unique_ptr<sqlite3_stmt, int (*)(sqlite3_stmt*)> owner(statement, &sqlite3_finalize);
  const std::string file = harmless(upload.name);
  sqlite3_bind_double(statement, 1, secondsFromTimeValue(received));
  bind(statement, 2, upload.name);
  bind(statement, 3, upload.target);
  sqlite3_bind_int64(statement, 4, static_cast<std::int64_t>(upload.wireBytes));
  sqlite3_bind_int64(statement, 5, static_cast<std::int64_t>(upload.fileBytes));
  bind(statement, 6, file);
  if (sqlite3_step(statement) != SQLITE_DONE) return problemLocked("write to the database");
  return sqlite3_last_insert_rowid(_database.get());
}

Result<void> UploadStore::runLocked(const char* sql) {
  if (sqlite3_exec(_database.get(), sql, nullptr, nullptr, nullptr) == SQLITE_OK) return {};
  return problemLocked("use the database");
}

Failure UploadStore::problemLocked(const char* doing) {
  return failure("database", sqlite3_errcode(_database.get()),
                 std::string("cannot ") + doing + ": " + sqlite3_errmsg(_database.get()));
}

}  // namespace velk::collector
