#include "tools/collector/UploadStore.h"

#include "platform/Files.h"

namespace velk::collector {
namespace {

constexpr std::size_t kLongestFileName = 100;

constexpr const char* kSchema = R"(
CREATE TABLE IF NOT EXISTS uploads (
  id INTEGER PRIMARY KEY, received REAL NOT NULL, name TEXT NOT NULL, target TEXT NOT NULL,
  wire_bytes INTEGER NOT NULL, file_bytes INTEGER NOT NULL, file TEXT);
)";
constexpr const char* kInsert =
    "INSERT INTO uploads (received, name, target, wire_bytes, file_bytes, file) VALUES (?, ?, ?, ?, ?,"
    " (SELECT COALESCE(MAX(id), 0) + 1 FROM uploads) || '-' || ?)";

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
  Guard guard(_lock);
  if (Result<void> opened = _database.open(databasePath, kSchema); !opened) return opened;
  Result<Statement> insert = _database.statement(kInsert);
  if (!insert) return Failure(std::move(insert).error());
  _insert = std::move(*insert);
  return {};
}

Result<std::int64_t> UploadStore::keep(const KeptUpload& upload, TimeValue received) {
  Guard guard(_lock);
  if (Result<void> begun = _database.begin(); !begun) return Failure(std::move(begun).error());
  return _database.end(insertAndMoveLocked(upload, received));
}

/// The file before the line is there for good: a line without a file would promise what is not there.
Result<std::int64_t> UploadStore::insertAndMoveLocked(const KeptUpload& upload, TimeValue received) {
  Result<std::int64_t> number = insertLocked(upload, received);
  if (!number) return number;
  const auto moved = files::move(upload.path, _directory + "/" + std::to_string(*number) + "-" + harmless(upload.name));
  if (!moved) return Failure(moved.error());
  return number;
}

Result<std::int64_t> UploadStore::insertLocked(const KeptUpload& upload, TimeValue received) {
  const std::string file = harmless(upload.name);
  bindColumn(_insert.get(), 1, secondsFromTimeValue(received));
  bindColumn(_insert.get(), 2, upload.name);
  bindColumn(_insert.get(), 3, upload.target);
  bindColumn(_insert.get(), 4, static_cast<std::int64_t>(upload.wireBytes));
  bindColumn(_insert.get(), 5, static_cast<std::int64_t>(upload.fileBytes));
  bindColumn(_insert.get(), 6, file);
  if (Result<void> stepped = _database.step(_insert.get()); !stepped) return Failure(std::move(stepped).error());
  return _database.lastRow();
}

}  // namespace velk::collector
