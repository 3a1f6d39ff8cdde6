// What a client tells of the messages that it hands over: implemented by its user.
#pragma once

#include <memory>

#include "foundation/PropertyValue.h"

namespace velk {

class VelkReporting;

/// Hears of every valid message that a client hands over, filtered or not. Called in order, on the library's threads.
/// While it is slow, 16,384 messages (or 8 MiB of them) wait for it; the log hears of those that are dropped beyond
/// that. `client` is null for a message whose client has been released meanwhile. One that throws ends the process.
class VelkReportingMessageSentDelegate {
 public:
  virtual ~VelkReportingMessageSentDelegate() = default;
  virtual void didSendMessageForReportingClient(const std::shared_ptr<VelkReporting>& client,
                                                const PropertyDictionary& event) = 0;
};

}  // namespace velk
