#include "tools/ctl/SessionLine.h"

#include <gtest/gtest.h>

namespace velk::ctl {
namespace {

SessionCall callFrom(std::string_view line) {
  const auto read = readSessionLine(line);
  if (!read || !std::holds_alternative<SessionCall>(*read)) {
    ADD_FAILURE() << line << ": " << (read ? "no call" : read.error().description);
    return {};
  }
  return std::get<SessionCall>(*read);
}

std::string reasonFor(std::string_view line) {
  const auto read = readSessionLine(line);
  return read ? "taken" : read.error().description;
}

TEST(SessionLine, PutsArgumentsInTheOrderOfTheWire) {
  const auto call = callFrom(
      R"({"method":"sendMessageWithSessionInfo","payload":{"a":1},"type":2,"category":3,"userInfo":{"u":1},"sessionInfo":{}})");
  EXPECT_EQ(call.method.method, Method::sendMessageWithSessionInfo);
  EXPECT_EQ(call.arguments,
            (PropertyArray{PropertyDictionary(), PropertyDictionary{{"u", 1}}, 3, 2, PropertyDictionary{{"a", 1}}}));
}

TEST(SessionLine, FillsInWhatIsAbsent) {
  EXPECT_EQ(callFrom(R"({"method":"setSessionInfo","sessionInfo":{"SessionID":1}})").arguments,
            (PropertyArray{PropertyDictionary{{"SessionID", 1}}, nullptr, PropertyArray(), false}));
  EXPECT_EQ(callFrom(R"({"method":"updateSharedDataForKey","key":"k"})").arguments, (PropertyArray{"k", nullptr}));
  EXPECT_EQ(callFrom(R"({"method":"fetchStatesWithUserInfo"})").arguments, (PropertyArray{nullptr}));
}

TEST(SessionLine, KnowsEveryMethodOfTheInterface) {
  for (const auto& description : allMethods()) {
    if (description.method == Method::sendMessageToClient || description.method == Method::copyStatus) continue;
    const std::string path = description.method == Method::uploadFileAtPath ? R"(,"path":"/tmp/x")" : "";
    const auto call = callFrom(R"({"method":")" + std::string(description.name) + "\"" + path + "}");
    const std::size_t added = description.method == Method::uploadFileAtPath ? 1 : 0;  // the token
    EXPECT_EQ(call.arguments.size() + added, description.argumentCount) << description.name;
  }
}

TEST(SessionLine, ReadsDatesAndData) {
  const auto call = callFrom(R"({"method":"setDigestKey","key":{"$data":"AQI="},"algorithm":0})");
  EXPECT_EQ(call.arguments, (PropertyArray{ByteData{1, 2}, 0}));
  const auto date = callFrom(R"({"method":"updateSharedDataForKey","key":"k","value":{"$date":12.5}})");
  EXPECT_EQ(date.arguments[1], PropertyValue(Date{12.5}));
}

TEST(SessionLine, PassesWrongTypesOnForTheDaemonToRefuse) {
  EXPECT_EQ(callFrom(R"({"method":"sendMessageWithDictionary","dictionary":"text"})").arguments,
            (PropertyArray{"text"}));
}

TEST(SessionLine, NamesTheFileToUpload) {
  const auto call = callFrom(R"({"method":"uploadFileAtPath","path":"/tmp/x"})");
  EXPECT_EQ(call.path, "/tmp/x");
  EXPECT_NE(reasonFor(R"({"method":"uploadFileAtPath"})"), "taken");
  EXPECT_NE(reasonFor(R"({"method":"uploadFileAtPath","path":5})"), "taken");
}

TEST(SessionLine, Waits) {
  const auto read = readSessionLine(R"({"method":"wait","seconds":0.25})");
  ASSERT_TRUE(read);
  EXPECT_EQ(std::get<SessionWait>(*read).seconds, 0.25);
  for (const char* line : {R"({"method":"wait"})", R"({"method":"wait","seconds":-1})",
                           R"({"method":"wait","seconds":"1"})", R"({"method":"wait","seconds":1e300})"}) {
    EXPECT_NE(reasonFor(line), "taken") << line;
  }
}

TEST(SessionLine, RefusesLinesThatItCannotUse) {
  EXPECT_NE(reasonFor("{").find("not JSON"), std::string::npos);
  EXPECT_EQ(reasonFor("[]"), "not a JSON object");
  EXPECT_EQ(reasonFor("{}"), "there is no \"method\", or it is not a string");
  EXPECT_EQ(reasonFor(R"({"method":5})"), "there is no \"method\", or it is not a string");
  EXPECT_EQ(reasonFor(R"({"method":"format"})"), "there is no method \"format\"");
  EXPECT_EQ(reasonFor(R"({"method":"copyStatus"})"), "there is no method \"copyStatus\"");
  EXPECT_EQ(reasonFor(R"({"method":"sendMessageToClient"})"), "there is no method \"sendMessageToClient\"");
  EXPECT_EQ(reasonFor(R"({"method":"fetchDisplayURL","sesionInfo":{}})"),
            "\"fetchDisplayURL\" takes no \"sesionInfo\"");
}

}  // namespace
}  // namespace velk::ctl
