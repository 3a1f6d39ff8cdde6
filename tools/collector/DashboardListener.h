// The dashboard's end of the collector: receives datagrams, acknowledges those whose senders wait for it, and plays a
// bad link for tests. Knows nothing of files or printing: what arrives goes to a handler.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "foundation/DashboardDatagram.h"
#include "foundation/Error.h"

namespace velk::collector {

/// How bad the link is. The same seed and the same order of arrival give the same losses.
struct DashboardFaults {
  double drop = 0;                  ///< fraction of the datagrams that are as good as never received
  double dropAcknowledgements = 0;  ///< fraction of the acknowledgements that are never sent
  std::uint64_t seed = 1;
  double acknowledgementDelaySeconds = 0;
};

enum class DatagramFate {
  received,        ///< the sender wants no acknowledgement
  acknowledged,    ///< it was sent, or will be after the delay
  unacknowledged,  ///< received, but the acknowledgement is lost
  dropped,         ///< lost on the way here
};
[[nodiscard]] std::string_view nameOf(DatagramFate fate) noexcept;

struct ReceivedDatagram {
  dashboard::Header header;
  std::string text;
  DatagramFate fate = DatagramFate::received;
};

/// Reads bytes that anybody may have sent; `fate` is left as it is made. Nothing when they are no datagram: shorter
/// than a header, of another length than the header says, or longer than a sender makes them.
[[nodiscard]] std::optional<ReceivedDatagram> readDatagram(std::span<const std::uint8_t> bytes);

/// Lifecycle: open -> start -> stop. Opened, started and stopped by one thread; one thread of its own in between.
class DashboardListener {
 public:
  /// Called on the listener's thread, before the acknowledgement leaves; must not block for long.
  using Handler = std::function<void(const ReceivedDatagram&)>;

  /// `address` is a number, of either version. `port` 0: any that is free. The kernel keeps what arrives from now on.
  [[nodiscard]] static Result<std::unique_ptr<DashboardListener>> open(const std::string& address, int port,
                                                                       const DashboardFaults& faults, Handler handler);
  virtual ~DashboardListener() = default;

  [[nodiscard]] virtual int port() const = 0;
  virtual void start() = 0;
  /// Joins the thread; acknowledgements that are still delayed are not sent. Idempotent; also done by the destructor.
  virtual void stop() = 0;
};

}  // namespace velk::collector
