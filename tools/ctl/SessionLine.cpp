#include "tools/ctl/SessionLine.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <span>

#include "foundation/Json.h"

namespace velk::ctl {
namespace {

constexpr double kLongestWaitSeconds = 86400;

struct Argument {
  enum class Absent { null, emptyList, no };
  std::string_view name;
  Absent absent = Absent::null;
};

struct CallForm {
  Method method;
  std::span<const Argument> arguments;
};

constexpr std::array<Argument, 4> kSetSessionInfo = {{{"sessionInfo"},
                                                      {"userInfo"},
                                                      {"frameworksToCheck", Argument::Absent::emptyList},
                                                      {"hasAggregationBlock", Argument::Absent::no}}};
constexpr std::array<Argument, 1> kUserInfo = {{{"userInfo"}}};
constexpr std::array<Argument, 1> kDictionary = {{{"dictionary"}}};
constexpr std::array<Argument, 1> kPath = {{{"path"}}};
constexpr std::array<Argument, 1> kLogData = {{{"logData"}}};
constexpr std::array<Argument, 5> kOneShot = {{{"sessionInfo"}, {"userInfo"}, {"category"}, {"type"}, {"payload"}}};
constexpr std::array<Argument, 2> kKeyAndValue = {{{"key"}, {"value"}}};
constexpr std::array<Argument, 2> kDigest = {{{"key"}, {"algorithm"}}};

constexpr std::array<CallForm, 13> kForms = {{
    {Method::setSessionInfo, kSetSessionInfo},
    {Method::startConfigWithCompletionHandler, {}},
    {Method::fetchStatesWithUserInfo, kUserInfo},
    {Method::fetchDisplayURL, {}},
    {Method::sendMessageWithDictionary, kDictionary},
    {Method::flushMessagesWithCompletion, {}},
    {Method::finishSessionGracefully, {}},
    {Method::uploadFileAtPath, kPath},
    {Method::uploadLogData, kLogData},
    {Method::sendMessageWithSessionInfo, kOneShot},
    {Method::updateSharedDataWithDictionary, kDictionary},
    {Method::updateSharedDataForKey, kKeyAndValue},
    {Method::setDigestKey, kDigest},
}};

Failure refused(std::string why) { return failure("session", 1, std::move(why)); }

std::string quoted(std::string_view text) { return "\"" + std::string(text) + "\""; }

PropertyValue valueOf(const PropertyDictionary& object, const Argument& argument) {
  if (const PropertyValue* value = object.find(argument.name)) return *value;
  switch (argument.absent) {
    case Argument::Absent::emptyList:
      return PropertyArray();
    case Argument::Absent::no:
      return false;
    case Argument::Absent::null:
      break;
  }
  return nullptr;
}

// A key that is misspelt would otherwise pass for an absent argument.
Result<void> checkKeys(const PropertyDictionary& object, std::string_view method, std::span<const Argument> arguments) {
  for (const PropertyDictionary::Entry& entry : object) {
    const bool known = entry.key == "method" || std::any_of(arguments.begin(), arguments.end(),
                                                            [&](const Argument& a) { return a.name == entry.key; });
    if (!known) return refused(quoted(method) + " takes no " + quoted(entry.key));
  }
  return {};
}

Result<SessionLine> readWait(const PropertyDictionary& object) {
  constexpr std::array<Argument, 1> kSeconds = {{{"seconds"}}};
  if (Result<void> checked = checkKeys(object, "wait", kSeconds); !checked) return Failure(std::move(checked).error());
  const PropertyValue* value = object.find("seconds");
  const double seconds = doubleValue(value);
  if (value == nullptr || !value->isNumber() || !(seconds >= 0) || seconds > kLongestWaitSeconds) {
    return refused("\"wait\" takes \"seconds\", a number from 0 to 86400");
  }
  return SessionWait{seconds};
}

Result<SessionLine> readCall(const PropertyDictionary& object, const MethodDescription& method, const CallForm& form) {
  if (Result<void> checked = checkKeys(object, method.name, form.arguments); !checked) {
    return Failure(std::move(checked).error());
  }
  SessionCall call{method, {}, std::nullopt};
  for (const Argument& argument : form.arguments) call.arguments.append(valueOf(object, argument));
  if (method.method == Method::uploadFileAtPath) {
    const std::string* path = object.string("path");
    if (path == nullptr || path->empty()) return refused("\"uploadFileAtPath\" takes \"path\", a string");
    call.path = *path;
  }
  return call;
}

}  // namespace

Result<SessionLine> readSessionLine(std::string_view line) {
  const Result<PropertyValue> value = json::parse(line, json::Extensions::tagged);
  if (!value) return refused("not JSON: " + value.error().description);
  const PropertyDictionary* object = value->dictionary();
  if (object == nullptr) return refused("not a JSON object");
  const std::string* name = object->string("method");
  if (name == nullptr) return refused("there is no \"method\", or it is not a string");
  if (*name == "wait") return readWait(*object);

  const MethodDescription* method = methodWithName(*name);
  const auto form = std::find_if(kForms.begin(), kForms.end(), [&](const CallForm& candidate) {
    return method != nullptr && candidate.method == method->method;
  });
  if (form == kForms.end()) return refused("there is no method " + quoted(*name));
  return readCall(*object, *method, *form);
}

}  // namespace velk::ctl
