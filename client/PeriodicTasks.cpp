#include "client/PeriodicTasks.h"

#include <utility>

#include "client/LogTexts.h"
#include "ipc/Vocabulary.h"
#include "platform/CurrentQueue.h"
#include "platform/Log.h"
#include "platform/Semaphore.h"

namespace velk {

namespace {

constexpr std::uint64_t kNanosecondsPerSecond = 1'000'000'000;
constexpr Duration kLeeway = std::chrono::milliseconds(100);
/// A wait this long is one without a limit: the clocks' arithmetic is spared the extremes.
constexpr Duration kUnlimited = std::chrono::hours(24 * 365);
/// Has the daemon post the event at once.
constexpr int kRealtimeFlag = 1;

PropertyDictionary realtimeMessage(std::uint16_t category, std::uint16_t type, PropertyDictionary payload) {
  PropertyDictionary message;
  message.set(kVelkReportingMessageParametersFlag, kRealtimeFlag);
  message.set(kVelkReportingMessageParametersCategory, category);
  message.set(kVelkReportingMessageParametersType, type);
  message.set(kVelkReportingMessageParametersPayload, std::move(payload));
  return message;
}

/// Wakes whoever waits for its turn, also when the turn never comes.
class Turn {
 public:
  explicit Turn(Semaphore& ended) : _ended(&ended) {}
  Turn(Turn&& other) noexcept : _ended(std::exchange(other._ended, nullptr)) {}
  Turn& operator=(Turn&&) = delete;
  Turn(const Turn&) = delete;
  Turn& operator=(const Turn&) = delete;
  ~Turn() {
    if (_ended != nullptr) _ended->signal();
  }

 private:
  Semaphore* _ended;
};

}  // namespace

std::optional<Duration> waitLimit(std::uint64_t updateTimeout) {
  const double scaled = static_cast<double>(updateTimeout * kNanosecondsPerSecond) * 0.95;
  if (scaled >= static_cast<double>(kUnlimited.count())) return std::nullopt;
  return Duration(static_cast<std::int64_t>(scaled));
}

PeriodicTasks::PeriodicTasks(std::shared_ptr<ReportingQueue> queue, Scheduler& timers, PeriodicTick::Runner runner,
                             Sender sender)
    : _queue(std::move(queue)), _timers(timers), _runner(std::move(runner)), _send(std::move(sender)) {}

PeriodicTasks::~PeriodicTasks() {
  // In a forked child the timer's lock may be held by a thread that is not there: it is left alone, on purpose.
  if (_forkGuard.forked()) static_cast<void>(_timer.release());
}

bool PeriodicTasks::registerModule(std::uint32_t module, bool needToUpdate, bool needToReport,
                                   VelkReportingServiceBlock serviceBlock) {
  if (!serviceBlock) return false;
  const std::uint64_t ticket = _modules.handOver(std::make_shared<PeriodicModule>(
      module, UpdateAndReportServices(needToUpdate, needToReport, std::move(serviceBlock))));
  if (ticket == 0) {
    log::error(texts::kTooManyModules, module, PeriodicModules::kMaximumModules);
    return false;
  }
  _queue->async([self = shared_from_this(), ticket, module, needToUpdate, needToReport] {
    self->store(ticket, module, needToUpdate, needToReport);
  });
  return true;
}

void PeriodicTasks::store(std::uint64_t ticket, std::uint32_t module, bool needToUpdate, bool needToReport) {
  std::vector<PeriodicModules::Module> replaced;
  if (!_modules.store(ticket, replaced)) return;
  log::standard(texts::kRegisteredModule, module, needToUpdate ? "" : " no", needToReport ? "" : " no");
  dispose(std::move(replaced));
}

void PeriodicTasks::unregisterModule(std::uint32_t module, bool mayWait) {
  if (isInCallback()) return static_cast<void>(takeModule(module));
  if (!mayWait || _queue->beneath()->isCurrent()) return dispose(takeModule(module));
  Semaphore ended;
  std::optional<std::vector<PeriodicModules::Module>> taken;
  _queue->async([self = shared_from_this(), turn = Turn(ended), &taken, module] { taken = self->takeModule(module); });
  ended.wait();
  if (!taken) taken = takeModule(module);  // no turn ever comes
  for (const auto& each : *taken) each->waitForCalls();
}

std::vector<PeriodicModules::Module> PeriodicTasks::takeModule(std::uint32_t module) {
  auto taken = _modules.take(module);
  log::standard(taken.empty() ? texts::kModuleDoesNotExist : texts::kModuleRemoved, module);
  return taken;
}

/// What callbacks own may wait for the library's thread when it ends: it ends where callbacks run.
void PeriodicTasks::dispose(std::vector<PeriodicModules::Module> modules) {
  if (!modules.empty()) _runner([modules = std::move(modules)] {});
}

void PeriodicTasks::startLogTimer(std::uint32_t interval, std::uint32_t reportingMultiplier, std::uint16_t category,
                                  std::uint16_t type) {
  _queue->async([self = shared_from_this(), settings = LogTimer{interval, reportingMultiplier, category, type}] {
    self->startTimer(settings);
  });
}

void PeriodicTasks::startTimer(const LogTimer& settings) {
  if (_timer || _isEnding) return;
  if (settings.interval == 0) return log::error(texts::kIntervalIsZero);
  _timer = _timers.makeTimer(_queue->beneath(), [weak = weak_from_this(), settings] {
    if (const auto self = weak.lock()) self->fired(settings);
  });
  if (!_timer) return;
  _counter = 0;
  _timer->start(Duration::zero(), std::chrono::seconds(settings.interval), kLeeway);
  log::standard(texts::kTimerStarted, settings.interval, settings.multiplier);
}

void PeriodicTasks::fired(const LogTimer& settings) {
  if (std::exchange(_turnIsQueued, true)) return;
  _queue->runInTurn([self = shared_from_this(), settings, generation = _generation] {
    if (self->_generation != generation) return;
    self->_turnIsQueued = false;
    if (self->_queue->isHeld()) return;  // so much waits that this did not: a later tick will
    self->myPeriodicTask(settings.category, settings.type, settings.multiplier,
                         settings.interval * kNanosecondsPerSecond);
  });
}

void PeriodicTasks::stopLogTimer() {
  _queue->async([self = shared_from_this()] {
    if (!self->_timer) return log::standard(texts::kNoTimer);
    log::standard(texts::kTimerStopped);
    self->_timer = nullptr;
    self->_turnIsQueued = false;
    ++self->_generation;
    self->_counter = 0;
  });
}

bool PeriodicTasks::isInCallback() const noexcept { return CurrentQueueScope::contains(this); }

void PeriodicTasks::withdrawAll(bool mayWait) {
  _isEnding = true;
  // Past the tick that may hold the reporting queue for ever. The timer is only cancelled: a stop that waits for that
  // tick still finds it.
  _queue->beneath()->async([self = shared_from_this()] {
    if (self->_timer) self->_timer->cancel();
  });
  auto modules = _modules.takeAll();
  if (!mayWait) dispose(std::move(modules));
}

void PeriodicTasks::end() {
  ++_generation;
  _timer = nullptr;
}

void PeriodicTasks::myPeriodicTask(std::uint16_t category, std::uint16_t type, std::uint32_t intervalMultiplier,
                                   std::uint64_t updateTimeout) {
  assertOnQueue(*_queue->beneath());
  if (_isEnding) return;
  ++_counter;
  log::standard(texts::kTickStarted);
  const bool reports = _counter == intervalMultiplier;
  auto modules = _modules.snapshot();
  std::erase_if(modules, [reports](const PeriodicModules::Module& module) {
    return !(reports ? module->services().report() : module->services().update());
  });
  _queue->hold();
  const auto whenOver = [self = shared_from_this(), reports, category, type](PeriodicTick::End end,
                                                                             PropertyDictionary result) {
    if (reports) {
      self->reportIsOver(end, category, type, std::move(result));
    } else {
      self->updatesAreOver(end);
    }
    self->_queue->release();
  };
  std::make_shared<PeriodicTick>(reports ? PeriodicTick::Kind::report : PeriodicTick::Kind::update, std::move(modules),
                                 _queue->beneath(), _runner, this, whenOver)
      ->start(_timers, waitLimit(updateTimeout));
}

void PeriodicTasks::updatesAreOver(PeriodicTick::End end) {
  if (end == PeriodicTick::End::timeoutWhileScheduling) log::standard(texts::kUpdateSchedulingTimeout);
  if (end == PeriodicTick::End::timeoutWhileWaiting) log::standard(texts::kUpdateTimeout);
  log::standard(texts::kUpdatesFinished);
}

void PeriodicTasks::reportIsOver(PeriodicTick::End end, std::uint16_t category, std::uint16_t type,
                                 PropertyDictionary result) {
  if (end == PeriodicTick::End::timeoutWhileScheduling) log::standard(texts::kReportSchedulingTimeout);
  if (end == PeriodicTick::End::timeoutWhileWaiting) log::standard(texts::kReportTimeout);
  log::standard(texts::kMetricsCollected);
  if (!result.empty()) {
    log::standard(texts::kSentRealtimeEvent);
    _send(realtimeMessage(category, type, std::move(result)));
  }
  log::standard(texts::kCollectionFinished);
  _counter = 0;
}

}  // namespace velk
