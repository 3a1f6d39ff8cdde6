#include "platform/UserDefaults.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <thread>
#include <vector>

#include "platform/FileDescriptor.h"
#include "platform/Files.h"
#include "platform/Platform.h"
#include "tests/support/FakeUserDefaults.h"
#include "tests/support/RecordingLog.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

class UserDefaultsTest : public testing::Test {
 protected:
  [[nodiscard]] std::unique_ptr<UserDefaults> open() const {
    return openUserDefaults("suite", directory / "state", directory / "etc");
  }
  [[nodiscard]] unsigned modeOf(std::string_view name) const {
    struct stat status {};
    EXPECT_EQ(::stat((directory / name).c_str(), &status), 0) << name;
    return status.st_mode & 07777;
  }

  test::RecordingLog log;
  const test::TemporaryDirectory directory;
};

TEST_F(UserDefaultsTest, IsEmptyWithoutAFile) {
  const auto suite = open();
  EXPECT_EQ(suite->value("key"), std::nullopt);
  EXPECT_TRUE(suite->allValues().empty());
  EXPECT_FALSE(files::exists(directory / "state"));
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(UserDefaultsTest, KeepsEveryKindOfValue) {
  const PropertyDictionary value{
      {"date", Date{1'600'000'000.25}}, {"data", ByteData{1, 2}}, {"list", PropertyArray{1, -2, 2.5}}};
  ASSERT_TRUE(open()->set("key", value));
  EXPECT_EQ(open()->value("key"), PropertyValue(value));
}

TEST_F(UserDefaultsTest, LetsNobodyElseIn) {
  ASSERT_TRUE(open()->set("key", 1));
  EXPECT_EQ(modeOf("state"), 0700U);
  EXPECT_EQ(modeOf("state/suite.json"), 0600U);
  EXPECT_EQ(modeOf("state/suite.lock"), 0600U);
}

TEST_F(UserDefaultsTest, SeesWhatOthersWroteLast) {
  const auto reader = open();
  const auto writer = open();
  // Versions of equal length, written within one tick of the file system's clock.
  for (int number = 10; number < 99; ++number) {
    ASSERT_TRUE(writer->set("key", number));
    ASSERT_EQ(reader->value("key"), PropertyValue(number));
  }
  ASSERT_TRUE(writer->remove("key"));
  EXPECT_EQ(reader->value("key"), std::nullopt);
}

TEST_F(UserDefaultsTest, SeesFilesEditedByHand) {
  const auto suite = open();
  ASSERT_TRUE(suite->set("key", 1));
  directory.write("state/suite.json", "{\"key\": \"edited by hand\"}");
  EXPECT_EQ(suite->value("key"), PropertyValue("edited by hand"));
}

TEST_F(UserDefaultsTest, FallsBackToTheAdministratorsDefaults) {
  directory.write("etc/suite.json", R"({"a": 1, "b": 2})");
  const auto suite = open();
  ASSERT_TRUE(suite->set("b", 3));
  EXPECT_EQ(suite->value("a"), PropertyValue(1));
  EXPECT_EQ(suite->value("b"), PropertyValue(3));
  EXPECT_EQ(suite->allValues(), (PropertyDictionary{{"a", 1}, {"b", 3}}));
  ASSERT_TRUE(suite->remove("b"));
  EXPECT_EQ(suite->value("b"), PropertyValue(2));
  EXPECT_EQ(suite->valueOrStore("a", [] { return PropertyValue(9); }), PropertyValue(1));
}

TEST_F(UserDefaultsTest, IgnoresAdministratorsDefaultsThatOthersCanWrite) {
  const auto path = directory.write("etc/suite.json", R"({"a": 1})");
  const auto suite = open();
  EXPECT_EQ(suite->value("a"), PropertyValue(1));
  ASSERT_EQ(::chmod(path.c_str(), 0666), 0);
  EXPECT_EQ(suite->value("a"), std::nullopt);
  EXPECT_EQ(suite->value("a"), std::nullopt);
  EXPECT_EQ(log.count(log::Level::error, "UserDefaults: Ignoring " + path + ": others can write it"), 1);
}

TEST_F(UserDefaultsTest, ReportsUnusableAdministratorsDefaultsOnce) {
  directory.write("etc/suite.json", "nonsense");
  const auto suite = open();
  EXPECT_EQ(suite->value("a"), std::nullopt);
  EXPECT_EQ(suite->value("b"), std::nullopt);
  EXPECT_EQ(log.lines().size(), 1U);
  EXPECT_EQ(directory.read("etc/suite.json"), "nonsense");
}

TEST_F(UserDefaultsTest, SetsACorruptFileAsideOnce) {
  for (const std::string_view text : {"", "{\"key\": ", "[1, 2]", "\xff\xfe", "{\"a\": 1} and more"}) {
    log.clear();
    directory.write("state/suite.json", text);
    const auto suite = open();
    EXPECT_EQ(suite->value("key"), std::nullopt);
    EXPECT_EQ(suite->value("key"), std::nullopt);
    EXPECT_FALSE(files::exists(directory / "state/suite.json"));
    ASSERT_EQ(log.lines().size(), 1U) << text;
    EXPECT_EQ(log.lines()[0].level, log::Level::error);
    EXPECT_TRUE(log.contains("suite.json.corrupt-"));
    ASSERT_TRUE(suite->set("key", 1));
    EXPECT_EQ(suite->value("key"), PropertyValue(1));
  }
}

TEST_F(UserDefaultsTest, ReportsACorruptFileThatCannotBeSetAsideOnce) {
  for (int number = 1; number <= 5; ++number) {
    directory.write("state/suite.json.corrupt-" + std::to_string(number) + "/taken", "");
  }
  directory.write("state/suite.json", "corrupt");
  const auto suite = open();
  EXPECT_EQ(suite->value("key"), std::nullopt);
  EXPECT_EQ(suite->value("key"), std::nullopt);
  ASSERT_EQ(log.lines().size(), 1U);
  EXPECT_TRUE(log.contains("UserDefaults: Cannot use "));
  EXPECT_EQ(directory.read("state/suite.json"), "corrupt");
}

TEST_F(UserDefaultsTest, WritesOverACorruptFileAfterSettingItAside) {
  directory.write("state/suite.json", "corrupt");
  ASSERT_TRUE(open()->set("key", 1));
  EXPECT_EQ(directory.read("state/suite.json.corrupt-1"), "corrupt");
  EXPECT_EQ(open()->value("key"), PropertyValue(1));
}

TEST_F(UserDefaultsTest, RefusesWhatCannotBeStored) {
  const auto suite = open();
  ASSERT_TRUE(suite->set("key", 1));
  EXPECT_FALSE(suite->set("key", std::numeric_limits<double>::quiet_NaN()));
  EXPECT_FALSE(suite->set("key", "\xff"));
  EXPECT_FALSE(suite->set("key", std::string(5 * 1024 * 1024, 'x')));
  EXPECT_EQ(suite->value("key"), PropertyValue(1));
}

TEST_F(UserDefaultsTest, WithdrawsConsentInAFullFile) {
  const auto suite = open();
  constexpr std::size_t kMaximumBytes = 4U * 1024 * 1024;
  const std::string frame = "{\n  \"large\": \"\"\n}\n";
  ASSERT_TRUE(suite->set("large", std::string(kMaximumBytes - frame.size(), 'x')));
  EXPECT_FALSE(suite->set("small", 1));
  for (const bool consent : {true, false, true, false}) {
    ASSERT_TRUE(suite->set(kDiagnosticsAndUsageSetting, consent));
    EXPECT_EQ(open()->value(kDiagnosticsAndUsageSetting), PropertyValue(consent));
  }
  EXPECT_FALSE(suite->set("small", 1));
  EXPECT_TRUE(suite->set("large", "now less"));
  EXPECT_TRUE(suite->set("small", 1));
}

TEST_F(UserDefaultsTest, ChangesAFullFileThatHasNoBlanks) {
  std::string text = R"({"last":[1,2],"list":[1)";
  for (int i = 0; i < 700'000; ++i) text += ",1";
  directory.write("state/suite.json", text + "]}");
  const auto suite = open();
  EXPECT_TRUE(suite->set(kDiagnosticsAndUsageSetting, false));
  EXPECT_TRUE(suite->set("last", 1));
  EXPECT_EQ(open()->value("last"), PropertyValue(1));
  EXPECT_EQ(open()->value("list")->array()->size(), 700'001U);
}

TEST_F(UserDefaultsTest, TellsWhenItCannotWrite) {
  directory.write("state", "a file where the directory should be");
  const auto suite = open();
  const auto stored = suite->set("key", 1);
  ASSERT_FALSE(stored);
  EXPECT_FALSE(stored.error().description.empty());
  EXPECT_EQ(suite->value("key"), std::nullopt);
}

TEST_F(UserDefaultsTest, DoesNotReplaceWhatItCannotRead) {
  ASSERT_TRUE(files::createDirectories(directory / "state/suite.json"));
  const auto suite = open();
  EXPECT_EQ(suite->value("key"), std::nullopt);
  EXPECT_EQ(suite->value("key"), std::nullopt);
  EXPECT_FALSE(suite->set("key", 1));
  EXPECT_EQ(log.lines().size(), 1U);
}

TEST_F(UserDefaultsTest, KeepsToWhatItReadLastWhileDescriptorsAreShort) {
#ifdef __SANITIZE_ADDRESS__
  GTEST_SKIP() << "this sanitizer needs descriptors";
#endif
  const auto suite = open();
  ASSERT_TRUE(suite->set("key", "old"));
  EXPECT_EQ(suite->value("key"), PropertyValue("old"));
  ASSERT_TRUE(open()->set("key", "new"));
  rlimit usual{};
  ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &usual), 0);
  const rlimit none{0, usual.rlim_max};
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
  const auto during = suite->value("key");
  const auto again = suite->value("key");
  const auto written = suite->set("other", 1);
  ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &usual), 0);
  EXPECT_EQ(during, PropertyValue("old"));
  EXPECT_EQ(again, PropertyValue("old"));
  EXPECT_FALSE(written);
  EXPECT_EQ(log.lines().size(), 1U) << "told once";
  EXPECT_EQ(suite->value("key"), PropertyValue("new"));
}

TEST_F(UserDefaultsTest, StoresAValueOnlyWhereThereIsNone) {
  const auto suite = open();
  EXPECT_EQ(suite->valueOrStore("key", [] { return PropertyValue("first"); }), PropertyValue("first"));
  EXPECT_EQ(open()->valueOrStore("key", [] { return PropertyValue("second"); }), PropertyValue("first"));
}

TEST_F(UserDefaultsTest, LosesNoKeyOfProcessesThatWriteAtOnce) {
  constexpr int kProcesses = 2;
  constexpr int kKeys = 40;
  std::vector<pid_t> children;
  for (int process = 0; process < kProcesses; ++process) {
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      const auto suite = open();
      bool stored = true;
      for (int key = 0; key < kKeys; ++key) {
        stored = suite->set(std::to_string(process) + "-" + std::to_string(key), key).has_value() && stored;
      }
      ::_exit(stored ? 0 : 1);
    }
    children.push_back(child);
  }
  for (const pid_t child : children) {
    int status = -1;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
  }
  EXPECT_EQ(open()->allValues().size(), static_cast<std::size_t>(kProcesses * kKeys));
}

TEST_F(UserDefaultsTest, ChildrenForkedDuringAWriteKeepNobodyOut) {
  const auto suite = open();
  pid_t child = -1;
  const auto stored = suite->valueOrStore("key", [&child]() -> PropertyValue {
    child = ::fork();  // as another thread of this process might just now
    if (child == 0) {
      ::alarm(60);
      for (;;) ::pause();
    }
    return 1;
  });
  EXPECT_TRUE(stored);
  const int lock = ::open((directory / "state/suite.lock").c_str(), O_RDWR | O_CLOEXEC);
  ASSERT_GE(lock, 0);
  EXPECT_EQ(::flock(lock, LOCK_EX | LOCK_NB), 0) << "the child's copy of the descriptor holds the lock";
  ::close(lock);
  ASSERT_GT(child, 0);
  ::kill(child, SIGKILL);
  int status = 0;
  EXPECT_EQ(::waitpid(child, &status, 0), child);
}

class HeldSuiteTest : public UserDefaultsTest {
 protected:
  /// As another process would hold it.
  void hold() {
    ASSERT_TRUE(open()->set("before", 1));
    lock = FileDescriptor(::open((directory / "state/suite.lock").c_str(), O_RDWR | O_CLOEXEC));
    ASSERT_EQ(::flock(lock.get(), LOCK_EX | LOCK_NB), 0);
  }
  template <class Work>
  static std::chrono::steady_clock::duration timeOf(Work work) {
    const auto begun = std::chrono::steady_clock::now();
    work();
    return std::chrono::steady_clock::now() - begun;
  }

  FileDescriptor lock;
};

TEST_F(HeldSuiteTest, IsReadAsEver) {
  hold();
  EXPECT_EQ(open()->value("before"), PropertyValue(1));
}

TEST_F(HeldSuiteTest, SaysAfterASecondWhichFileIsHeld) {
  hold();
  const auto suite = open();
  const auto stored = suite->set("key", 1);
  ASSERT_FALSE(stored);
  EXPECT_EQ(stored.error().description, directory / "state/suite.lock" + " is held by another process");
}

TEST_F(HeldSuiteTest, CostsOneWaitForManySettings) {
  hold();
  const auto suite = open();
  const auto first = timeOf([&] { EXPECT_FALSE(suite->set("key", 1)); });
  const auto others = timeOf([&] {
    for (int key = 0; key < 100; ++key) EXPECT_FALSE(suite->set(std::to_string(key), key));
  });
  EXPECT_GE(first, std::chrono::milliseconds(900));
  EXPECT_LT(others, 10 * first) << "a hundred waits would take a hundred times as long";
  lock = FileDescriptor();
  EXPECT_TRUE(suite->set("key", 1)) << "once it is free it can be written at once";
}

TEST_F(HeldSuiteTest, LetsThreadsWaitTogether) {
  hold();
  const auto suite = open();
  const auto all = timeOf([&] {
    std::vector<std::thread> threads;
    for (int thread = 0; thread < 8; ++thread) threads.emplace_back([&] { EXPECT_FALSE(suite->set("key", 1)); });
    for (auto& thread : threads) thread.join();
  });
  EXPECT_LT(all, std::chrono::seconds(5));
}

TEST_F(HeldSuiteTest, IsWrittenByWhoeverWaitedLongEnough) {
  hold();
  const auto suite = open();
  std::thread holder([&] {
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    lock = FileDescriptor();
  });
  EXPECT_TRUE(suite->set("key", 1));
  holder.join();
}

TEST_F(HeldSuiteTest, LeavesACorruptFileWhereItIs) {
  hold();
  ASSERT_TRUE(files::writeAtomically(directory / "state/suite.json", ByteData{'{'}));
  EXPECT_EQ(open()->value("before"), std::nullopt);
  EXPECT_TRUE(files::exists(directory / "state/suite.json"));
}

TEST_F(UserDefaultsTest, LosesNoKeyOfThreadsThatWriteAtOnce) {
  const auto suite = open();
  std::vector<std::thread> threads;
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([&suite, thread] {
      for (int key = 0; key < 10; ++key) {
        const auto name = std::to_string(thread) + "-" + std::to_string(key);
        EXPECT_TRUE(suite->set(name, key));
        EXPECT_EQ(suite->value(name), PropertyValue(key));
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(suite->allValues().size(), 40U);
}

TEST(Consent, IsOffUnlessTurnedOn) {
  test::FakeUserDefaults defaults;
  const auto consent = makeConsent(defaults);
  EXPECT_FALSE(consent->diagnosticsAndUsageEnabled());
  defaults.put(kDiagnosticsAndUsageSetting, true);
  EXPECT_TRUE(consent->diagnosticsAndUsageEnabled());
  defaults.put(kDiagnosticsAndUsageSetting, "YES");
  EXPECT_TRUE(consent->diagnosticsAndUsageEnabled());
  defaults.put(kDiagnosticsAndUsageSetting, "off");
  EXPECT_FALSE(consent->diagnosticsAndUsageEnabled());
  defaults.put(kDiagnosticsAndUsageSetting, PropertyArray{1});
  EXPECT_FALSE(consent->diagnosticsAndUsageEnabled());
}

}  // namespace
}  // namespace velk
