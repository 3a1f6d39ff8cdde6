// One line of the input of `velkreportingctl session`: a JSON object that names a method and its arguments.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <variant>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"
#include "ipc/MethodTable.h"

namespace velk::ctl {

/// A method to call. The arguments stand in the order of the wire, as they were given: whether their types are right
/// is for the daemon to say.
struct SessionCall {
  MethodDescription method;
  PropertyArray arguments;
  /// The file whose descriptor goes with the call.
  std::optional<std::string> path;
};

/// Nothing is called; the next line is read after this time.
struct SessionWait {
  double seconds = 0;
};

using SessionLine = std::variant<SessionCall, SessionWait>;

/// Fails with a sentence when the line is no JSON object, when its method is unknown, or when it has a key that the
/// method does not take. An argument that is absent travels as null, or as an empty list or false where the method
/// has no notion of an absent one.
[[nodiscard]] Result<SessionLine> readSessionLine(std::string_view line);

}  // namespace velk::ctl
