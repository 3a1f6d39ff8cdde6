#include "ipc/MethodTable.h"

#include <algorithm>
#include <array>

namespace velk {
namespace {

constexpr std::array kMethods{
    MethodDescription{Method::setSessionInfo, "setSessionInfo", 4, 0},
    MethodDescription{Method::startConfigWithCompletionHandler, "startConfigWithCompletionHandler", 0, 3},
    MethodDescription{Method::fetchStatesWithUserInfo, "fetchStatesWithUserInfo", 1, 3},
    MethodDescription{Method::fetchDisplayURL, "fetchDisplayURL", 0, 1},
    MethodDescription{Method::sendMessageWithDictionary, "sendMessageWithDictionary", 1, 1},
    MethodDescription{Method::flushMessagesWithCompletion, "flushMessagesWithCompletion", 0, 2},
    MethodDescription{Method::finishSessionGracefully, "finishSessionGracefully", 0, 0},
    MethodDescription{Method::uploadFileAtPath, "uploadFileAtPath", 2, 2},
    MethodDescription{Method::uploadLogData, "uploadLogData", 1, 2},
    MethodDescription{Method::sendMessageWithSessionInfo, "sendMessageWithSessionInfo", 5, 1},
    MethodDescription{Method::updateSharedDataWithDictionary, "updateSharedDataWithDictionary", 1, 0},
    MethodDescription{Method::updateSharedDataForKey, "updateSharedDataForKey", 2, 0},
    MethodDescription{Method::setDigestKey, "setDigestKey", 2, 0},
    MethodDescription{Method::sendMessageToClient, "sendMessageToClient", 5, 0},
    MethodDescription{Method::copyStatus, "copyStatus", 0, 1},
};

template <class Matches>
const MethodDescription* find(Matches matches) noexcept {
  const auto* found = std::find_if(kMethods.begin(), kMethods.end(), matches);
  return found != kMethods.end() ? found : nullptr;
}

}  // namespace

std::span<const MethodDescription> allMethods() noexcept { return kMethods; }

const MethodDescription* methodWithNumber(std::uint32_t number) noexcept {
  return find([&](const auto& method) { return static_cast<std::uint32_t>(method.method) == number; });
}

const MethodDescription* methodWithName(std::string_view name) noexcept {
  return find([&](const auto& method) { return method.name == name; });
}

}  // namespace velk
