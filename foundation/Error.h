// Failures as values: a domain, a code and a text. Nothing is thrown across a folder's border.
#pragma once

#include <string>
#include <tl/expected.hpp>

#include "foundation/ErrorValue.h"

namespace velk {

/// A value, or the error that stands in its place. The caller decides whether to log it.
template <class Value>
using Result = tl::expected<Value, Error>;

using Failure = tl::unexpected<Error>;

/// A failed result: `return failure("storebag", 1, "no \"bag\" in the envelope");`
[[nodiscard]] inline Failure failure(std::string domain, int code, std::string description) {
  return Failure(Error{std::move(domain), code, std::move(description)});
}

}  // namespace velk
