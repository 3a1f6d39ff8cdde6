#include "client/VelkReportingAggregationObject.h"

#include "client/LogTexts.h"
#include "platform/Log.h"

namespace velk {

VelkReportingAggregationObject::VelkReportingAggregationObject(VelkReportingAggregationBlock aggregationBlock,
                                                               std::shared_ptr<Queue> callbackQueue)
    : _callbackQueue(std::move(callbackQueue)) {
  if (aggregationBlock) {
    _aggregationBlock = std::make_shared<const VelkReportingAggregationBlock>(std::move(aggregationBlock));
  }
}

void VelkReportingAggregationObject::sendMessageToClient(std::optional<PropertyDictionary> sessionInfo,
                                                         double timestamp, std::uint16_t category, std::uint16_t type,
                                                         std::optional<PropertyDictionary> payload) {
  log::standard(texts::kSendMessageToClient, category, type);
  if (!hasAggregationBlock()) return;
  _callbackQueue->async([self = shared_from_this(), sessionInfo = std::move(sessionInfo), timestamp, category, type,
                         payload = std::move(payload)] {
    const SharedBlock current = self->block();
    if (!current) return;
    try {
      (*current)(sessionInfo, timestamp, category, type, payload);
    } catch (...) {  // the client's own code: whatever it throws must not end its process
      log::standard(texts::kAggregationBlockThrew);
      self->releaseAggregationBlock();
    }
  });
}

bool VelkReportingAggregationObject::hasAggregationBlock() const { return block() != nullptr; }

void VelkReportingAggregationObject::releaseAggregationBlock() {
  SharedBlock released;
  {
    Guard guard(_lock);
    released.swap(_aggregationBlock);
  }
  // It may own anything, and the end of that may wait for the library's thread: it ends where callbacks run.
  if (released) _callbackQueue->async([released = std::move(released)] {});
}

VelkReportingAggregationObject::SharedBlock VelkReportingAggregationObject::block() const {
  Guard guard(_lock);
  return _aggregationBlock;
}

}  // namespace velk
