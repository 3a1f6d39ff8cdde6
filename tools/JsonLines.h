// One JSON object a line, flushed at once, so that a program at the other end of a pipe sees each as it happens.
// Used by both tools; any thread may write. Lives as long as the command that made it.
#pragma once

#include <iosfwd>
#include <string>
#include <string_view>

#include "foundation/PropertyValue.h"
#include "platform/Lock.h"

namespace velk::tools {

/// The object as one line without its end. Dates and byte data stand as {"$date"} and {"$data"}; numbers that JSON
/// has no form for (nan, infinities) stand as null, so that every line can be read.
[[nodiscard]] std::string jsonText(const PropertyDictionary& object);
/// The same over several indented lines, for people.
[[nodiscard]] std::string prettyJsonText(const PropertyValue& value);

/// Writes to a stream that somebody else owns and that nobody else writes to meanwhile.
class JsonLines {
 public:
  explicit JsonLines(std::ostream& stream) : _stream(stream) {}

  void write(const PropertyDictionary& object);
  /// Whole lines, each with its end, that must stay together.
  void writeText(std::string_view lines);
  /// False once the stream took something no longer (the reader has gone).
  [[nodiscard]] bool good() const;

 private:
  mutable Lock _lock;
  std::ostream& _stream VELK_GUARDED_BY(_lock);
};

}  // namespace velk::tools
