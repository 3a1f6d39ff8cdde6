// The collector's dashboard: keeps and shows the datagrams that arrive, and takes the log data that sessions post.
#pragma once

#include <atomic>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Clock.h"
#include "tools/collector/Announcer.h"
#include "tools/collector/Collector.h"
#include "tools/collector/DashboardListener.h"
#include "tools/collector/DashboardStore.h"

namespace velk::collector {

/// Made by the program before listener and server, and outlives them. Any thread.
class Dashboard {
 public:
  /// `store` may be null (nothing is kept); it and the others outlive the dashboard.
  Dashboard(DashboardStore* store, Announcer& announcer, const Clock& clock);

  void take(const ReceivedDatagram& datagram);
  /// Takes an archived array and answers, as plain text, where it can be seen from now on; 400 with a sentence when it
  /// is none, 500 when it cannot be stored.
  [[nodiscard]] Answer postLogData(const HeaderList& headers, std::string_view archive);
  /// The archive as it came, or 404.
  [[nodiscard]] Answer logData(const std::string& number);

 private:
  [[nodiscard]] Answer refuse(int status, const std::string& reason);

  DashboardStore* const _store;
  Announcer& _announcer;
  const Clock& _clock;
  std::atomic<std::int64_t> _logDataTaken{0};  ///< numbers what is not kept
};

}  // namespace velk::collector
