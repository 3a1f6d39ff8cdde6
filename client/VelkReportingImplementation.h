// What stands behind a client object. Queued work owns it, so it outlives the object's last reference until that work
// is done; it joins no thread and waits for nothing that its own thread has to do.
//
// Bound to the reporting queue ("com.tavrin.VelkReporting.main", on the library's thread) unless a method says
// otherwise. What a periodic tick does not hold up runs on the queue beneath it, which excludes the former.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "client/CallbackRoom.h"
#include "client/ClientRuntime.h"
#include "client/EventLists.h"
#include "client/EventOutbox.h"
#include "client/IncomingEvents.h"
#include "client/PeriodicTasks.h"
#include "client/ReportingQueue.h"
#include "client/SessionLink.h"
#include "client/SharedCallback.h"
#include "client/VelkReporting.h"
#include "client/VelkReportingAggregationObject.h"
#include "platform/HandedFile.h"

namespace velk {

class VelkReportingImplementation final : public LeavingClient,
                                          public std::enable_shared_from_this<VelkReportingImplementation> {
 public:
  /// Codes of errors that only the library makes.
  static constexpr int kOutboxFull = 8;
  static constexpr int kForkedChild = 9;
  static constexpr int kNotSendable = 12;
  static constexpr int kNoResources = 13;
  /// Files whose upload has not been answered yet: each takes two of the host's descriptors.
  static constexpr std::size_t kMaximumFilesHeld = 64;

  using StatesCallback = SharedCallback<const std::optional<PropertyArray>&>;
  using FlushCallback = SharedCallback<const std::optional<Error>&>;
  using UploadCallback = SharedCallback<bool, const std::optional<Error>&>;
  using LoggingBlock = std::shared_ptr<VelkReporting::LoggingBlock>;

  VelkReportingImplementation(ClientRuntime& runtime, SessionDescription description,
                              VelkReportingAggregationBlock aggregationBlock);
  /// Begins to connect; on the creator's thread, once, before anything else. `client` is the object that this stands
  /// behind.
  void open(std::weak_ptr<VelkReporting> client);
  /// False only for what was left half made, for want of memory: it has no end either.
  [[nodiscard]] bool isOpen() const noexcept { return _periodicTasks != nullptr; }

  // Any thread.

  /// In a forked child every operation does nothing.
  [[nodiscard]] bool isForeign() const noexcept { return _forkGuard.forked(); }
  [[nodiscard]] ClientRuntime& runtime() const noexcept { return _runtime; }
  [[nodiscard]] const CurrentEventLists& lists() const { return *_lists; }
  /// Queues work on the reporting queue, behind the events handed over so far; it owns this object until it has run.
  template <class Work>
  void onQueue(Work work) {
    _incoming.takeForWork([&](std::vector<IncomingEvents::Event> before) {
      _reporting->async([self = shared_from_this(), before = std::move(before), work = std::move(work)]() mutable {
        self->sendEvents(std::move(before));
        work(*self);
      });
    });
  }
  /// The same for a call to the daemon: it stays behind the events that were handed over before it.
  template <class Work>
  void callInOrder(Work work) {
    onQueue([work = std::move(work)](VelkReportingImplementation& self) mutable {
      self.runBehindHeldEvents([&self, work = std::move(work)]() mutable { work(self); });
    });
  }
  enum class Sent { taken, filtered, outboxFull, notFromForkedChild, notSendable };
  /// Tells the delegate of a valid message and queues it, unless the daemon wants no such events.
  Sent sendMessage(std::uint16_t category, const PropertyDictionary& message);
  /// The file is held open until its upload has been answered, so that nothing else is taken for it; no more than some
  /// may be held by one client. The error's code is the system's error number.
  [[nodiscard]] Result<std::shared_ptr<const FileToHandOver>> openForUpload(const std::string& path);
  /// Directly over the connection, past everything that is queued.
  void finishSession();
  /// The end: what was queued is sent, the session finished, the connection closed. Waits for that within a bound; on
  /// the library's own thread and in a callback of a module a thread for callbacks waits instead.
  void endOfLife(const void* client);
  void setEndOfLifeBound(Duration bound) noexcept { _endOfLifeBound.store(bound, std::memory_order_relaxed); }
  /// Sends what was queued, past a tick that does not end in time; the session goes on for as long as the process does.
  void sendBeforeExit(SteadyTime begun) override;

  /// From here on messages are brought to the queue, which knows the delegate.
  void expectMessageSentDelegate() noexcept { _mayHaveDelegate.store(true, std::memory_order_relaxed); }
  [[nodiscard]] std::weak_ptr<VelkReportingMessageSentDelegate> weakMessageSentDelegate() const;
  [[nodiscard]] LoggingBlock loggingBlock() const;

  [[nodiscard]] PeriodicTasks& periodicTasks() const { return *_periodicTasks; }
  void unregisterPeriodicTask(std::uint32_t module);

  // On the reporting queue.

  /// `identity` is what the log tells of it: on the library's thread nobody owns the delegate even for a moment.
  void setMessageSentDelegate(std::weak_ptr<VelkReportingMessageSentDelegate> delegate, std::uintptr_t identity);
  void startConfiguration(const StatesCallback& completionHandler);
  void fetchReportingStates(const std::optional<PropertyDictionary>& userInfo, const StatesCallback& fetchComplete);
  void flush(const FlushCallback& completion);
  void updateSharedDataWithDictionary(const PropertyDictionary& dictionary);
  void updateSharedDataForKey(const std::string& key, const std::optional<PropertyValue>& value);
  void setDigestKey(const ByteData& key, std::int32_t algorithm);
  void setMessageLoggingBlock(LoggingBlock block);
  void uploadFile(const std::string& url, const std::shared_ptr<const FileToHandOver>& file,
                  const UploadCallback& completionHandler);
  void uploadLogData(const PropertyArray& logData, const UploadCallback& completionHandler);

 private:
  /// Queues an event. False when the outbox is full.
  [[nodiscard]] bool enqueueEvent(const PropertyDictionary& message, std::size_t size);
  /// Tells the delegate of a message, in order, on a thread for callbacks; bounded from here on.
  void notifyMessageWasSent(const PropertyDictionary& message);
  void takeIncoming(IncomingEvents::Ticket ticket);
  void sendEvents(std::vector<IncomingEvents::Event> events);
  /// False when it has to wait.
  [[nodiscard]] bool trySending(const PropertyDictionary& message);
  void sendHeldEvents();
  void sendWhatFits();
  void runBehindHeldEvents(Task call);
  enum class Turn { behindTicks, pastTicks };
  /// The number of events that were left when it last looked.
  std::size_t sendHeldEventsWithin(SteadyTime deadline, Turn turn);
  void retryLater(Duration delay);
  void retryAtOnce();
  void reportOverflow();
  void connectionWasLost(SessionLink::UnsentEvents unsent);
  void leave(const void* client, SteadyTime deadline);
  void finishAndClose(const void* client, SteadyTime deadline);
  void finishSessionNow();
  /// Until everything sent has been handed to the system, and no longer.
  void waitForConnection(SteadyTime deadline) const;
  [[nodiscard]] std::size_t heldEvents() const;
  void fetchDisplayURL(const std::shared_ptr<Connection>& connection);
  void logText(const std::string& text);
  void setLoggingBlock(LoggingBlock block);
  [[nodiscard]] ConfigurationReply statesReply(const StatesCallback& callback);

  // Constant after construction.
  ClientRuntime& _runtime;
  const ForkGuard _forkGuard;
  const std::shared_ptr<Queue> _queue;
  const std::shared_ptr<ReportingQueue> _reporting;  ///< over `_queue`
  const std::shared_ptr<Queue> _orderedCallbacks;
  const std::shared_ptr<CurrentEventLists> _lists;
  const std::shared_ptr<VelkReportingAggregationObject> _aggregation;
  std::shared_ptr<SessionLink> _link;
  std::shared_ptr<PeriodicTasks> _periodicTasks;
  std::weak_ptr<VelkReporting> _client;
  /// Events are batched on their way anyway, so a moment more or less is nothing to them.
  const bool _mayLinger;

  // Self-synchronised.
  EventOutbox _outbox;
  IncomingEvents _incoming;
  std::atomic<Duration> _endOfLifeBound{ClientRuntime::kEndOfLifeBound};
  const std::shared_ptr<CallbackRoom> _roomForMessages;
  const std::shared_ptr<CallbackRoom> _roomForTexts;
  std::atomic<bool> _mayHaveDelegate{false};  ///< once true it stays so
  /// Shared with the files.
  const std::shared_ptr<std::atomic<std::size_t>> _filesHeld = std::make_shared<std::atomic<std::size_t>>(0);

  mutable Lock _lock;
  std::weak_ptr<VelkReportingMessageSentDelegate> _weakMessageSentDelegate VELK_GUARDED_BY(_lock);
  LoggingBlock _loggingBlock VELK_GUARDED_BY(_lock);

  // On the reporting queue.
  bool _retryIsPending = false;
  SteadyTime _lastTaken{};
  bool _isFinished = false;
};

}  // namespace velk
