// What the command line asks of the collector. Constant once it has been read.
#pragma once

#include <iosfwd>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "foundation/PropertyValue.h"
#include "tools/ExitCode.h"
#include "tools/collector/DashboardListener.h"

namespace velk::collector {

struct CollectorOptions {
  std::string listenAddress = "127.0.0.1";
  /// 0: the kernel chooses.
  int port = 8443;
  /// Certificates and the database.
  std::string stateDirectory;
  /// Signed envelopes, one file per storebag name.
  std::string storebagDirectory;
  /// When set, posts must carry a digest made with it.
  std::optional<ByteData> digestKey;
  /// Where the port is written, atomically, once connections are taken. Empty: nowhere.
  std::string portFile;
  /// A certificate of one's own (chain in PEM) and its key, in place of the test authority's. Both or none.
  std::string certificateFile;
  std::string privateKeyFile;
  bool json = false;
  bool quiet = false;
  /// Count only: nothing is parsed, stored or shown.
  bool sink = false;
  int maxAgeSeconds = 600;
  /// The port of dashboard datagrams; 0: the kernel chooses. Absent: none are taken.
  std::optional<int> dashboardPort;

  // Faults, for tests of the other end.
  double storebagDelaySeconds = 0;
  std::optional<int> storebagStatus;
  std::optional<int> postStatus;
  DashboardFaults dashboard;
};

/// Reads the command line (without the program's name). The other answer is the status to end with: the help has been
/// written to `out`, or what is wrong to `error`.
[[nodiscard]] std::variant<CollectorOptions, tools::ExitCode> readCollectorOptions(std::vector<std::string> arguments,
                                                                                   std::ostream& out,
                                                                                   std::ostream& error);

}  // namespace velk::collector
