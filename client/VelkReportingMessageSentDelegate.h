// What a client tells of the messages that it hands over: implemented by its user.
#pragma once

#include <memory>

#include "foundation/PropertyValue.h"

namespace velk {

class VelkReporting;

/// Hears of every valid message that a client hands over, filtered or not. Called in order, on the library's threads.
class VelkReportingMessageSentDelegate {
 public:
  virtual ~VelkReportingMessageSentDelegate() = default;
  virtual void didSendMessageForReportingClient(const std::shared_ptr<VelkReporting>& client,
                                                const PropertyDictionary& event) = 0;
};

}  // namespace velk
