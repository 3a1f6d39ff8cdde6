// What one attempt to move bytes through a socket did.
#pragma once

#include <cstddef>

namespace velk {

struct Transfer {
  enum class Status { moved, wouldBlock, ended, failed };
  Status status = Status::moved;
  std::size_t bytes = 0;
  /// The system's error number when it failed.
  int error = 0;
};

}  // namespace velk
