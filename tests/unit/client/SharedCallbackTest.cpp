// What the user's callbacks captured: copied and ended like any other code of the user's, never on the library's own
// thread, on whatever road a callback comes to its end.
#include "client/SharedCallback.h"

#include <array>
#include <atomic>
#include <functional>
#include <ostream>
#include <utility>
#include <vector>

#include "tests/support/TemporaryDirectory.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

bool isOnLibraryThread() { return ClientRuntime::shared().loop().isCurrent(); }

/// What becomes of what is captured.
struct Fate {
  std::atomic<int> alive{0};
  std::atomic<int> touchedOnLibraryThread{0};
  Semaphore ended;

  void touch() { touchedOnLibraryThread += isOnLibraryThread() ? 1 : 0; }
};

/// Captured by callbacks. Too large to lie within a function object, so that a move of that is none of this.
class Captured {
 public:
  explicit Captured(std::shared_ptr<Fate> fate) : _fate(std::move(fate)) { begin(); }
  Captured(const Captured& other) : _fate(other._fate) { begin(); }
  Captured& operator=(const Captured&) = delete;
  ~Captured() {
    _fate->touch();
    if (--_fate->alive == 0) _fate->ended.signal();
  }

 private:
  void begin() {
    _fate->touch();
    ++_fate->alive;
  }

  std::shared_ptr<Fate> _fate;
  [[maybe_unused]] std::array<std::size_t, 8> _room{};
};

/// An operation with a callback that owns `captured`.
struct Operation {
  const char* name;
  std::function<void(VelkReporting& client, const Captured& captured)> call;
};

void PrintTo(const Operation& operation, std::ostream* stream) { *stream << operation.name; }

const std::vector<Operation>& operations() {
  static const std::vector<Operation> all{
      {"startConfiguration",
       [](VelkReporting& client, const Captured& captured) {
         client.startConfigurationWithCompletionHandler([captured](const auto&) {});
       }},
      {"fetchReportingStates",
       [](VelkReporting& client, const Captured& captured) {
         client.fetchReportingStatesWithUserInfo(userInfo(), [captured](const auto&) {});
       }},
      {"flushMessages",
       [](VelkReporting& client, const Captured& captured) {
         client.flushMessagesWithCompletion([captured](const auto&) {});
       }},
      {"uploadFile",
       [](VelkReporting& client, const Captured& captured) {
         EXPECT_TRUE(client.uploadFileWithURL("/proc/self/status", [captured](bool, const auto&) {}));
       }},
      {"uploadDataArray",
       [](VelkReporting& client, const Captured& captured) {
         EXPECT_TRUE(
             client.uploadDataArray(PropertyArray{PropertyDictionary{{"a", 1}}}, [captured](bool, const auto&) {}));
       }},
      {"setMessageLoggingBlock",
       [](VelkReporting& client, const Captured& captured) {
         client.setMessageLoggingBlock([captured](const auto&) {});
         client.setMessageLoggingBlock(nullptr);
       }},
      {"registerPeriodicTask",
       [](VelkReporting& client, const Captured& captured) {
         EXPECT_TRUE(client.registerPeriodicTaskForModule(1, true, true, [captured](auto*) {}));
         EXPECT_TRUE(client.registerPeriodicTaskForModule(1, true, true, [](auto*) {}));
       }},
  };
  return all;
}

class WhatCallbacksCaptured : public VelkReportingTest, public ::testing::WithParamInterface<Operation> {
 protected:
  void call(VelkReporting& client) const { GetParam().call(client, Captured(_fate)); }
  void expectOneEndElsewhere() const {
    EXPECT_TRUE(_fate->ended.waitFor(kPatience));
    EXPECT_EQ(_fate->alive.load(), 0);
    EXPECT_EQ(_fate->touchedOnLibraryThread.load(), 0);
  }

  const std::shared_ptr<Fate> _fate = std::make_shared<Fate>();
};

TEST_P(WhatCallbacksCaptured, EndsElsewhereWithoutADaemon) {
  const auto client = makeClient();
  call(*client);
  expectOneEndElsewhere();
}

TEST_P(WhatCallbacksCaptured, EndsElsewhereBehindTheAnswer) {
  _daemon.start();
  const auto client = makeClient();
  call(*client);
  expectOneEndElsewhere();
}

TEST_P(WhatCallbacksCaptured, EndsElsewhereWhenTheDaemonGoesUnasked) {
  _daemon.start();
  const auto client = makeClient();
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
  _daemon.holdCalls(true);
  call(*client);
  _daemon.holdCalls(false);
  _daemon.stop();
  expectOneEndElsewhere();
}

TEST_P(WhatCallbacksCaptured, EndsElsewhereWithTheClient) {
  auto client = makeClient();
  call(*client);
  client.reset();
  expectOneEndElsewhere();
}

INSTANTIATE_TEST_SUITE_P(Of, WhatCallbacksCaptured, ::testing::ValuesIn(operations()),
                         [](const auto& info) { return std::string(info.param.name); });

TEST_F(VelkReportingTest, WhatTheAggregationBlockCapturedEndsElsewhere) {
  const auto fate = std::make_shared<Fate>();
  _daemon.start();
  auto client = makeClient([captured = Captured(fate)](auto&&...) { throw 7; });
  ASSERT_TRUE(_daemon.waitForCalls("setSessionInfo", 1));
  for (int event = 0; event < 100; ++event) _daemon.sendToClient(sessionInfo(), 1, 2, 1, std::nullopt);
  EXPECT_TRUE(fate->ended.waitFor(kPatience)) << "it threw, and is let go of while more events come";
  client.reset();
  EXPECT_EQ(fate->touchedOnLibraryThread.load(), 0);
}

TEST_F(VelkReportingTest, DelegateThatGoesWhileMessagesAreSentEndsElsewhere) {
  class Delegate : public VelkReportingMessageSentDelegate {
   public:
    explicit Delegate(std::shared_ptr<Fate> fate) : _captured(std::move(fate)) {}
    void didSendMessageForReportingClient(const std::shared_ptr<VelkReporting>&, const PropertyDictionary&) override {}

   private:
    const Captured _captured;
  };
  const auto fate = std::make_shared<Fate>();
  const auto client = makeClient();
  for (int round = 0; round < 200; ++round) {
    auto delegate = std::make_shared<Delegate>(fate);
    client->setMessageSentDelegate(delegate);
    for (int event = 0; event < round % 8; ++event) client->sendMessageWithCategory(1, 1);
    delegate.reset();
    ASSERT_TRUE(fate->ended.waitFor(kPatience));
  }
  EXPECT_EQ(fate->touchedOnLibraryThread.load(), 0);
}

TEST(SharedForUser, NothingStaysNothing) {
  EXPECT_FALSE(sharedForUser(ClientRuntime::shared(), std::function<void(int)>()));
}

TEST(SharedForUser, EndsWhereCallbacksRunWhenTheLibraryLetsGoLast) {
  const auto fate = std::make_shared<Fate>();
  ClientRuntime& runtime = ClientRuntime::shared();
  auto shared = shareForUser(runtime, std::function<void()>([captured = Captured(fate)] {}));
  runtime.loop().post([shared = std::move(shared)] {});
  EXPECT_TRUE(fate->ended.waitFor(kPatience));
  EXPECT_EQ(fate->touchedOnLibraryThread.load(), 0);
}

TEST(SharedCallback, IsCalledByWhoeverComesFirstAndOnce) {
  std::atomic<int> calls{0};
  Semaphore called;
  const SharedCallback<int> callback(ClientRuntime::shared(), [&](int value) {
    calls += value;
    called.signal();
  });
  const auto copy = callback;
  callback(1);
  copy(10);
  copy.callHere(100);
  EXPECT_TRUE(called.waitFor(kPatience));
  EXPECT_EQ(calls.load(), 1);
}

TEST(SharedCallback, WhatItCapturedEndsBehindTheCall) {
  const auto fate = std::make_shared<Fate>();
  const SharedCallback<> callback(ClientRuntime::shared(), [captured = Captured(fate)] {});
  callback();
  EXPECT_TRUE(fate->ended.waitFor(kPatience)) << "although somebody could still ask for it";
}

}  // namespace
}  // namespace velk::test
