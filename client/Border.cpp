#include "client/Border.h"

#include <exception>

#include "client/LogTexts.h"
#include "platform/Log.h"

namespace velk {

void logException(const char* operation) noexcept {
  try {
    try {
      throw;
    } catch (const std::exception& exception) {
      log::error(texts::kNothingWasDone, operation, exception.what());
    } catch (...) {
      log::error(texts::kNothingWasDone, operation, "an exception of no standard kind");
    }
  } catch (...) {  // there is no memory for the line either
    static_cast<void>(operation);
  }
}

}  // namespace velk
