// The modules that registered for a client's periodic tasks, and the calls of their callbacks that are under way.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <vector>

#include "client/UpdateAndReportServices.h"
#include "platform/Lock.h"

namespace velk {

/// One registration. Any thread.
class PeriodicModule {
 public:
  PeriodicModule(std::uint32_t number, UpdateAndReportServices services)
      : _number(number), _services(std::move(services)) {}

  [[nodiscard]] std::uint32_t number() const noexcept { return _number; }
  [[nodiscard]] const UpdateAndReportServices& services() const noexcept { return _services; }

  /// Calls the callback, unless the module was withdrawn. False when that, or what it threw, makes the call void.
  [[nodiscard]] bool call(PropertyDictionary* statistics);
  /// No call begins any more.
  void withdraw();
  /// Returns when no call is under way. Not from one.
  void waitForCalls();

 private:
  [[nodiscard]] bool begin();
  void end();

  const std::uint32_t _number;
  const UpdateAndReportServices _services;

  Lock _lock;
  Condition _ended;
  bool _isWithdrawn VELK_GUARDED_BY(_lock) = false;
  std::size_t _calls VELK_GUARDED_BY(_lock) = 0;
};

/// Registrations are handed over on any thread and take effect when their turn on the reporting queue comes; whoever
/// takes a module away in between takes it from both places. Any thread; what is taken out is returned, for the caller
/// to destroy where the end of a callback's belongings may take its time.
class PeriodicModules {
 public:
  using Module = std::shared_ptr<PeriodicModule>;
  /// Far beyond what one process is made of.
  static constexpr std::size_t kMaximumModules = 4096;

  /// A ticket for `store`, or 0 when there is no more room.
  [[nodiscard]] std::uint64_t handOver(Module module);
  /// Puts what was handed over in its place. False when it was taken away meanwhile; else `replaced` is what was there.
  [[nodiscard]] bool store(std::uint64_t ticket, std::vector<Module>& replaced);
  /// All there is under that number, withdrawn.
  [[nodiscard]] std::vector<Module> take(std::uint32_t number);
  /// The same of all numbers.
  [[nodiscard]] std::vector<Module> takeAll();
  /// Those that are in their place, in the order of their numbers.
  [[nodiscard]] std::vector<Module> snapshot() const;

 private:
  mutable Lock _lock;
  std::uint64_t _lastTicket VELK_GUARDED_BY(_lock) = 0;
  std::map<std::uint64_t, Module> _handedOver VELK_GUARDED_BY(_lock);
  std::map<std::uint32_t, Module> _stored VELK_GUARDED_BY(_lock);
};

}  // namespace velk
