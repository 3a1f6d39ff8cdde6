// The object that a process creates to report through the daemon.
//
// It validates the session info, connects to "com.tavrin.velkreportingd" and from then on turns each call into a call
// on the session that the daemon keeps for it, from a queue of its own, so that calls arrive in the order in which they
// were made. No daemon need be running: the connection is made at first use, and again after the daemon came back;
// events wait meanwhile, within a bound. No call below blocks on the daemon.
//
// Any thread may call any operation. Callbacks run on threads of the library that are there only while they are needed;
// a callback may take its time and may wait for another one. Message texts and aggregated events arrive in order, one
// at a time; answers to different calls may arrive at the same time. A callback that throws ends the process, except
// where it says otherwise. What a callback captured belongs to the library from the call on, and ends once, behind its
// last use or where it turns out that there is none; like the callback itself, never on the library's permanent thread.
// A callback may make any call, and may let go of the last reference. An empty one is none.
//
// No operation throws (property values do, as the standard containers do). What the system refuses (memory, a thread,
// descriptors) is an error line in the log, and the answer is null, false, nothing or empty.
//
// When the last reference goes, what was handed over is sent, the session is finished, and the connection is closed. A
// process that exits with a reference left sends what was handed over too. Both wait for it within a bound, and for the
// callbacks of modules whose tick has begun: do not hold a lock that one of these wants.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "client/UpdateAndReportServices.h"
#include "client/VelkReportingMessageSentDelegate.h"
#include "foundation/ErrorValue.h"
#include "foundation/Export.h"
#include "foundation/PropertyValue.h"

namespace velk {

class VelkReportingImplementation;

/// Session info of the client that an event came from (absent in the call that ends the aggregation), time in seconds
/// since 1970, category, type, payload with the sender's user info merged in. One that throws is never called again.
/// While it is slow, 16,384 events (or 8 MiB of them) wait for it; the log hears of those that are dropped beyond that.
using VelkReportingAggregationBlock =
    std::function<void(const std::optional<PropertyDictionary>& client, double timestamp, std::uint16_t category,
                       std::uint16_t type, const std::optional<PropertyDictionary>& payload)>;

class VELK_EXPORT VelkReporting : public std::enable_shared_from_this<VelkReporting> {
 public:
  /// The names of the backends that are enabled, or nothing when the session is not configured: the daemon could not be
  /// asked, or has no storebag for it.
  using StatesCallback = std::function<void(const std::optional<PropertyArray>& enabledBackends)>;
  using LoggingBlock = std::function<void(const std::string& text)>;
  using FlushCallback = std::function<void(const std::optional<Error>& error)>;
  using UploadCallback = std::function<void(bool uploaded, const std::optional<Error>& error)>;

  /// A client, or null, with a line of the default level: without session info, with a "ComponentType" outside 5 to 30,
  /// with an "EnableFlag" of 0; and, with an error line, when the system gives the library no thread or no descriptors,
  /// which may be tried again. The texts of `frameworksToCheck` are handed to the daemon. With an aggregation block the
  /// client is handed its own events and those of the sessions below it. The caller owns the client.
  [[nodiscard]] static std::shared_ptr<VelkReporting> initWithSessionInfo(
      const std::optional<PropertyDictionary>& sessionInfo, const std::optional<PropertyDictionary>& userInfo,
      const PropertyArray& frameworksToCheck, VelkReportingAggregationBlock aggregationBlock = nullptr);

  ~VelkReporting();
  VelkReporting(const VelkReporting&) = delete;
  VelkReporting& operator=(const VelkReporting&) = delete;

  /// How long the last release of this object may wait for what was handed over to leave (one second unless set; 0 to
  /// an hour), and how long the end of the process may, by `exit` or a return from `main`, while this object is there.
  /// What has not left by then is lost. A daemon that went away within the last half minute is waited for as well: it
  /// may be on its way back; one that was not there is asked once more, and not waited for. `_exit`, and the end by a
  /// signal, wait for nothing.
  void setEndOfLifeBound(std::chrono::milliseconds bound);

  /// Has the daemon build the session's backends; once, before events are sent. The handler is called once: with
  /// nothing, and a line in the log, when no daemon answers; the session is then configured as soon as one does.
  void startConfigurationWithCompletionHandler(StatesCallback completionHandler);
  /// Gives the session a new user info and asks which backends are enabled now. Nothing leaves the user info as it is
  /// or, in a session that requires none ("RequireUserDict" false), takes it away. The callback is called once: with
  /// nothing, and a line in the log, when no daemon answers; one that comes later is told the user info all the same.
  void fetchReportingStatesWithUserInfo(const std::optional<PropertyDictionary>& userInfo,
                                        StatesCallback fetchComplete);

  /// Sends an event. False, with error code 4, only for category 0: an event that the storebag filters answers true,
  /// and so does one that is not taken, then with an error (8, 9 or 12, as below).
  bool sendMessageWithCategory(std::uint16_t category, std::uint16_t type,
                               const std::optional<PropertyDictionary>& payload = std::nullopt, Error* error = nullptr);
  /// Sends a message dictionary ("ParametersCategory", "ParametersType", "ParametersPayload", "ParametersFlag").
  /// False without error when the storebag filters it; false with an error for a missing category or type (code 7),
  /// a category of 0 (4), when the outbox is full (8), in a forked child (9), and, with a line in the log, for what can
  /// never be sent (12): more than 1 MiB, 65,536 values or 4,096 keys in one dictionary, dictionaries and arrays more
  /// than 31 deep (the message is the first), text that is no UTF-8.
  bool sendMessageWithDictionary(const PropertyDictionary& dictionary, Error* error = nullptr);

  /// Has the daemon post what it batched for this session. Always true.
  bool flushMessages();
  /// The same. The callback is called once, with no error or with why it failed, in the words, domain and code of who
  /// found out: the session ("VelkReportingErrorDomain": -1, or the status of a server that refused), its transport, or
  /// (with a line in the log) the connection, "VelkConnectionErrorDomain": 9 no daemon answers, 1 it went away before
  /// it had answered, 2 it reads too slowly, 10 this process may not use its socket.
  void flushMessagesWithCompletion(FlushCallback completion);
  /// Marks the session as finished gracefully. Overtakes what is still queued, and awaits nothing. Lost, with a line in
  /// the log, when no daemon answers. The last release does the same behind what is queued.
  void finishSession();

  // Data that the sessions of one hierarchy share: it travels with the events of all of them. Lost, with a line in the
  // log, when no daemon answers.
  void updateSharedDataWithDictionary(const PropertyDictionary& dictionary);
  /// Without a value the key is removed.
  void updateSharedDataForKey(const std::string& key, const std::optional<PropertyValue>& value);

  /// Takes effect with the next message that is sent. The delegate is never owned here, but for a call of it. While it
  /// is slow, 16,384 messages (or 8 MiB of them) wait for it; the log hears of those that are dropped beyond that.
  void setMessageSentDelegate(std::weak_ptr<VelkReportingMessageSentDelegate> delegate);
  [[nodiscard]] std::shared_ptr<VelkReportingMessageSentDelegate> messageSentDelegate() const;
  /// Is given the text of each message that left, and the address at which reports can be viewed. While it is slow,
  /// 16,384 texts (or 8 MiB of them) wait for it; the log hears of those that are dropped beyond that.
  void setMessageLoggingBlock(LoggingBlock block);
  /// A copy, or an empty one when none is set. One that was set a moment ago may not be there yet.
  [[nodiscard]] LoggingBlock messageLoggingBlock() const;

  // The daemon's latest answer to a configuration or a fetch. Before the first one everything passes.

  /// True when the list of allowed categories is empty or holds this one.
  [[nodiscard]] bool isWhitelistedEvent(std::uint16_t category) const;
  [[nodiscard]] bool isBlacklistedEvent(std::uint16_t category) const;

  /// True when the backend "upload_server" is enabled.
  [[nodiscard]] bool serverSupportsFileUpload() const;
  /// Hands a file to the daemon for upload: a path, or a file address ("file:/PATH", "file://HOST/PATH", its escapes
  /// resolved; the host does not count). It is opened here, without following links. When the server says that it has
  /// the file, it is removed, unless another one has taken its name, and then the callback hears whether an upload was
  /// attempted. False when it cannot be opened, for a path that is no UTF-8 (its address may be), and while 64 files of
  /// this object wait for their answers. Directories, FIFOs, links and what else is no file are handed over and
  /// answered with false. Keep the object until the callback came: with its last reference the session is closed; an
  /// upload that was not answered by then may go on, but nobody waits for its answer: the callback may never be
  /// called, and the file stay even when it is delivered.
  bool uploadFileWithURL(const std::optional<std::string>& fileURL, UploadCallback completionHandler);
  /// Uploads log data: dictionaries. False for none, and (with an error line) when something else stands among them.
  /// The callback is called once with the daemon's answer; not at all, with a line in the log, when no daemon answers.
  bool uploadDataArray(const std::optional<PropertyArray>& logData, UploadCallback completionHandler);
  /// The key of the digest that goes with each post of the "qrs" backend: an HMAC of its JSON with SHA-1, by algorithm
  /// 0; by any other there is none. Call it after `startConfigurationWithCompletionHandler`: a key that comes before
  /// reaches the backend with the next user info only. A later user info makes the algorithm 0. False without a key.
  bool setDigestKey(const std::optional<ByteData>& digestKey, std::uint32_t algorithm);

  // Periodic tasks: while the log timer runs, each tick asks the modules that want it to update their measurements;
  // each tick of number `reportingMultiplier` asks the reporting modules for statistics instead, merges these and sends
  // them as one realtime event. Callbacks run in parallel, at most four at once, on threads that exist only while they
  // are needed; calls that are made during a tick reach the daemon after it, so a slow module delays them.

  /// Registers a module, in place of an earlier registration under its number; a tick that has begun does not know it
  /// yet. False without a callback, and (with an error line) beyond 4,096 modules. What the callback owns ends once,
  /// after its last call, never on the library's permanent thread: when the module is replaced or unregistered, or with
  /// the client, at the latest as soon as calls that have begun are over.
  bool registerPeriodicTaskForModule(std::uint32_t module, bool needToUpdate, bool needToReport,
                                     VelkReportingServiceBlock serviceBlock);
  /// Always true, also for a module that is not registered. Waits until the tick that has begun is over: the module's
  /// callback does not run after this returned. So callbacks must not wait for a thread that is in here, nor for a lock
  /// that it holds. Called from a callback of one of this client's modules it does not wait: the module's callback is
  /// not called any more, but a call that has begun goes on.
  bool unregisterPeriodTaskForModule(std::uint32_t module);
  /// Ticks at once, and then every `interval` seconds; ticks that are missed while one takes long are made up for by
  /// one. With a multiplier of 0 there are only updates. Does nothing when the timer runs already, nor, with an error
  /// line, for an interval of 0. Stops by itself with the client.
  void startLogTimerWithInterval(std::uint32_t interval, std::uint32_t reportingMultiplier, std::uint16_t category,
                                 std::uint16_t type);
  /// No tick begins after calls that are made from here on; does not wait for one that has begun.
  void stopLogTimer();

  // Services that need no client object.

  /// A random identifier of this user that lasts until it is regenerated: one for use while the user's consent to
  /// diagnostics and usage data is respected, one for use regardless of it. Kept where no daemon reads it; without a
  /// home directory each call makes a new one.
  [[nodiscard]] static std::string getPersistentIdentifierForDNU(bool respectConsent);
  static void regeneratePersistentIdentifierForDNU(bool respectConsent);

  /// A token for a session below that of `parentToken` (nothing: a new root of level 0). Nothing when the parent is
  /// no dictionary or has no "token".
  [[nodiscard]] static std::optional<PropertyDictionary> newHierarchyTokenFromParentToken(
      const std::optional<PropertyValue>& parentToken);

  /// Reports a single event without a client object. True: it was taken; delivery is not reported, and without a daemon
  /// it is lost. The end of the process, by `exit` or a return from `main`, waits for those under way, for at most a
  /// second. False, with an error: 2 no session info, 3 client type outside 5 to 30, 4 category 0, 8 when 256 are
  /// waiting, 12 what can never be sent (as above, but the payload is the first), 13 the system gives the library no
  /// thread or no descriptors.
  static bool sendOneMessageWithSessionInfo(const std::optional<PropertyDictionary>& sessionInfo,
                                            const std::optional<PropertyDictionary>& userInfo, std::uint16_t category,
                                            std::uint16_t type, const std::optional<PropertyDictionary>& payload,
                                            Error* error = nullptr);

 private:
  explicit VelkReporting(std::shared_ptr<VelkReportingImplementation> implementation);

  const std::shared_ptr<VelkReportingImplementation> _implementation;
};

}  // namespace velk
