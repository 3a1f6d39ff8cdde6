// The C interface: errors.

#include "client/CInterfaceHandles.h"
#include "ipc/Vocabulary.h"

namespace velk::cinterface {

VelkReportingError* newError(const Error& error) {
  auto handle = std::make_unique<VelkReportingError>();
  handle->error = error;
  return handle.release();
}

void handOut(VelkReportingError** out, const Error& error) {
  if (out == nullptr) return;
  // The domain is the library's, always: a text that stood in a domain of its own is lost here.
  const std::string domain(kVelkReportingErrorDomain);
  *out = error == Error() ? nullptr : newError({domain, error.code, error.description});
}

}  // namespace velk::cinterface

VelkReportingError* VelkReportingErrorRetain(const VelkReportingError* error) {
  // Only what is borrowed is constant; whoever retains it is an owner like any other.
  return velk::cinterface::retain(const_cast<VelkReportingError*>(error));
}

void VelkReportingErrorRelease(VelkReportingError* error) { velk::cinterface::release(error); }

const char* VelkReportingErrorGetDomain(const VelkReportingError* error) {
  return error != nullptr ? error->error.domain.c_str() : nullptr;
}

int32_t VelkReportingErrorGetCode(const VelkReportingError* error) { return error != nullptr ? error->error.code : 0; }

const char* VelkReportingErrorGetDescription(const VelkReportingError* error) {
  return error != nullptr ? error->error.description.c_str() : nullptr;
}

VelkReportingValue* VelkReportingErrorCopyUserInfo(const VelkReportingError* error) {
  if (error == nullptr) return nullptr;
  return velk::cinterface::guarded(__func__, nullptr, [&] {
    velk::PropertyDictionary userInfo;
    if (!error->error.description.empty()) userInfo.set("description", error->error.description);
    return velk::cinterface::newValue(std::move(userInfo));
  });
}
