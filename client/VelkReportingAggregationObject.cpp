#include "client/VelkReportingAggregationObject.h"

#include "client/LogTexts.h"
#include "platform/Log.h"

namespace velk {

VelkReportingAggregationObject::VelkReportingAggregationObject(VelkReportingAggregationBlock aggregationBlock,
                                                               std::shared_ptr<Queue> callbackQueue)
    : _callbackQueue(std::move(callbackQueue)),
      _room(std::make_shared<CallbackRoom>(texts::kAggregationBlockIsSlow, texts::kAggregationBlockWasSlow)) {
  if (aggregationBlock) {
    _aggregationBlock = std::make_shared<const VelkReportingAggregationBlock>(std::move(aggregationBlock));
  }
}

bool VelkReportingAggregationObject::Event::endsAggregation() const {
  return !sessionInfo && !payload && timestamp == 0 && category == 0 && type == 0;
}

std::size_t VelkReportingAggregationObject::Event::size() const {
  return (sessionInfo ? estimatedSize(*sessionInfo) : 0) + (payload ? estimatedSize(*payload) : 0);
}

void VelkReportingAggregationObject::sendMessageToClient(std::optional<PropertyDictionary> sessionInfo,
                                                         double timestamp, std::uint16_t category, std::uint16_t type,
                                                         std::optional<PropertyDictionary> payload) {
  log::standard(texts::kSendMessageToClient, category, type);
  if (!hasAggregationBlock()) return;
  Event event{std::move(sessionInfo), timestamp, category, type, std::move(payload)};
  // The end needs no room, so that it is heard however far behind the block is; one of them is enough.
  const bool ends = event.endsAggregation();
  if (ends && _endIsWaiting.exchange(true)) return;
  auto place = ends ? CallbackRoom::Place() : _room->reserve(event.size());
  if (!ends && !place) return;
  _callbackQueue->async([self = shared_from_this(), event = std::move(event), ends, place = std::move(place)] {
    if (ends) self->_endIsWaiting = false;
    self->runBlock(event);
  });
}

void VelkReportingAggregationObject::runBlock(const Event& event) {
  const SharedBlock current = block();
  if (!current) return;
  try {
    (*current)(event.sessionInfo, event.timestamp, event.category, event.type, event.payload);
  } catch (...) {  // the client's own code: whatever it throws must not end its process
    log::standard(texts::kAggregationBlockThrew);
    releaseAggregationBlock();
  }
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
