#include "daemon/KeepAliveCounter.h"

#include "daemon/LogTexts.h"
#include "platform/Log.h"

namespace velk {

void KeepAliveCounter::beginIfUnused(const std::string& sessionDescription) {
  if (_count != 0) return;
  _keepAlive.beginTransaction();
  log::standard(daemontexts::kTransactionStarted, sessionDescription);
}

void KeepAliveCounter::retain() {
  ++_count;
  log::standard(daemontexts::kTransactionRetained, _count);
}

void KeepAliveCounter::release(std::uint32_t count) {
  if (_count < 1) return;
  _count = static_cast<std::int32_t>(static_cast<std::uint32_t>(_count) - count);
  log::standard(daemontexts::kTransactionReleased, _count, count);
  if (_count > 0) return;
  _keepAlive.endTransaction();
  log::standard(daemontexts::kTransactionEnded);
}

}  // namespace velk
