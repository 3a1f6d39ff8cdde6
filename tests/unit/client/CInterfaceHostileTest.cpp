// The C interface in the hands of a careless program: values that contain themselves, JSON from anywhere, every pointer
// null, handles in use by many threads, forked children.

#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cmath>
#include <filesystem>
#include <thread>

#include "tests/support/TemporaryDirectory.h"
#include "tests/unit/client/CInterfaceFixture.h"

namespace velk::test {
namespace {

std::string repeated(const std::string& text, std::size_t times) {
  std::string all;
  all.reserve(times * text.size());
  while (times-- > 0) all += text;
  return all;
}

TEST(CInterfaceHostile, ContainersPutIntoThemselvesStayWalkable) {
  const Value array(VelkReportingArrayCreate());
  int times = 0;
  while (VelkReportingArrayAppend(array, array)) ASSERT_LT(++times, 64);
  EXPECT_EQ(times, 20) << "it doubles each time";
  const Value dictionary(VelkReportingDictionaryCreate());
  times = 0;
  while (VelkReportingDictionarySet(dictionary, std::to_string(times).c_str(), dictionary)) ASSERT_LT(++times, 64);
  EXPECT_EQ(times, 20);
  const Value copy(VelkReportingValueCopy(dictionary));
  EXPECT_TRUE(VelkReportingValueIsEqual(copy, dictionary));
  EXPECT_EQ(VelkReportingDictionaryGetCount(dictionary), 20U);
  EXPECT_FALSE(VelkReportingArrayAppend(array, dictionary));
  const Value leaf(VelkReportingValueCreateNull());
  EXPECT_FALSE(VelkReportingArrayAppend(array, leaf)) << "it is full to the last";
}

TEST(CInterfaceHostile, WhatWasTakenOutMakesRoomAgain) {
  const Value deep(VelkReportingValueCreateFromJSON((repeated("[", 63) + repeated("]", 63)).c_str(), nullptr));
  ASSERT_NE(deep.handle, nullptr);
  const Value dictionary(VelkReportingDictionaryCreate());
  EXPECT_TRUE(VelkReportingDictionarySet(dictionary, "deep", deep));
  const Value outer(VelkReportingArrayCreate());
  EXPECT_FALSE(VelkReportingArrayAppend(outer, dictionary)) << "65 of them";
  EXPECT_TRUE(VelkReportingDictionaryRemove(dictionary, "deep"));
  EXPECT_TRUE(VelkReportingArrayAppend(outer, dictionary));
  EXPECT_TRUE(VelkReportingDictionarySet(dictionary, "deep", deep));
  EXPECT_TRUE(VelkReportingDictionarySetBoolean(dictionary, "deep", true)) << "replaced";
  EXPECT_TRUE(VelkReportingArrayAppend(outer, dictionary));

  const Value large(VelkReportingValueCreateFromJSON(("[" + repeated("0,", 600'000) + "0]").c_str(), nullptr));
  const Value holder(VelkReportingDictionaryCreate());
  EXPECT_TRUE(VelkReportingDictionarySet(holder, "large", large));
  EXPECT_TRUE(VelkReportingDictionarySet(holder, "large", large)) << "in place of the other";
  EXPECT_FALSE(VelkReportingDictionarySet(holder, "more", large));
}

TEST(CInterfaceHostile, JsonIsReadAsItIsWritten) {
  const struct {
    const char* text;
    const char* read;
  } texts[] = {
      {R"({"a":1,"b":2,"a":3})", R"({"a":3,"b":2})"},
      {R"("\ud83d\ude00\u0000\/")", "\"\xf0\x9f\x98\x80\\u0000/\""},
      {" [ 1 , -0 , 1e2 , 1E-400 ] \n", "[1,0,100.0,0.0]"},
      {"18446744073709551615", "18446744073709551615"},
      {"18446744073709551616", "18446744073709551616.0"},
      {"-9223372036854775808", "-9223372036854775808"},
      {R"({"$date":1,"x":1})", R"({"$date":1,"x":1})"},
      {R"({"$data":"not base64!"})", R"({"$data":"not base64!"})"},
      {"true", "true"},
      {"null", "null"},
  };
  for (const auto& each : texts) {
    VelkReportingError* error = nullptr;
    const Value value(VelkReportingValueCreateFromJSON(each.text, &error));
    EXPECT_EQ(error, nullptr) << each.text;
    ASSERT_NE(value.handle, nullptr) << each.text;
    EXPECT_EQ(jsonOf(value), each.read) << each.text;
  }
}

TEST(CInterfaceHostile, WhatIsNoJsonIsRefusedWithItsPlace) {
  std::vector<std::string> texts = {
      "",
      " ",
      "nul",
      "NaN",
      "Infinity",
      "-Infinity",
      "01",
      "+1",
      ".5",
      "1.",
      "0x10",
      "1e999",
      "-1e999",
      "'a'",
      "[1,]",
      "[,1]",
      "{\"a\":}",
      "{a:1}",
      "{\"a\":1,}",
      "{\"a\" 1}",
      "[1]2",
      "{} {}",
      "\"a",
      "\"\\x41\"",
      "\"\\u12\"",
      "\"\\ud800\"",
      "\"\\udc00\"",
      "\"\\ud800\\u0041\"",
      "\"\n\"",
      "\xff",
      "\"\xff\"",
      "[\"\xed\xa0\x80\"]",
      "\xef\xbb\xbf{}",
      "/* */ {}",
      "// \n{}",
      "]",
      "}",
      "[}",
      "{]",
  };
  texts.push_back(repeated("[", 65) + repeated("]", 65));
  texts.push_back(repeated("[", 5'000'000));
  texts.push_back(repeated("{\"a\":", 1'000'000));
  texts.push_back("\"" + repeated("x", 10'000'000));
  texts.push_back("[" + repeated("1,", 5'000'000));
  texts.push_back(repeated("1", 10'000'000));
  for (const std::string& text : texts) {
    VelkReportingError* error = nullptr;
    EXPECT_EQ(VelkReportingValueCreateFromJSON(text.c_str(), &error), nullptr) << text.substr(0, 100);
    ASSERT_NE(error, nullptr) << text.substr(0, 100);
    EXPECT_EQ(VelkReportingErrorGetCode(error), kVelkReportingErrorInvalidJSON);
    EXPECT_STRNE(VelkReportingErrorGetDescription(error), "");
    VelkReportingErrorRelease(error);
    EXPECT_EQ(VelkReportingValueCreateFromJSON(text.c_str(), nullptr), nullptr);
  }
}

TEST(CInterfaceHostile, JsonMayBeLong) {
  const std::string text =
      "{\"text\":\"" + repeated("x", 10'000'000) + "\",\"list\":[" + repeated("1,", 500'000) + "1]}";
  const Value value(VelkReportingDictionaryCreateFromJSON(text.c_str(), nullptr));
  EXPECT_EQ(VelkReportingDictionaryGetCount(value), 2U);
  EXPECT_EQ(jsonOf(value), text);
  VelkReportingError* error = nullptr;
  const std::string tooMany = "[" + repeated("0,", 1'100'000) + "0]";
  EXPECT_EQ(VelkReportingValueCreateFromJSON(tooMany.c_str(), &error), nullptr);
  EXPECT_EQ(VelkReportingErrorGetCode(error), kVelkReportingErrorInvalidJSON);
  VelkReportingErrorRelease(error);
}

TEST(CInterfaceHostile, NumbersThatAreNoneHaveNoJson) {
  for (const double number : {std::nan(""), HUGE_VAL, -HUGE_VAL}) {
    for (VelkReportingValue* leaf : {VelkReportingValueCreateReal(number), VelkReportingValueCreateDate(number)}) {
      const Value owned(leaf);
      const Value array(VelkReportingArrayCreate());
      EXPECT_TRUE(VelkReportingArrayAppend(array, leaf)) << "a value like any other on the wire";
      VelkReportingError* error = nullptr;
      EXPECT_EQ(VelkReportingValueCopyJSON(array, &error), nullptr);
      EXPECT_EQ(VelkReportingErrorGetCode(error), kVelkReportingErrorInvalidJSON);
      VelkReportingErrorRelease(error);
    }
  }
}

TEST(CInterfaceHostile, KeysWithAZeroAreThereButHaveNoNameInC) {
  const Value value(VelkReportingDictionaryCreateFromJSON("{\"a\\u0000b\": 1, \"a\": 2}", nullptr));
  EXPECT_EQ(VelkReportingDictionaryGetCount(value), 2U);
  EXPECT_STREQ(VelkReportingDictionaryGetKey(value, 0), "a");
  EXPECT_EQ(VelkReportingDictionaryGetInteger(value, "a"), 2) << "the one that can be named";
  EXPECT_TRUE(VelkReportingDictionaryRemove(value, "a"));
  EXPECT_EQ(jsonOf(value), R"({"a\u0000b":1})");
}

/// Work of many threads at once.
template <class Work>
void inParallel(Work work) {
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 8; ++thread) {
    threads.emplace_back([&work] {
      for (int turn = 0; turn < 2'000; ++turn) work();
    });
  }
  for (auto& thread : threads) thread.join();
}

TEST(CInterfaceHostile, ManyThreadsMayHoldAndReadOneValue) {
  VelkReportingValue* value = VelkReportingDictionaryCreateFromJSON(R"({"a": [1, 2], "b": "text"})", nullptr);
  VelkReportingError* error = nullptr;
  static_cast<void>(VelkReportingValueCreateFromJSON("{", &error));
  inParallel([value, error] {
    VelkReportingValue* mine = VelkReportingValueRetain(value);
    VelkReportingValue* copy = VelkReportingValueCopy(mine);
    VelkReportingDictionarySetInteger(copy, "own", 1);  // a copy is changed apart from all others
    VelkReportingValue* list = VelkReportingDictionaryCopyValue(mine, "a");
    VelkReportingArrayAppend(list, copy);
    VelkReportingValueRelease(list);
    VelkReportingValueRelease(copy);
    VelkReportingValueRelease(mine);
    VelkReportingErrorRelease(VelkReportingErrorRetain(error));
  });
  EXPECT_EQ(jsonOf(value), R"({"a":[1,2],"b":"text"})");
  EXPECT_STRNE(VelkReportingErrorGetDescription(error), "");
  VelkReportingErrorRelease(error);
  VelkReportingValueRelease(value);
}

class CInterfaceHostileClient : public CInterfaceTest {};

TEST_F(CInterfaceHostileClient, ManyThreadsMayHoldOneClient) {
  _daemon.start();
  Context context;
  VelkReportingClient* client = create();
  VelkReportingClientSetEndOfLifeBound(client, 60'000);  // all of it arrives, on however slow a machine
  VelkReportingSetMessageBlock(client, noteText, &context, Context::destroy);
  inParallel([this, client] {
    VelkReportingClient* mine = VelkReportingClientRetain(client);
    VelkReportingSendMessageWithError(mine, 1, 1, _user, nullptr);
    VelkReportingClientRelease(mine);
  });
  EXPECT_EQ(_daemon.count("finishSessionGracefully"), 0U);
  VelkReportingClientRelease(client);
  EXPECT_TRUE(_daemon.waitForCalls("finishSessionGracefully", 1));
  ASSERT_TRUE(context.destroyed.waitFor(kPatience));
  EXPECT_EQ(context.ended.load(), 1);
}

void noteUploaded(bool uploaded, void* context) {
  static_cast<Context*>(context)->note(uploaded ? "uploaded" : "not uploaded");
}

void noteService(VelkReportingValue*, void* context) { static_cast<Context*>(context)->note("served"); }

using Contexts = std::array<Context, 6>;

/// Hands a context to everything that takes one.
void handOverEverywhere(VelkReportingClient* client, const VelkReportingValue* info, const char* path,
                        Contexts& contexts) {
  const auto destroy = Context::destroy;
  VelkReportingClientStartConfiguration(client, noteStates, &contexts[0], destroy);
  VelkReportingFetchStatesWithUserInfo(client, info, noteStates, &contexts[1], destroy);
  VelkReportingSetMessageBlock(client, noteText, &contexts[2], destroy);
  VelkReportingFlushMessagesWithCompletion(client, noteError, &contexts[3], destroy);
  static_cast<void>(VelkReportingClientUploadFile(client, path, noteUploaded, &contexts[4], destroy));
  static_cast<void>(VelkReportingClientRegisterPeriodicTask(client, 1, true, true, noteService, &contexts[5], destroy));
}

TEST_F(CInterfaceHostileClient, EveryContextEndsOnceWhateverBecomesOfItsCall) {
  const TemporaryDirectory directory;
  const std::string file = directory.write("file", "text");
  enum { nobodyListens, daemonDies, clientGoesFirst, all };
  for (int situation = nobodyListens; situation != all; ++situation) {
    Contexts contexts;
    if (situation != nobodyListens) _daemon.start();
    _daemon.holdCalls(situation != nobodyListens);
    VelkReportingClient* client = create();
    VelkReportingClientSetEndOfLifeBound(client, 0);
    handOverEverywhere(client, _user, file.c_str(), contexts);
    if (situation == clientGoesFirst) VelkReportingClientRelease(client);
    _daemon.holdCalls(false);
    if (situation != nobodyListens) _daemon.stop();
    if (situation != clientGoesFirst) VelkReportingClientRelease(client);
    for (std::size_t each = 0; each < contexts.size(); ++each) {
      ASSERT_TRUE(contexts[each].destroyed.waitFor(kPatience)) << situation << ", " << each;
      EXPECT_EQ(contexts[each].ended.load(), 1) << situation << ", " << each;
      const bool isCompletion = each == 0 || each == 1 || each == 3;  // told also when there is no answer
      EXPECT_TRUE(!isCompletion || contexts[each].texts.size() == 1) << situation << ", " << each;
    }
  }
}

TEST_F(CInterfaceHostileClient, EveryCallbackMayBeNull) {
  _daemon.start();
  const TemporaryDirectory directory;
  const std::string file = directory.write("file", "text");
  const Client client(create());
  Context context;
  const auto destroy = Context::destroy;
  for (void* own : {static_cast<void*>(nullptr), static_cast<void*>(&context)}) {
    const auto end = own != nullptr ? destroy : nullptr;
    VelkReportingClientStartConfiguration(client, nullptr, own, end);
    VelkReportingFetchStatesWithUserInfo(client, nullptr, nullptr, own, end);
    VelkReportingSetMessageBlock(client, nullptr, own, end);
    VelkReportingFlushMessagesWithCompletion(client, nullptr, own, end);
    EXPECT_TRUE(VelkReportingClientUploadFile(client, file.c_str(), nullptr, own, end));
    EXPECT_FALSE(VelkReportingClientRegisterPeriodicTask(client, 1, true, true, nullptr, own, end));
    EXPECT_EQ(VelkReportingClientCreateWithAggregation(nullptr, nullptr, nullptr, nullptr, own, end), nullptr);
    EXPECT_EQ(VelkReportingClientCreateWithAggregation(nullptr, nullptr, nullptr, noEvent, own, end), nullptr);
  }
  EXPECT_EQ(context.ended.load(), 8);
  flushAndWait(client);
}

TEST_F(CInterfaceHostileClient, WhatIsOfTheWrongTypeCountsAsNone) {
  _daemon.start();
  const Value number(VelkReportingValueCreateInteger(1));
  EXPECT_EQ(VelkReportingClientCreate(number, _user, nullptr), nullptr);
  const Client client(VelkReportingClientCreate(_session, number, number));
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
  EXPECT_EQ(_daemon.calls()[0].arguments, (PropertyArray{sessionInfo(), nullptr, PropertyArray{}, false}));
  VelkReportingFetchStatesWithUserInfo(client, number, nullptr, nullptr, nullptr);
  ASSERT_TRUE(_daemon.waitForCalls("fetchStatesWithUserInfo", 1));
  EXPECT_EQ(_daemon.calls()[1].arguments, PropertyArray{nullptr});
  VelkReportingUpdateSharedDataWithDictionary(client, number);
  VelkReportingUpdateSharedDataForKey(client, "\xff", number);
  EXPECT_FALSE(VelkReportingClientSetDigestKey(client, nullptr, 5, 0));
  EXPECT_TRUE(VelkReportingClientSetDigestKey(client, "", 0, 0));
  flushAndWait(client);
  EXPECT_EQ(_daemon.count("updateSharedDataWithDictionary") + _daemon.count("updateSharedDataForKey"), 0U);
}

std::size_t openDescriptors() {
  const std::filesystem::directory_iterator all("/proc/self/fd");
  return static_cast<std::size_t>(std::distance(begin(all), end(all)));
}

TEST_F(CInterfaceHostileClient, AForkedChildEndsItsContextsAndDoesNothingElse) {
  _daemon.start();
  const TemporaryDirectory directory;
  const std::string file = directory.write("file", "text");
  VelkReportingClient* client = create();
  flushAndWait(client);
  const std::size_t before = _daemon.calls().size();
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    Contexts contexts;
    const std::size_t descriptors = openDescriptors();
    handOverEverywhere(client, _user, file.c_str(), contexts);
    VelkReportingError* error = nullptr;
    bool inert = openDescriptors() == descriptors;
    for (const Context& context : contexts) inert = context.ended.load() == 1 && context.texts.empty() && inert;
    inert = !VelkReportingSendMessageWithDictionary(client, json(R"({"ParametersCategory":1,"ParametersType":1})"),
                                                    &error) &&
            inert;
    inert = VelkReportingErrorGetCode(error) == kVelkReportingErrorForkedChild && inert;
    VelkReportingErrorRelease(error);
    error = nullptr;
    inert = VelkReportingSendMessageWithError(client, 1, 1, nullptr, &error) && inert;
    inert = VelkReportingErrorGetCode(error) == kVelkReportingErrorForkedChild && inert;
    VelkReportingErrorRelease(error);
    VelkReportingClientStartLogTimer(client, 1, 1, 1, 1);
    VelkReportingClientStopLogTimer(client);
    inert = VelkReportingClientUnregisterPeriodicTask(client, 1) && inert;
    VelkReportingFlushMessages(client);
    VelkReportingClientFinishSession(client);
    VelkReportingClientRelease(client);
    ::_exit(inert ? 0 : 1);
  }
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
  flushAndWait(client);
  EXPECT_EQ(_daemon.calls().size(), before + 1) << "the parent's client is unharmed, and alone";
  VelkReportingClientRelease(client);
}

}  // namespace
}  // namespace velk::test
