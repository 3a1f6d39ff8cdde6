#include "platform/HttpSession.h"

#include <algorithm>

#include "foundation/Text.h"

namespace velk {

void HttpRequest::setHeader(std::string_view name, std::string_view value) {
  const auto found = std::find_if(headers.begin(), headers.end(),
                                  [&](const auto& header) { return equalsIgnoringCase(header.first, name); });
  if (found != headers.end()) {
    found->second = value;
  } else {
    headers.emplace_back(name, value);
  }
}

const std::string* HttpResponse::header(std::string_view name) const noexcept {
  const auto found = std::find_if(headers.rbegin(), headers.rend(),
                                  [&](const auto& header) { return equalsIgnoringCase(header.first, name); });
  return found == headers.rend() ? nullptr : &found->second;
}

}  // namespace velk
