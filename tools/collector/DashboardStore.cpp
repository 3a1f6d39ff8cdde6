#include "tools/collector/DashboardStore.h"

#include <sqlite3.h>

#include "platform/Files.h"

namespace velk::collector {
namespace {

constexpr int kBusyTimeoutMs = 5000;

constexpr const char* kSchema = R"(
PRAGMA journal_mode = WAL;
PRAGMA synchronous = NORMAL;
CREATE TABLE IF NOT EXISTS datagrams (
  id INTEGER PRIMARY KEY, received REAL NOT NULL, fate TEXT NOT NULL, sent REAL NOT NULL, component INTEGER NOT NULL,
  major_version INTEGER NOT NULL, session INTEGER NOT NULL, client_version INTEGER NOT NULL,
  event_number INTEGER NOT NULL, method INTEGER NOT NULL, status INTEGER NOT NULL, device BLOB NOT NULL,
  flags INTEGER NOT NULL, text BLOB NOT NULL);
CREATE TABLE IF NOT EXISTS log_data (
  id INTEGER PRIMARY KEY, received REAL NOT NULL, entries INTEGER NOT NULL, archive BLOB NOT NULL);
)";

constexpr const char* kInsertDatagram =
    "INSERT INTO datagrams (received, fate, sent, component, major_version, session, client_version, event_number,"
    " method, status, device, flags, text) VALUES (?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?)";
constexpr const char* kInsertLogData = "INSERT INTO log_data (received, entries, archive) VALUES (?, ?, ?)";
constexpr const char* kSelectLogData = "SELECT archive FROM log_data WHERE id = ?";

// Texts and bytes outlive the step that uses them, so SQLite need not copy them.
void bind(sqlite3_stmt* statement, int column, std::string_view text) {
  sqlite3_bind_text64(statement, column, text.data(), text.size(), SQLITE_STATIC, SQLITE_UTF8);
}

void bindBytes(sqlite3_stmt* statement, int column, std::string_view bytes) {
  sqlite3_bind_blob64(statement, column, bytes.data(), bytes.size(), SQLITE_STATIC);
}

void bind(sqlite3_stmt* statement, int column, std::int64_t number) { sqlite3_bind_int64(statement, column, number); }

void bind(sqlite3_stmt* statement, int column, double number) { sqlite3_bind_double(statement, column, number); }

}  // namespace

void DashboardStore::DatabaseClose::operator()(sqlite3* database) const noexcept { sqlite3_close(database); }

void DashboardStore::StatementFinalize::operator()(sqlite3_stmt* statement) const noexcept {
  sqlite3_finalize(statement);
}

DashboardStore::DashboardStore() = default;

DashboardStore::~DashboardStore() = default;

Result<std::unique_ptr<DashboardStore>> DashboardStore::open(const std::string& path) {
  std::unique_ptr<DashboardStore> store(new DashboardStore);
  if (Result<void> prepared = store->prepare(path); !prepared) return Failure(std::move(prepared).error());
  return store;
}

Result<void> DashboardStore::prepare(const std::string& path) {
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
  if (sqlite3_exec(database, kSchema, nullptr, nullptr, nullptr) != SQLITE_OK) return problemLocked("use the database");
  for (auto& [statement, sql] : {std::pair<Statement&, const char*>{_insertDatagram, kInsertDatagram},
                                 {_insertLogData, kInsertLogData},
                                 {_selectLogData, kSelectLogData}}) {
    Result<Statement> prepared = statementLocked(sql);
    if (!prepared) return Failure(std::move(prepared).error());
    statement = std::move(*prepared);
  }
  return {};
}

Result<void> DashboardStore::add(const ReceivedDatagram& datagram, TimeValue received) {
  const dashboard::Header& header = datagram.header;
  const double sent = header.seconds + header.fourMilliseconds * dashboard::kFourMilliseconds / 1000.0;
  Guard guard(_lock);
  sqlite3_stmt* statement = _insertDatagram.get();
  bind(statement, 1, secondsFromTimeValue(received));
  bind(statement, 2, nameOf(datagram.fate));
  bind(statement, 3, sent);
  bind(statement, 4, std::int64_t{header.component});
  bind(statement, 5, std::int64_t{header.majorVersion});
  bind(statement, 6, std::int64_t{header.sessionID});
  bind(statement, 7, std::int64_t{header.clientVersion});
  bind(statement, 8, std::int64_t{header.eventNumber});
  bind(statement, 9, std::int64_t{header.method});
  bind(statement, 10, std::int64_t{header.respCode});
  bindBytes(statement, 11, {header.deviceIdentifier.data(), header.deviceIdentifier.size()});
  bind(statement, 12, std::int64_t{header.flags});
  bindBytes(statement, 13, datagram.text);
  return stepLocked(statement);
}

Result<std::int64_t> DashboardStore::addLogData(std::string_view archive, std::size_t entries, TimeValue received) {
  Guard guard(_lock);
  sqlite3_stmt* statement = _insertLogData.get();
  bind(statement, 1, secondsFromTimeValue(received));
  bind(statement, 2, static_cast<std::int64_t>(entries));
  bindBytes(statement, 3, archive);
  if (Result<void> stepped = stepLocked(statement); !stepped) return Failure(std::move(stepped).error());
  return sqlite3_last_insert_rowid(_database.get());
}

Result<std::string> DashboardStore::logData(std::int64_t number) {
  Guard guard(_lock);
  sqlite3_stmt* statement = _selectLogData.get();
  bind(statement, 1, number);
  std::string archive;
  const bool found = sqlite3_step(statement) == SQLITE_ROW;
  if (found) {
    const auto* bytes = static_cast<const char*>(sqlite3_column_blob(statement, 0));
    const int size = sqlite3_column_bytes(statement, 0);
    if (bytes != nullptr) archive.assign(bytes, static_cast<std::size_t>(size));
  }
  sqlite3_reset(statement);
  if (!found) return failure("database", SQLITE_NOTFOUND, "there is no such log data");
  return archive;
}

Result<void> DashboardStore::stepLocked(sqlite3_stmt* statement) {
  const int stepped = sqlite3_step(statement);
  sqlite3_reset(statement);
  sqlite3_clear_bindings(statement);
  if (stepped != SQLITE_DONE) return problemLocked("write to the database");
  return {};
}

Result<DashboardStore::Statement> DashboardStore::statementLocked(const char* sql) {
  sqlite3_stmt* statement = nullptr;
  if (sqlite3_prepare_v3(_database.get(), sql, -1, SQLITE_PREPARE_PERSISTENT, &statement, nullptr) != SQLITE_OK) {
    return problemLocked("use the database");
  }
  return Statement(statement);
}

Failure DashboardStore::problemLocked(const char* doing) {
  return failure("database", sqlite3_errcode(_database.get()),
                 std::string("cannot ") + doing + ": " + sqlite3_errmsg(_database.get()));
}

}  // namespace velk::collector
