// What went wrong, as a value that users of the library see as well.
#pragma once

#include <string>

namespace velk {

/// Why something did not work. `description` is for people: it names the thing and the cause.
struct Error {
  std::string domain;
  int code = 0;
  std::string description;

  bool operator==(const Error&) const = default;
};

}  // namespace velk
