// What a client exports to the daemon: it is handed the events of the sessions below its own.
#pragma once

#include <atomic>
#include <memory>

#include "client/CallbackRoom.h"
#include "client/VelkReporting.h"
#include "ipc/SessionInterface.h"
#include "platform/Lock.h"
#include "platform/Queue.h"

namespace velk {

/// Called on the library's thread; runs the client's block, if there is one, on `callbackQueue`, in order. A block
/// that throws is released and never called again. What waits for a slow block is bounded: events beyond that are
/// dropped, which the log hears of, but never the end of the aggregation. Lives as long as its connection.
class VelkReportingAggregationObject : public ClientSessionReplyInterface,
                                       public std::enable_shared_from_this<VelkReportingAggregationObject> {
 public:
  VelkReportingAggregationObject(VelkReportingAggregationBlock aggregationBlock, std::shared_ptr<Queue> callbackQueue);

  void sendMessageToClient(std::optional<PropertyDictionary> sessionInfo, double timestamp, std::uint16_t category,
                           std::uint16_t type, std::optional<PropertyDictionary> payload) override;

  [[nodiscard]] bool hasAggregationBlock() const;
  /// The client is going: its block is not called any more, but for a call that has begun.
  void releaseAggregationBlock();

 private:
  using SharedBlock = std::shared_ptr<const VelkReportingAggregationBlock>;
  struct Event {
    std::optional<PropertyDictionary> sessionInfo;
    double timestamp;
    std::uint16_t category;
    std::uint16_t type;
    std::optional<PropertyDictionary> payload;

    [[nodiscard]] bool endsAggregation() const;
    [[nodiscard]] std::size_t size() const;
  };
  [[nodiscard]] SharedBlock block() const;
  void runBlock(const Event& event);

  const std::shared_ptr<Queue> _callbackQueue;
  const std::shared_ptr<CallbackRoom> _room;
  std::atomic<bool> _endIsWaiting{false};
  mutable Lock _lock;
  SharedBlock _aggregationBlock VELK_GUARDED_BY(_lock);
};

}  // namespace velk
