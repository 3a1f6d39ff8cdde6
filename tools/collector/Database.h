// An SQLite file as the collector's stores use one: opened or made, prepared statements, transactions.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "foundation/Error.h"

struct sqlite3;
struct sqlite3_stmt;

namespace velk::collector {

struct DatabaseClose {
  void operator()(sqlite3* database) const noexcept;
};
struct StatementFinalize {
  void operator()(sqlite3_stmt* statement) const noexcept;
};
using Statement = std::unique_ptr<sqlite3_stmt, StatementFinalize>;

/// Bytes that are no text.
struct Blob {
  std::string_view bytes;
};

/// Columns count from 1. Texts and bytes are not copied: they must outlive the statement's step.
void bindColumn(sqlite3_stmt* statement, int column, std::string_view text);
void bindColumn(sqlite3_stmt* statement, int column, Blob blob);
void bindColumn(sqlite3_stmt* statement, int column, std::int64_t number);
void bindColumn(sqlite3_stmt* statement, int column, double number);
template <class Value>
void bindColumn(sqlite3_stmt* statement, int column, const std::optional<Value>& value) {
  // What is not bound is null.
  if (value) bindColumn(statement, column, *value);
}

/// Owned by a store, which locks it and ends its statements first.
class Database {
 public:
  /// Opens or makes the file (0600) and applies `schema`, which must bear being applied again. Fails with a sentence
  /// when it is no database or cannot be written. A writer waits up to five seconds for one of another process.
  [[nodiscard]] Result<void> open(const std::string& path, const char* schema);

  [[nodiscard]] Result<void> run(const char* sql);
  [[nodiscard]] Result<Statement> statement(const char* sql);
  /// Runs a statement that answers no rows, and readies it for the next time.
  [[nodiscard]] Result<void> step(sqlite3_stmt* statement);
  [[nodiscard]] std::int64_t lastRow() const;

  /// A transaction: what is done between `begin` and `end` is there whole, or not at all. `end` is told how the work
  /// went, and answers the same unless the transaction could not be closed.
  [[nodiscard]] Result<void> begin() { return run("BEGIN IMMEDIATE"); }
  [[nodiscard]] Result<std::int64_t> end(Result<std::int64_t> outcome);

 private:
  [[nodiscard]] Failure problem(const char* doing) const;

  std::string _path;
  std::unique_ptr<sqlite3, DatabaseClose> _handle;
};

}  // namespace velk::collector
