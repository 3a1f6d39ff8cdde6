#include "platform/FileDescriptor.h"

#include <unistd.h>

namespace velk {

FileDescriptor::~FileDescriptor() {
  // An error of close() leaves the descriptor closed all the same, so there is nothing to do about it.
  if (_descriptor >= 0) ::close(_descriptor);
}

}  // namespace velk
