#include "tools/ctl/Context.h"

#include <ostream>

#include "platform/Files.h"
#include "tools/JsonLines.h"

namespace velk::ctl {

using tools::ExitCode;

namespace {

bool isFileError(const Error& error, files::Code code) {
  return error.domain == "files" && error.code == static_cast<int>(code);
}

}  // namespace

void Context::report(const PropertyDictionary& object, const std::string& words) {
  if (json) {
    out << tools::jsonText(object) << std::endl;
  } else if (!words.empty()) {
    out << words << std::endl;
  }
  if (!out) fail(ExitCode::ioError, "the result could not be written");
}

void Context::fail(ExitCode code, const std::string& sentence) {
  exitCode = code;
  if (json) {
    error << tools::jsonText({{"error", sentence}, {"status", tools::status(code)}}) << std::endl;
  } else {
    error << "velkreportingctl: " << sentence << std::endl;
  }
}

ExitCode exitCodeForReading(const Error& error) {
  if (isFileError(error, files::Code::notAllowed)) return ExitCode::noPermission;
  if (isFileError(error, files::Code::tooLarge)) return ExitCode::data;
  return ExitCode::noInput;
}

ExitCode exitCodeForWriting(const Error& error) {
  return isFileError(error, files::Code::notAllowed) ? ExitCode::noPermission : ExitCode::cannotCreate;
}

}  // namespace velk::ctl
