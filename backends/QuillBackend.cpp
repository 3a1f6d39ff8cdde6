#include "backends/QuillBackend.h"

#include <utility>

#include "backends/LogTexts.h"
#include "foundation/JsonLine.h"
#include "platform/Log.h"

namespace velk {

namespace {

/// Client types 7, 11 and 13, as bits from the first of them on.
constexpr std::int32_t kFirstAllowedType = 7;
constexpr std::int32_t kLastAllowedType = 13;
constexpr std::uint32_t kAllowedTypes = 1U << 0 | 1U << 4 | 1U << 6;

constexpr const char* kForwardingSelector = "sendMessageWithMethod:respCode:dict:";

}  // namespace

bool QuillBackend::isClientTypeAllowed(std::int32_t clientType) noexcept {
  if (clientType < kFirstAllowedType || clientType > kLastAllowedType) return false;
  return (kAllowedTypes >> (clientType - kFirstAllowedType) & 1U) != 0;
}

std::shared_ptr<QuillBackend> QuillBackend::initWithName(const BackendContext& context, std::string name,
                                                         PropertyValue profile,
                                                         std::optional<std::string> productFamily,
                                                         std::int32_t clientType) {
  log::standard(backend_texts::kLoadingQuillAdaptor, clientType);
  if (!isClientTypeAllowed(clientType)) {
    log::error(backend_texts::kNoQuillBundle, clientType);
    return nullptr;
  }
  std::shared_ptr<QuillBackend> backend(
      new QuillBackend(context, std::move(name), std::move(profile), std::move(productFamily)));
  backend->makeAdaptor();
  return backend;
}

QuillBackend::QuillBackend(const BackendContext& context, std::string name, PropertyValue profile,
                           std::optional<std::string> productFamily)
    : VelkReportingBackend(context, std::move(name), std::move(profile), std::move(productFamily)),
      _clientBundle(context.platform.adaptorBundle),
      _releaseQueue(context.platform.scheduler.makeSerialQueue("com.tavrin.VelkReporting.quillAdaptor")) {}

QuillBackend::~QuillBackend() {
  if (!_quillAdaptor) return;
  _releaseQueue->async([adaptor = std::move(_quillAdaptor)] { adaptor->release(); });
}

/// Leaves the adaptor absent when there is none: the send step says so for every event.
void QuillBackend::makeAdaptor() {
  if (_clientBundle == nullptr) return;
  auto loaded = _clientBundle->load();
  if (!loaded) {
    log::error(backend_texts::kQuillBundleUnusable, loaded.error());
    return;
  }
  if (!*loaded) return;
  _quillAdaptorClass = std::move(*loaded);
  auto made = _quillAdaptorClass->makeInstance();
  if (!made) {
    log::error(backend_texts::kQuillBundleUnusable, made.error());
    return;
  }
  _quillAdaptor = std::move(*made);
}

std::optional<std::string> QuillBackend::sendMessageWithEventID(const std::optional<PropertyDictionary>& message,
                                                                const TimeValue&, std::uint16_t method,
                                                                std::uint16_t respCode, std::uint16_t, std::uint32_t) {
  if (!_quillAdaptor || !_quillAdaptor->respondsToSendMessage()) {
    const std::string* description = _quillAdaptor ? &_quillAdaptor->description() : nullptr;
    log::error(backend_texts::kQuillDoesNotRespond, description, kForwardingSelector);
    return std::nullopt;
  }
  std::optional<std::string> dict;
  if (message) dict = json::line(*message);
  if (const auto sent = _quillAdaptor->sendMessageWithMethod(method, respCode, dict); !sent) {
    log::error(backend_texts::kQuillEventLost, sent.error());
  }
  return std::nullopt;
}

}  // namespace velk
