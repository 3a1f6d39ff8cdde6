// Facts of this machine from /proc and the file system, as payloads. Used by the sample reporter.
#pragma once

#include "foundation/PropertyValue.h"

namespace velk::examples {

/// Load averages, runnable tasks and uptime.
[[nodiscard]] PropertyDictionary loadFacts();
/// Total, available, cached and swap memory in KiB.
[[nodiscard]] PropertyDictionary memoryFacts();
/// Size and free space of the root file system in bytes, and sectors read and written since the start.
[[nodiscard]] PropertyDictionary diskFacts();
/// Bytes and packets of all interfaces but the loopback.
[[nodiscard]] PropertyDictionary networkFacts();

}  // namespace velk::examples
