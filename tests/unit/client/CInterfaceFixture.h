// What tests of the C interface share: contexts that count their uses, handles that release themselves, a client.
#pragma once

#include <atomic>
#include <string>
#include <vector>

#include "client/VelkReportingC.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {

/// A callback's context: how often it was used, and ended.
struct Context {
  std::atomic<int> ended{0};
  Semaphore called;
  Semaphore destroyed;
  std::vector<std::string> texts;

  static void destroy(void* context) {
    ++static_cast<Context*>(context)->ended;
    static_cast<Context*>(context)->destroyed.signal();
  }
  void note(std::string text) {
    EXPECT_EQ(ended.load(), 0) << "the context is used after its end";
    texts.push_back(std::move(text));
    called.signal();
  }
};

inline std::string jsonOf(const VelkReportingValue* value) {
  if (value == nullptr) return "none";
  char* text = VelkReportingValueCopyJSON(value, nullptr);
  std::string copy(text);
  VelkReportingTextFree(text);
  return copy;
}

inline void noteStates(const VelkReportingValue* backends, void* context) {
  static_cast<Context*>(context)->note(jsonOf(backends));
}

inline void noteText(const char* text, void* context) { static_cast<Context*>(context)->note(text); }

inline void noteError(const VelkReportingError* error, void* context) {
  static_cast<Context*>(context)->note(error == nullptr ? "none" : VelkReportingErrorGetDescription(error));
}

inline void noEvent(const VelkReportingValue*, double, uint16_t, uint16_t, const VelkReportingValue*, void*) {}

/// Releases at the end of the test.
template <class Handle, void (*release)(Handle*)>
struct Owner {
  explicit Owner(Handle* owned) : handle(owned) {}
  Owner(const Owner&) = delete;
  Owner& operator=(const Owner&) = delete;
  ~Owner() { release(handle); }
  operator Handle*() const { return handle; }
  Handle* handle;
};
using Value = Owner<VelkReportingValue, VelkReportingValueRelease>;
using Client = Owner<VelkReportingClient, VelkReportingClientRelease>;

inline VelkReportingValue* json(const char* text) { return VelkReportingDictionaryCreateFromJSON(text, nullptr); }

class CInterfaceTest : public VelkReportingTest {
 protected:
  VelkReportingClient* create() { return VelkReportingClientCreate(_session, _user, nullptr); }
  void configureAndWait(VelkReportingClient* client) {
    Context context;
    VelkReportingClientStartConfiguration(client, noteStates, &context, Context::destroy);
    EXPECT_TRUE(context.called.waitFor(kPatience));
    EXPECT_TRUE(context.destroyed.waitFor(kPatience));
    flushAndWait(client);  // the lists are cached before the next call is answered
  }
  std::string flushAndWait(VelkReportingClient* client) {
    Context context;
    VelkReportingFlushMessagesWithCompletion(client, noteError, &context, Context::destroy);
    EXPECT_TRUE(context.destroyed.waitFor(kPatience));
    EXPECT_EQ(context.ended.load(), 1);
    return context.texts.at(0);
  }

  const Value _session{json(R"({"ComponentType": 9, "SessionID": 7})")};
  const Value _user{json(R"({"_clientName": "Test", "_serviceName": "unit"})")};
};

}  // namespace velk::test
