#include "tools/collector/DashboardStore.h"

#include <sqlite3.h>

namespace velk::collector {
namespace {

constexpr const char* kSchema = R"(
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

}  // namespace

DashboardStore::DashboardStore() = default;

DashboardStore::~DashboardStore() = default;

Result<std::unique_ptr<DashboardStore>> DashboardStore::open(const std::string& path) {
  std::unique_ptr<DashboardStore> store(new DashboardStore);
  if (Result<void> prepared = store->prepare(path); !prepared) return Failure(std::move(prepared).error());
  return store;
}

Result<void> DashboardStore::prepare(const std::string& path) {
  Guard guard(_lock);
  if (Result<void> opened = _database.open(path, kSchema); !opened) return opened;
  for (auto& [statement, sql] : {std::pair<Statement&, const char*>{_insertDatagram, kInsertDatagram},
                                 {_insertLogData, kInsertLogData},
                                 {_selectLogData, kSelectLogData}}) {
    Result<Statement> prepared = _database.statement(sql);
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
  bindColumn(statement, 1, secondsFromTimeValue(received));
  bindColumn(statement, 2, nameOf(datagram.fate));
  bindColumn(statement, 3, sent);
  bindColumn(statement, 4, std::int64_t{header.component});
  bindColumn(statement, 5, std::int64_t{header.majorVersion});
  bindColumn(statement, 6, std::int64_t{header.sessionID});
  bindColumn(statement, 7, std::int64_t{header.clientVersion});
  bindColumn(statement, 8, std::int64_t{header.eventNumber});
  bindColumn(statement, 9, std::int64_t{header.method});
  bindColumn(statement, 10, std::int64_t{header.respCode});
  bindColumn(statement, 11, Blob{{header.deviceIdentifier.data(), header.deviceIdentifier.size()}});
  bindColumn(statement, 12, std::int64_t{header.flags});
  bindColumn(statement, 13, Blob{datagram.text});
  return _database.step(statement);
}

Result<std::int64_t> DashboardStore::addLogData(std::string_view archive, std::size_t entries, TimeValue received) {
  Guard guard(_lock);
  sqlite3_stmt* statement = _insertLogData.get();
  bindColumn(statement, 1, secondsFromTimeValue(received));
  bindColumn(statement, 2, static_cast<std::int64_t>(entries));
  bindColumn(statement, 3, Blob{archive});
  if (Result<void> stepped = _database.step(statement); !stepped) return Failure(std::move(stepped).error());
  return _database.lastRow();
}

Result<std::string> DashboardStore::logData(std::int64_t number) {
  Guard guard(_lock);
  sqlite3_stmt* statement = _selectLogData.get();
  bindColumn(statement, 1, number);
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

}  // namespace velk::collector
