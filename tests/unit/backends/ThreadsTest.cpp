// What other threads may do while a session sends: other sessions read and write, transports answer.
#include <atomic>
#include <thread>

#include "platform/ThreadPool.h"
#include "tests/unit/backends/BackendFixture.h"

namespace velk::test {
namespace {

TEST(BackendThreads, ShareABackendSafely) {
  FakePlatform fakes;
  auto pool = makeThreadPool();
  const Platform own = fakes.platform();
  Platform platform{own.clock,  *pool,         own.defaults, own.device,  own.locale,       own.http,
                    own.random, own.keepAlive, own.consent,  own.process, own.logSubmission};
  const DeviceEnvironment environment(fakes.defaults, fakes.device);
  const BackendContext context{platform, environment};
  const auto transport = std::make_shared<FakeTransport>();
  const PropertyDictionary entry{{"locale_whitelist", PropertyArray{"US"}},
                                 {"filters", PropertyArray{}},
                                 {"sampling_threshold", 1.0},
                                 {"event_threshold", 5},
                                 {"post_url", "https://collector.example/"}};
  const auto backend =
      newBackendWithName(context, "korrin", PropertyDictionary{{"clients", PropertyArray{entry}}}, "Lamp", 20);
  backend->setReportingSessionConnectivityDelegate(transport);
  backend->setUserInfoDict(PropertyDictionary{{"_clientName", "Media"}});
  backend->setBatchEvents(true);
  backend->updateState();

  std::atomic<bool> stop{false};
  std::thread otherSession([&] {
    while (!stop) {
      backend->setCorrelatedSessionID("parent.child");
      backend->setSamplingThreshold(backend->samplingThreshold().value_or(0) > 0.5 ? 0.25 : 0.75);
      if (backend->state() == kBackendEnabled) backend->setState(kBackendEnabled);
      static_cast<void>(backend->batchedEventsSize());
    }
  });
  std::thread server([&] {
    for (std::size_t answered = 0; !stop;) {
      if (answered < transport->count()) {
        transport->answer(answered++, 200);
      } else {
        std::this_thread::yield();
      }
    }
  });
  std::size_t posted = 0;
  for (int event = 0; event < 500; ++event) {
    backend->sendMessage(PropertyDictionary{{"ClientData", PropertyDictionary{{"n", event}}}}, kStart, 7, 3,
                         event % 50 == 0 ? 1 : 0);
  }
  backend->flushMessagesWithCompletion({});
  stop = true;
  otherSession.join();
  server.join();
  for (std::size_t number = 0; number < transport->count(); ++number) {
    posted += eventsOf(transport->request(number)).size();
  }
  EXPECT_EQ(posted, 500U);
}

}  // namespace
}  // namespace velk::test
