// Hands every event to the diagnostics service, through an adaptor that the administrator has installed. Neither
// filters, batches nor answers anything. Only the conferencing client types have it.
//
// The adaptor is foreign code: it is called on the session's thread, never with a lock held, and what it blocks is that
// session alone. It is given back on a queue of its own, since a backend's last reference may go anywhere.
#pragma once

#include "backends/VelkReportingBackend.h"
#include "platform/AdaptorBundle.h"
#include "platform/Queue.h"

namespace velk {

class QuillBackend : public VelkReportingBackend {
 public:
  /// Null (and an error line) for client types that may not use the adaptor; no client type is none of those that may.
  /// Without a usable adaptor the backend is made all the same, and refuses every event with an error line.
  [[nodiscard]] static std::shared_ptr<QuillBackend> initWithName(const BackendContext& context, std::string name,
                                                                  PropertyValue profile,
                                                                  std::optional<std::string> productFamily,
                                                                  std::int32_t clientType = 0);
  ~QuillBackend() override;

  [[nodiscard]] static bool isClientTypeAllowed(std::int32_t clientType) noexcept;

  /// Forwards method, response code and message as they are, and waits for the adaptor.
  std::optional<std::string> sendMessageWithEventID(const std::optional<PropertyDictionary>& message,
                                                    const TimeValue& timestamp, std::uint16_t method,
                                                    std::uint16_t respCode, std::uint16_t eventID,
                                                    std::uint32_t flag) override;

 private:
  QuillBackend(const BackendContext& context, std::string name, PropertyValue profile,
               std::optional<std::string> productFamily);
  void makeAdaptor();

  // Constant after creation.
  AdaptorBundle* const _clientBundle;  ///< not owned; null where the platform has none
  std::shared_ptr<QuillAdaptorClass> _quillAdaptorClass;
  const std::shared_ptr<Queue> _releaseQueue;

  // Used on the owning session's queue only.
  std::unique_ptr<QuillAdaptor> _quillAdaptor;
};

}  // namespace velk
