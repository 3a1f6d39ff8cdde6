// What the dashboard's side of the collector keeps, in an SQLite file of its own.
//   datagrams (id, received, fate, sent, component, major_version, session, client_version, event_number, method,
//              status, device, flags, text)
//   log_data  (id, received, entries, archive)
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "foundation/Error.h"
#include "foundation/TimeValue.h"
#include "platform/Lock.h"
#include "tools/collector/DashboardListener.h"
#include "tools/collector/Database.h"

namespace velk::collector {

/// Any thread; entries are written one after the other.
class DashboardStore {
 public:
  /// Opens or makes the file (0600). Fails with a sentence when it is no database or cannot be written.
  [[nodiscard]] static Result<std::unique_ptr<DashboardStore>> open(const std::string& path);
  ~DashboardStore();
  DashboardStore(const DashboardStore&) = delete;
  DashboardStore& operator=(const DashboardStore&) = delete;

  [[nodiscard]] Result<void> add(const ReceivedDatagram& datagram, TimeValue received);
  /// Answers its number.
  [[nodiscard]] Result<std::int64_t> addLogData(std::string_view archive, std::size_t entries, TimeValue received);
  /// The archive of that number; fails when there is none.
  [[nodiscard]] Result<std::string> logData(std::int64_t number);

 private:
  DashboardStore();
  [[nodiscard]] Result<void> prepare(const std::string& path);

  // Held while SQLite works: that is what it is for.
  Lock _lock;
  Database _database VELK_GUARDED_BY(_lock);
  Statement _insertDatagram VELK_GUARDED_BY(_lock);
  Statement _insertLogData VELK_GUARDED_BY(_lock);
  Statement _selectLogData VELK_GUARDED_BY(_lock);
};

}  // namespace velk::collector
