// A host that has no descriptor or no thread left to give: nothing is thrown at it, it is told so, and what was refused
// works as soon as there is one again. Each test has a process of its own, which has not used the library yet.
#include <pthread.h>
#include <sys/resource.h>
#include <unistd.h>

#include <cstdio>
#include <thread>

#include "client/LogTexts.h"
#include "tests/unit/client/ClientFixture.h"

namespace velk::test {
namespace {

constexpr uid_t kNobody = 65534;

// The check of objects' types that goes with the address sanitizer asks a pipe of its own whether memory is there, and
// takes a sound object for a broken one where no pipe can be had.
#ifdef __SANITIZE_ADDRESS__
constexpr bool kSanitizerNeedsDescriptors = true;
#else
constexpr bool kSanitizerNeedsDescriptors = false;
#endif

/// While one lives, this process has as many descriptors as it may.
class NoDescriptors {
 public:
  NoDescriptors() {
    getrlimit(RLIMIT_NOFILE, &_usual);
    const int next = dup(STDERR_FILENO);
    close(next);
    const rlimit none{static_cast<rlim_t>(next), _usual.rlim_max};
    setrlimit(RLIMIT_NOFILE, &none);
  }
  ~NoDescriptors() { setrlimit(RLIMIT_NOFILE, &_usual); }
  NoDescriptors(const NoDescriptors&) = delete;
  NoDescriptors& operator=(const NoDescriptors&) = delete;

 private:
  rlimit _usual{};
};

/// While one lives, no thread can be started: each would want a stack that is larger than all memory.
class NoThreads {
 public:
  NoThreads() {
    pthread_getattr_default_np(&_usual);
    pthread_attr_t endless;
    pthread_attr_init(&endless);
    pthread_attr_setstacksize(&endless, std::size_t{1} << 47);
    pthread_setattr_default_np(&endless);
    pthread_attr_destroy(&endless);
  }
  ~NoThreads() {
    pthread_setattr_default_np(&_usual);
    pthread_attr_destroy(&_usual);
  }
  NoThreads(const NoThreads&) = delete;
  NoThreads& operator=(const NoThreads&) = delete;

 private:
  pthread_attr_t _usual{};
};

/// The same by the system's own limit, which holds for every user but root.
class NoProcesses {
 public:
  NoProcesses() {
    if (geteuid() == 0 && setresuid(kNobody, kNobody, kNobody) != 0) std::abort();
    getrlimit(RLIMIT_NPROC, &_usual);
    const rlimit none{0, _usual.rlim_max};
    setrlimit(RLIMIT_NPROC, &none);
  }
  ~NoProcesses() { setrlimit(RLIMIT_NPROC, &_usual); }
  NoProcesses(const NoProcesses&) = delete;
  NoProcesses& operator=(const NoProcesses&) = delete;

 private:
  rlimit _usual{};
};

class ClientScarcity : public VelkReportingTest {
 protected:
  ClientScarcity() { GTEST_FLAG_SET(death_test_style, "threadsafe"); }

  /// In the process of its own: everything that needs a thread is refused, and says why; the rest works.
  void expectRefusals() {
    EXPECT_EQ(makeClient(), nullptr);
    EXPECT_EQ(_log.count(texts::kFailedToCreateQueue), 1);
    Error error;
    EXPECT_FALSE(VelkReporting::sendOneMessageWithSessionInfo(sessionInfo(), userInfo(), 1, 1, std::nullopt, &error));
    EXPECT_EQ(error.code, 13);
    EXPECT_EQ(error.domain, "VelkReportingErrorDomain");
    EXPECT_EQ(errorsThatBeginWith("initWithSessionInfo: the library gets no thread: "), 1);
    EXPECT_EQ(errorsThatBeginWith("sendOneMessageWithSessionInfo: the library gets no thread: "), 1);
    EXPECT_EQ(VelkReporting::getPersistentIdentifierForDNU(true).size(), 36U);
    VelkReporting::regeneratePersistentIdentifierForDNU(true);
    EXPECT_TRUE(VelkReporting::newHierarchyTokenFromParentToken(std::nullopt));
  }
  [[nodiscard]] int errorsThatBeginWith(std::string_view beginning) const {
    int count = 0;
    for (const auto& line : _log.lines()) {
      count += line.level == log::Level::error && line.text.starts_with(beginning) ? 1 : 0;
    }
    return count;
  }
  void expectEvents() {
    const auto client = makeClient();
    ASSERT_TRUE(client);
    static_cast<void>(configure(*client));
    EXPECT_TRUE(client->sendMessageWithDictionary(message(1)));
    EXPECT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 1));
    EXPECT_TRUE(VelkReporting::sendOneMessageWithSessionInfo(sessionInfo(), userInfo(), 1, 1, std::nullopt));
    EXPECT_TRUE(_daemon.waitForCalls("sendMessageWithSessionInfo", 1));
  }
  /// The end of that process.
  [[noreturn]] static void end() {
    std::fflush(stdout);
    _exit(HasFailure() ? 1 : 0);
  }
  static void begin() { alarm(60); }
};

TEST_F(ClientScarcity, OfDescriptorsRefusesUntilThereAreSome) {
  if (kSanitizerNeedsDescriptors) GTEST_SKIP() << "the sanitizer needs descriptors";
  EXPECT_EXIT(
      {
        begin();
        _daemon.start();
        {
          const NoDescriptors none;
          expectRefusals();
        }
        expectEvents();
        end();
      },
      testing::ExitedWithCode(0), "");
}

TEST_F(ClientScarcity, OfThreadsRefusesUntilThereIsOne) {
  EXPECT_EXIT(
      {
        begin();
        _daemon.start();
        {
          const NoThreads none;
          expectRefusals();
        }
        expectEvents();
        end();
      },
      testing::ExitedWithCode(0), "");
}

TEST_F(ClientScarcity, OfProcessesRefusesUntilOneMayBeStarted) {
  EXPECT_EXIT(
      {
        begin();
        {
          const NoProcesses none;
          expectRefusals();
        }
        const auto client = makeClient();
        EXPECT_TRUE(client);
        EXPECT_TRUE(client && flush(*client)) << "no daemon answers, and that is told";
        end();
      },
      testing::ExitedWithCode(0), "");
}

TEST_F(ClientScarcity, OfDescriptorsLetsEventsWait) {
  if (kSanitizerNeedsDescriptors) GTEST_SKIP() << "the sanitizer needs descriptors";
  EXPECT_EXIT(
      {
        begin();
        const auto client = makeClient();
        EXPECT_TRUE(flush(*client)) << "it has tried to connect";
        _daemon.start();
        {
          const NoDescriptors none;
          EXPECT_TRUE(client->sendMessageWithDictionary(message(1)));
          EXPECT_TRUE(flush(*client));
          EXPECT_FALSE(client->uploadFileWithURL("/proc/self/status", nullptr));
          EXPECT_TRUE(VelkReporting::sendOneMessageWithSessionInfo(sessionInfo(), userInfo(), 1, 1, std::nullopt));
          EXPECT_TRUE(flush(*client)) << "the single message has had its turn";
        }
        EXPECT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 1));
        end();
      },
      testing::ExitedWithCode(0), "");
}

TEST_F(ClientScarcity, OfThreadsLetsCallbacksAndTicksWait) {
  EXPECT_EXIT(
      {
        begin();
        _daemon.start();
        const auto client = makeClient();
        const auto answered = std::make_shared<Semaphore>();
        {
          const NoThreads none;
          client->flushMessagesWithCompletion([answered](const auto&) { answered->signal(); });
          client->registerPeriodicTaskForModule(1, true, true, [](auto* statistics) { statistics->set("n", 1); });
          client->startLogTimerWithInterval(3600, 1, 3, 4);
          // One of each pool.
          while (errorsThatBeginWith("Failed to start a thread: ") < 2) std::this_thread::yield();
        }
        EXPECT_TRUE(answered->waitFor(kPatience)) << "although nobody calls anything any more";
        EXPECT_TRUE(_daemon.waitForCalls("sendMessageWithDictionary", 1));
        end();
      },
      testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace velk::test
