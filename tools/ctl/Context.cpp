#include "tools/ctl/Context.h"

#include <ostream>

#include "foundation/Format.h"
#include "foundation/JsonLine.h"
#include "platform/Files.h"

namespace velk::ctl {

using tools::ExitCode;

namespace {

bool isFileError(const Error& error, files::Code code) {
  return error.domain == "files" && error.code == static_cast<int>(code);
}

}  // namespace

void Context::report(const PropertyDictionary& object, const std::string& words) {
  if (json) {
    out << velk::json::line(object) << std::endl;
  } else if (!words.empty()) {
    out << words << std::endl;
  }
  if (!out) fail(ExitCode::ioError, "the result could not be written to standard output");
}

void Context::fail(ExitCode code, const std::string& sentence) {
  exitCode = code;
  writeProblem({{"error", sentence}, {"status", tools::status(code)}}, sentence);
}

void Context::warn(const std::string& sentence) { writeProblem({{"warning", sentence}}, sentence); }

void Context::writeProblem(const PropertyDictionary& object, const std::string& sentence) {
  Guard guard(_lock);
  if (json) {
    _error << velk::json::line(object) << std::endl;
  } else {
    _error << "velkreportingctl: " << withoutControlCharacters(sentence) << std::endl;
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
