// The HTTP request that carries events: address, headers, digest. Used by the HTTPS post backend; nothing is kept.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "backends/DottedVersion.h"
#include "foundation/PropertyValue.h"
#include "platform/HttpSession.h"

namespace velk {

/// What a request is made of. The pointers are the backend's own; null where it has no such thing.
struct PostDescription {
  std::string url;
  std::shared_ptr<const std::string> body;  ///< what is sent
  bool isCompressed = false;
  const std::string* json = nullptr;  ///< the body before compression, which the digest is made of
  const PropertyDictionary* userInfo = nullptr;
  bool isInternal = false;
  DottedVersion selfVersion;
  const std::string* hardwareType = nullptr;
  const std::string* productVersion = nullptr;
  std::uint16_t clientVersion = 0;
  std::int32_t compType = 0;
  std::optional<std::uint16_t> method;     ///< of a single event's post
  std::optional<std::uint16_t> respCode;   ///< of a single event's post
  const std::string* sessionID = nullptr;  ///< null: no header
  const ByteData* digestKey = nullptr;     ///< null: no header
  bool wifiOnly = false;
};

/// On builds that are not internal only https leaves the device, whatever scheme the address had before.
[[nodiscard]] HttpRequest makePostRequest(const PostDescription& description);

/// The address with "https" for its scheme. What follows a second "://" is cut off; an address without any stays.
[[nodiscard]] std::string addressWithHttps(std::string_view url);

}  // namespace velk
