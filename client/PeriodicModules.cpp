#include "client/PeriodicModules.h"

#include "client/LogTexts.h"
#include "platform/Log.h"

namespace velk {

bool PeriodicModule::call(PropertyDictionary* statistics) {
  if (!begin()) return false;
  bool returned = false;
  try {
    _services.block()(statistics);
    returned = true;
  } catch (...) {  // the client's own code: whatever it throws must not end its process
    log::error(texts::kServiceBlockThrew, _number);
  }
  end();
  return returned;
}

bool PeriodicModule::begin() {
  Guard guard(_lock);
  if (_isWithdrawn) return false;
  ++_calls;
  return true;
}

void PeriodicModule::end() {
  Guard guard(_lock);
  if (--_calls == 0) _ended.notifyAll();
}

void PeriodicModule::withdraw() {
  Guard guard(_lock);
  _isWithdrawn = true;
}

void PeriodicModule::waitForCalls() {
  BlockingScope blocking;
  Guard guard(_lock);
  while (_calls != 0) _ended.wait(_lock);
}

std::uint64_t PeriodicModules::handOver(Module module) {
  Guard guard(_lock);
  if (_handedOver.size() + _stored.size() >= kMaximumModules && !_stored.contains(module->number())) return 0;
  if (_handedOver.size() >= kMaximumModules) return 0;
  _handedOver.emplace(++_lastTicket, std::move(module));
  return _lastTicket;
}

bool PeriodicModules::store(std::uint64_t ticket, std::vector<Module>& replaced) {
  Guard guard(_lock);
  auto arrived = _handedOver.extract(ticket);
  if (!arrived) return false;
  Module& place = _stored[arrived.mapped()->number()];
  if (place) replaced.push_back(std::move(place));
  place = std::move(arrived.mapped());
  return true;
}

std::vector<PeriodicModules::Module> PeriodicModules::take(std::uint32_t number) {
  std::vector<Module> taken;
  {
    Guard guard(_lock);
    if (auto stored = _stored.extract(number)) taken.push_back(std::move(stored.mapped()));
    for (auto next = _handedOver.begin(); next != _handedOver.end();) {
      const auto current = next++;
      if (current->second->number() == number) taken.push_back(std::move(_handedOver.extract(current).mapped()));
    }
  }
  for (const auto& module : taken) module->withdraw();
  return taken;
}

std::vector<PeriodicModules::Module> PeriodicModules::takeAll() {
  std::vector<Module> taken;
  {
    Guard guard(_lock);
    for (auto& [number, module] : _stored) taken.push_back(std::move(module));
    for (auto& [ticket, module] : _handedOver) taken.push_back(std::move(module));
    _stored.clear();
    _handedOver.clear();
  }
  for (const auto& module : taken) module->withdraw();
  return taken;
}

std::vector<PeriodicModules::Module> PeriodicModules::snapshot() const {
  std::vector<Module> modules;
  Guard guard(_lock);
  modules.reserve(_stored.size());
  for (const auto& [number, module] : _stored) modules.push_back(module);
  return modules;
}

}  // namespace velk
