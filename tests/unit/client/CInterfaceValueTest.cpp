// Values and errors as a C program uses them.

#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <string>

#include "client/VelkReportingC.h"

namespace velk::test {
namespace {

std::string jsonOf(const VelkReportingValue* value) {
  char* text = VelkReportingValueCopyJSON(value, nullptr);
  std::string copy = text != nullptr ? text : "(null)";
  VelkReportingTextFree(text);
  return copy;
}

TEST(CInterfaceValue, KeysAreThoseOfTheWire) {
  const struct {
    const char* constant;
    const char* text;
  } constants[] = {
      {::kVelkReportingSessionInfoClientType, "ComponentType"},
      {::kVelkReportingSessionInfoClientVersion, "ClientVersion"},
      {::kVelkReportingSessionInfoSessionID, "SessionID"},
      {::kVelkReportingSessionInfoBatchEvent, "BatchEvents"},
      {::kVelkReportingSessionInfoRequireUserInfo, "RequireUserDict"},
      {::kVelkReportingSessionInfoHierarchyToken, "HierarchyToken"},
      {::kVelkReportingSessionInfoEnableFlag, "EnableFlag"},
      {::kVelkReportingUserInfoClientName, "_clientName"},
      {::kVelkReportingUserInfoServiceName, "_serviceName"},
      {::kVelkReportingMessageParametersCategory, "ParametersCategory"},
      {::kVelkReportingMessageParametersType, "ParametersType"},
      {::kVelkReportingMessageParametersPayload, "ParametersPayload"},
      {::kVelkReportingMessageParametersFlag, "ParametersFlag"},
      {::kVelkReportingHierarchyTokenTokenID, "token"},
      {::kVelkReportingHierarchyTokenLevel, "level"},
      {::kVelkReportingLogDataData, "LogData"},
      {::kVelkReportingLogDataStartTime, "StartTime"},
      {::kVelkReportingLogDataEndTime, "EndTime"},
      {::kVelkReportingBackendDashboard, "dashboard"},
      {::kVelkReportingBackendUploadServer, "upload_server"},
      {::kVelkReportingBackendHTTPPost, "splunk"},
      {::kVelkReportingBackendHTTPPost2, "korrin"},
      {::kVelkReportingBackendPowerlog, "power"},
      {::kVelkReportingBackendQRS, "qrs"},
      {::kVelkReportingBackendQuill, "quill"},
      {::kVelkReportingMessageBlobClientData, "ClientData"},
      {::kVelkReportingMessageBlobSharedData, "SharedData"},
      {::kVelkReportingErrorDomain, "VelkReportingErrorDomain"},
  };
  for (const auto& each : constants) EXPECT_STREQ(each.constant, each.text);
}

TEST(CInterfaceValue, DictionaryIsBuiltReadAndChanged) {
  VelkReportingValue* dictionary = VelkReportingDictionaryCreate();
  EXPECT_TRUE(VelkReportingDictionarySetBoolean(dictionary, "flag", true));
  EXPECT_TRUE(VelkReportingDictionarySetInteger(dictionary, "number", -5));
  EXPECT_TRUE(VelkReportingDictionarySetReal(dictionary, "real", 2.5));
  EXPECT_TRUE(VelkReportingDictionarySetString(dictionary, "text", "word"));
  VelkReportingValue* array = VelkReportingArrayCreate();
  VelkReportingValue* big = VelkReportingValueCreateUnsignedInteger(UINT64_MAX);
  EXPECT_TRUE(VelkReportingArrayAppend(array, big));
  EXPECT_TRUE(VelkReportingDictionarySet(dictionary, "list", array));
  EXPECT_TRUE(VelkReportingArrayAppend(array, big)) << "the dictionary has its own copy";
  VelkReportingValueRelease(big);
  VelkReportingValueRelease(array);

  EXPECT_EQ(jsonOf(dictionary), R"({"flag":true,"number":-5,"real":2.5,"text":"word","list":[18446744073709551615]})");
  EXPECT_TRUE(VelkReportingDictionaryGetBoolean(dictionary, "flag"));
  EXPECT_EQ(VelkReportingDictionaryGetInteger(dictionary, "number"), -5);
  EXPECT_EQ(VelkReportingDictionaryGetReal(dictionary, "real"), 2.5);
  EXPECT_STREQ(VelkReportingDictionaryGetString(dictionary, "text"), "word");
  EXPECT_EQ(VelkReportingDictionaryGetString(dictionary, "number"), nullptr);
  EXPECT_EQ(VelkReportingDictionaryGetCount(dictionary), 5U);
  EXPECT_STREQ(VelkReportingDictionaryGetKey(dictionary, 4), "list");
  EXPECT_EQ(VelkReportingDictionaryGetKey(dictionary, 5), nullptr);

  VelkReportingValue* list = VelkReportingDictionaryCopyValue(dictionary, "list");
  EXPECT_EQ(VelkReportingArrayGetCount(list), 1U);
  VelkReportingValue* first = VelkReportingArrayCopyValue(list, 0);
  EXPECT_EQ(VelkReportingValueGetUnsignedInteger(first), UINT64_MAX);
  EXPECT_EQ(VelkReportingArrayCopyValue(list, 1), nullptr);
  VelkReportingValueRelease(first);
  VelkReportingValueRelease(list);

  EXPECT_TRUE(VelkReportingDictionaryRemove(dictionary, "flag"));
  EXPECT_FALSE(VelkReportingDictionaryRemove(dictionary, "flag"));
  VelkReportingValueRelease(dictionary);
}

TEST(CInterfaceValue, LeavesSayWhatTheyAre) {
  const struct {
    VelkReportingValue* value;
    VelkReportingValueType type;
  } leaves[] = {{VelkReportingValueCreateNull(), kVelkReportingValueTypeNull},
                {VelkReportingValueCreateBoolean(true), kVelkReportingValueTypeBoolean},
                {VelkReportingValueCreateInteger(7), kVelkReportingValueTypeInteger},
                {VelkReportingValueCreateUnsignedInteger(7), kVelkReportingValueTypeInteger},
                {VelkReportingValueCreateUnsignedInteger(UINT64_MAX), kVelkReportingValueTypeUnsignedInteger},
                {VelkReportingValueCreateReal(1.5), kVelkReportingValueTypeReal},
                {VelkReportingValueCreateDate(12.5), kVelkReportingValueTypeDate},
                {VelkReportingValueCreateString("a"), kVelkReportingValueTypeString},
                {VelkReportingValueCreateData("\0\1", 2), kVelkReportingValueTypeData},
                {VelkReportingArrayCreate(), kVelkReportingValueTypeArray},
                {VelkReportingDictionaryCreate(), kVelkReportingValueTypeDictionary}};
  for (const auto& leaf : leaves) {
    EXPECT_EQ(VelkReportingValueGetType(leaf.value), leaf.type);
    VelkReportingValue* copy = VelkReportingValueCopy(leaf.value);
    EXPECT_TRUE(VelkReportingValueIsEqual(copy, leaf.value));
    VelkReportingValueRelease(copy);
    VelkReportingValueRelease(leaf.value);
  }
}

TEST(CInterfaceValue, ReadingsAreLenientWhereTheySaySo) {
  VelkReportingValue* text = VelkReportingValueCreateString("12.5 apples");
  EXPECT_EQ(VelkReportingValueGetInteger(text), 12);
  EXPECT_EQ(VelkReportingValueGetReal(text), 12.5);
  EXPECT_TRUE(VelkReportingValueGetBoolean(text));
  EXPECT_EQ(VelkReportingValueGetUnsignedInteger(text), 0U);
  EXPECT_EQ(VelkReportingValueGetDate(text), 0);
  std::size_t size = 1;
  EXPECT_EQ(VelkReportingValueGetData(text, &size), nullptr);
  EXPECT_EQ(size, 0U);
  VelkReportingValueRelease(text);
  VelkReportingValue* negative = VelkReportingValueCreateInteger(-1);
  EXPECT_EQ(VelkReportingValueGetUnsignedInteger(negative), 0U);
  VelkReportingValueRelease(negative);
}

TEST(CInterfaceValue, TextIsTrueByHowItBegins) {
  const auto isTrue = [](const char* text) {
    VelkReportingValue* value = VelkReportingValueCreateString(text);
    const bool read = VelkReportingValueGetBoolean(value);
    VelkReportingValueRelease(value);
    return read;
  };
  for (const char* text : {"Y", "yes", "True", "t", "1", " \t+007", "-2", "0yes"}) EXPECT_TRUE(isTrue(text)) << text;
  for (const char* text : {"", "0", "0.5", "no", "on", "++1", "- 1"}) EXPECT_FALSE(isTrue(text)) << text;
}

TEST(CInterfaceValue, NumbersBeyondABoundStayAtIt) {
  VelkReportingValue* dictionary = VelkReportingDictionaryCreateFromJSON(
      R"({"most": 18446744073709551615, "above": 9223372036854775808, "huge": 1e300, "least": -1e300})", nullptr);
  ASSERT_NE(dictionary, nullptr);
  EXPECT_EQ(VelkReportingDictionaryGetInteger(dictionary, "most"), INT64_MAX) << "not -1";
  EXPECT_EQ(VelkReportingDictionaryGetInteger(dictionary, "above"), INT64_MAX);
  EXPECT_EQ(VelkReportingDictionaryGetInteger(dictionary, "huge"), INT64_MAX);
  EXPECT_EQ(VelkReportingDictionaryGetInteger(dictionary, "least"), INT64_MIN);
  VelkReportingValue* most = VelkReportingDictionaryCopyValue(dictionary, "most");
  EXPECT_EQ(VelkReportingValueGetInteger(most), INT64_MAX);
  EXPECT_EQ(VelkReportingValueGetUnsignedInteger(most), UINT64_MAX) << "the value itself is kept";
  EXPECT_EQ(VelkReportingValueGetReal(most), 18446744073709551615.0);
  EXPECT_TRUE(VelkReportingValueGetBoolean(most));
  VelkReportingValueRelease(most);
  VelkReportingValueRelease(dictionary);
  VelkReportingValue* none = VelkReportingValueCreateReal(std::nan(""));
  EXPECT_EQ(VelkReportingValueGetInteger(none), 0);
  VelkReportingValueRelease(none);
}

TEST(CInterfaceValue, TextAndDataKeepTheirZeros) {
  VelkReportingValue* text = VelkReportingValueCreateStringWithLength("a\0b", 3);
  std::size_t length = 0;
  const char* characters = VelkReportingValueGetString(text, &length);
  EXPECT_EQ(std::string(characters, length), std::string("a\0b", 3));
  EXPECT_EQ(characters[length], 0);
  VelkReportingValueRelease(text);

  VelkReportingValue* data = VelkReportingValueCreateData("a\0b", 3);
  std::size_t size = 0;
  EXPECT_EQ(std::memcmp(VelkReportingValueGetData(data, &size), "a\0b", 3), 0);
  EXPECT_EQ(size, 3U);
  VelkReportingValueRelease(data);
  VelkReportingValue* empty = VelkReportingValueCreateData(nullptr, 0);
  EXPECT_NE(VelkReportingValueGetData(empty, &size), nullptr) << "empty is not none";
  EXPECT_EQ(size, 0U);
  VelkReportingValueRelease(empty);
}

TEST(CInterfaceValue, RefusesTextThatIsNoUtf8) {
  EXPECT_EQ(VelkReportingValueCreateString("\xFF"), nullptr);
  EXPECT_EQ(VelkReportingValueCreateStringWithLength("\xC3\xA4", 1), nullptr);
  EXPECT_EQ(VelkReportingValueCreateString(nullptr), nullptr);
  EXPECT_EQ(VelkReportingValueCreateData(nullptr, 1), nullptr);
  VelkReportingValue* dictionary = VelkReportingDictionaryCreate();
  EXPECT_FALSE(VelkReportingDictionarySetString(dictionary, "key", "\xFF"));
  EXPECT_FALSE(VelkReportingDictionarySetInteger(dictionary, "\xFF", 1));
  EXPECT_FALSE(VelkReportingDictionarySetInteger(dictionary, nullptr, 1));
  EXPECT_EQ(VelkReportingDictionaryGetCount(dictionary), 0U);
  VelkReportingValueRelease(dictionary);
}

TEST(CInterfaceValue, OperationsOfTheWrongTypeChangeNothing) {
  VelkReportingValue* array = VelkReportingArrayCreate();
  VelkReportingValue* dictionary = VelkReportingDictionaryCreate();
  EXPECT_FALSE(VelkReportingArrayAppend(dictionary, array));
  EXPECT_FALSE(VelkReportingDictionarySet(array, "key", dictionary));
  EXPECT_FALSE(VelkReportingDictionarySet(dictionary, "key", nullptr));
  EXPECT_FALSE(VelkReportingArrayAppend(array, nullptr));
  EXPECT_EQ(VelkReportingArrayGetCount(dictionary), 0U);
  EXPECT_EQ(VelkReportingDictionaryGetCount(array), 0U);
  EXPECT_EQ(VelkReportingDictionaryCopyValue(array, "key"), nullptr);
  EXPECT_EQ(VelkReportingDictionaryGetKey(array, 0), nullptr);
  EXPECT_FALSE(VelkReportingDictionaryRemove(array, "key"));
  VelkReportingValueRelease(dictionary);
  VelkReportingValueRelease(array);
}

TEST(CInterfaceValue, ContainersStandWithinEachOtherUpToABound) {
  std::string text;
  for (int level = 0; level < 60; ++level) text += '[';
  text += std::string(60, ']');
  for (VelkReportingValue* value :
       {VelkReportingArrayCreate(), VelkReportingValueCreateFromJSON(text.c_str(), nullptr)}) {
    for (;;) {
      VelkReportingValue* outer = VelkReportingArrayCreate();
      if (!VelkReportingArrayAppend(outer, value)) {
        VelkReportingValueRelease(outer);
        break;
      }
      VelkReportingValueRelease(value);
      value = outer;
    }
    EXPECT_EQ(jsonOf(value), std::string(64, '[') + std::string(64, ']'));
    VelkReportingValue* dictionary = VelkReportingDictionaryCreate();
    EXPECT_FALSE(VelkReportingDictionarySet(dictionary, "deep", value));
    EXPECT_EQ(VelkReportingDictionaryGetCount(dictionary), 0U);
    VelkReportingValue* inner = VelkReportingArrayCopyValue(value, 0);
    EXPECT_TRUE(VelkReportingDictionarySet(dictionary, "deep", inner)) << "one level less";
    VelkReportingValueRelease(inner);
    VelkReportingValueRelease(dictionary);
    VelkReportingValueRelease(value);
  }
}

TEST(CInterfaceValue, JsonGoesBothWays) {
  const char* text = R"({"a":[1,2.5,null,true],"when":{"$date":12.5},"bytes":{"$data":"AAE="}})";
  VelkReportingError* error = nullptr;
  VelkReportingValue* value = VelkReportingDictionaryCreateFromJSON(text, &error);
  ASSERT_NE(value, nullptr);
  EXPECT_EQ(error, nullptr);
  VelkReportingValue* date = VelkReportingDictionaryCopyValue(value, "when");
  EXPECT_EQ(VelkReportingValueGetDate(date), 12.5);
  VelkReportingValueRelease(date);
  EXPECT_EQ(jsonOf(value), text);
  VelkReportingValueRelease(value);
}

TEST(CInterfaceValue, JsonIsChecked) {
  for (const char* text : {"{", "[1]", "", "{\"a\":1} x", static_cast<const char*>(nullptr)}) {
    VelkReportingError* error = nullptr;
    EXPECT_EQ(VelkReportingDictionaryCreateFromJSON(text, &error), nullptr);
    ASSERT_NE(error, nullptr);
    EXPECT_EQ(VelkReportingErrorGetCode(error), 11);
    EXPECT_STREQ(VelkReportingErrorGetDomain(error), "VelkReportingErrorDomain");
    EXPECT_STRNE(VelkReportingErrorGetDescription(error), "");
    VelkReportingErrorRelease(error);
  }
  VelkReportingValue* real = VelkReportingValueCreateReal(std::nan(""));
  VelkReportingError* error = nullptr;
  EXPECT_EQ(VelkReportingValueCopyJSON(real, &error), nullptr);
  EXPECT_EQ(VelkReportingErrorGetCode(error), 11);
  VelkReportingErrorRelease(error);
  EXPECT_EQ(VelkReportingValueCopyJSON(real, nullptr), nullptr);
  VelkReportingValueRelease(real);
}

TEST(CInterfaceValue, AnErrorSlotIsAlwaysWritten) {
  VelkReportingError* error = reinterpret_cast<VelkReportingError*>(&error);  // as one that was never initialised
  VelkReportingValue* value = VelkReportingValueCreateFromJSON("1", &error);
  EXPECT_EQ(error, nullptr);
  error = reinterpret_cast<VelkReportingError*>(&error);
  VelkReportingTextFree(VelkReportingValueCopyJSON(value, &error));
  EXPECT_EQ(error, nullptr);
  VelkReportingValueRelease(value);
  error = reinterpret_cast<VelkReportingError*>(&error);
  EXPECT_EQ(VelkReportingValueCopyJSON(nullptr, &error), nullptr);
  EXPECT_EQ(VelkReportingErrorGetCode(error), 11);
  EXPECT_STREQ(VelkReportingErrorGetDescription(error), "there is no value");
  VelkReportingErrorRelease(error);
}

TEST(CInterfaceValue, ErrorsAreOwned) {
  VelkReportingError* error = nullptr;
  static_cast<void>(VelkReportingValueCreateFromJSON("{", &error));
  ASSERT_NE(error, nullptr);
  EXPECT_EQ(VelkReportingErrorRetain(error), error);
  VelkReportingErrorRelease(error);
  VelkReportingValue* userInfo = VelkReportingErrorCopyUserInfo(error);
  EXPECT_STREQ(VelkReportingDictionaryGetString(userInfo, "description"), VelkReportingErrorGetDescription(error));
  VelkReportingValueRelease(userInfo);
  VelkReportingErrorRelease(error);
}

TEST(CInterfaceValue, NullHandlesDoNothing) {
  EXPECT_EQ(VelkReportingValueRetain(nullptr), nullptr);
  VelkReportingValueRelease(nullptr);
  EXPECT_EQ(VelkReportingValueCopy(nullptr), nullptr);
  EXPECT_EQ(VelkReportingValueGetType(nullptr), kVelkReportingValueTypeNull);
  EXPECT_FALSE(VelkReportingValueGetBoolean(nullptr));
  EXPECT_EQ(VelkReportingValueGetInteger(nullptr), 0);
  EXPECT_EQ(VelkReportingValueGetUnsignedInteger(nullptr), 0U);
  EXPECT_EQ(VelkReportingValueGetReal(nullptr), 0);
  EXPECT_EQ(VelkReportingValueGetDate(nullptr), 0);
  EXPECT_EQ(VelkReportingValueGetString(nullptr, nullptr), nullptr);
  EXPECT_EQ(VelkReportingValueGetData(nullptr, nullptr), nullptr);
  EXPECT_EQ(VelkReportingValueCopyJSON(nullptr, nullptr), nullptr);
  EXPECT_TRUE(VelkReportingValueIsEqual(nullptr, nullptr));
  EXPECT_EQ(VelkReportingArrayGetCount(nullptr), 0U);
  EXPECT_EQ(VelkReportingDictionaryGetCount(nullptr), 0U);
  EXPECT_EQ(VelkReportingDictionaryGetInteger(nullptr, "key"), 0);
  EXPECT_EQ(VelkReportingDictionaryGetString(nullptr, "key"), nullptr);
  EXPECT_FALSE(VelkReportingDictionarySetInteger(nullptr, "key", 1));
  EXPECT_EQ(VelkReportingErrorRetain(nullptr), nullptr);
  VelkReportingErrorRelease(nullptr);
  EXPECT_EQ(VelkReportingErrorGetCode(nullptr), 0);
  EXPECT_EQ(VelkReportingErrorGetDomain(nullptr), nullptr);
  EXPECT_EQ(VelkReportingErrorGetDescription(nullptr), nullptr);
  EXPECT_EQ(VelkReportingErrorCopyUserInfo(nullptr), nullptr);
  VelkReportingTextFree(nullptr);
}

}  // namespace
}  // namespace velk::test
