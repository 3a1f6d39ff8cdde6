#include "tools/ctl/Suite.h"

#include "foundation/Format.h"
#include "foundation/Json.h"
#include "platform/Directories.h"
#include "tools/JsonLines.h"

namespace velk::ctl {

std::unique_ptr<UserDefaults> openSuite(const std::string& directory) {
  if (!directory.empty()) return openUserDefaults(kVelkReportingDefaultsSuite, directory, "");
  const Directories directories = daemonDirectories();
  return openUserDefaults(kVelkReportingDefaultsSuite, directories.state, directories.configuration);
}

PropertyValue valueFromArgument(std::string_view argument) {
  Result<PropertyValue> value = json::parse(argument, json::Extensions::tagged);
  return value ? std::move(*value) : PropertyValue(argument);
}

std::string wordsOf(const PropertyValue& value) {
  if (const std::string* text = value.string()) return withoutControlCharacters(*text);
  return tools::prettyJsonText(value);
}

}  // namespace velk::ctl
