#include "client/SessionInfoValidation.h"

#include "client/LogTexts.h"
#include "ipc/Vocabulary.h"
#include "platform/Log.h"

namespace velk {

namespace {

constexpr std::int64_t kLowestClientType = 5;
constexpr std::int64_t kHighestClientType = 30;

Error logged(int code, std::string_view text) {
  log::standard("%s", text);
  return {std::string(kVelkReportingErrorDomain), code, std::string(text)};
}

}  // namespace

std::optional<Error> validateSessionInfo(const std::optional<PropertyDictionary>& sessionInfo) {
  if (!sessionInfo) return logged(2, texts::kSessionInfoIsNil);
  const std::int64_t clientType = integerValue(sessionInfo->find(kVelkReportingSessionInfoClientType));
  if (clientType < kLowestClientType || clientType > kHighestClientType) {
    return logged(3, texts::kClientTypeIsInvalid);
  }
  return std::nullopt;
}

}  // namespace velk
