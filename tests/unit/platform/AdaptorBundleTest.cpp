#include "platform/AdaptorBundle.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/Lock.h"
#include "platform/VelkReportingQuillAdaptor.h"
#include "platform/linux/ForeignCalls.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

using testing::HasSubstr;
using testing::Not;

/// A configuration directory, and copies of shared objects that belong to this user.
class AdaptorBundleTest : public testing::Test {
 protected:
  ~AdaptorBundleTest() override {
    ::unsetenv("QUILL_ADAPTOR_FILE");
    ::unsetenv("HOSTILE_ADAPTOR");
  }

  [[nodiscard]] std::string install(const char* built, const std::string& name) const {
    std::filesystem::copy_file(built, directory / name);
    ::chmod((directory / name).c_str(), 0600);
    return directory / name;
  }
  void name(const std::string& path) const {
    directory.write("adaptors.conf", "# Adaptors\nQuillAdaptor=" + path + "\n");
  }
  [[nodiscard]] std::string refusalOf(const std::string& path) const {
    name(path);
    const auto loaded = makeAdaptorBundle(directory.path())->load();
    return loaded ? "(none)" : loaded.error().description;
  }
  [[nodiscard]] std::unique_ptr<QuillAdaptor> makeFrom(AdaptorBundle& bundle) const {
    const auto loaded = bundle.load();
    EXPECT_TRUE(loaded) << loaded.error().description;
    if (!loaded || *loaded == nullptr) return nullptr;
    auto made = (*loaded)->makeInstance();
    EXPECT_TRUE(made) << made.error().description;
    return made ? std::move(*made) : nullptr;
  }
  /// An instance of the adaptor that misbehaves on demand.
  [[nodiscard]] std::unique_ptr<QuillAdaptor> makeHostile() {
    name(install(VELK_HOSTILE_ADAPTOR, "hostile.so"));
    return makeFrom(*bundle);
  }

  const test::TemporaryDirectory directory;
  const std::unique_ptr<AdaptorBundle> bundle = makeAdaptorBundle(directory.path());
};

TEST_F(AdaptorBundleTest, HandsEventsToTheSample) {
  ::setenv("QUILL_ADAPTOR_FILE", (directory / "events").c_str(), 1);
  name(install(VELK_SAMPLE_ADAPTOR, "quill.so"));
  const auto first = makeFrom(*bundle);
  const auto second = makeFrom(*bundle);
  ASSERT_TRUE(first && second);
  EXPECT_EQ(first->description(), "<QuillAdaptor " + (directory / "quill.so") + ">");
  EXPECT_TRUE(first->respondsToSendMessage());
  EXPECT_TRUE(first->sendMessageWithMethod(7, 3, R"({"a":1})"));
  EXPECT_TRUE(second->sendMessageWithMethod(65'535, 0, std::nullopt));
  EXPECT_EQ(directory.read("events"), "7 3 {\"a\":1}\n65535 0 null\n");
  first->release();
  second->release();
}

TEST_F(AdaptorBundleTest, HasNoneWhereNoneIsNamed) {
  const auto without = bundle->load();
  ASSERT_TRUE(without);
  EXPECT_EQ(*without, nullptr);
  directory.write("adaptors.conf", "Other=/x\n");
  EXPECT_EQ(bundle->load().value_or(nullptr), nullptr);
  name("");
  EXPECT_EQ(bundle->load().value_or(nullptr), nullptr);
}

TEST_F(AdaptorBundleTest, LooksAgainUntilOneIsThere) {
  name(directory / "quill.so");
  EXPECT_FALSE(bundle->load());
  static_cast<void>(install(VELK_SAMPLE_ADAPTOR, "quill.so"));
  const auto loaded = bundle->load();
  ASSERT_TRUE(loaded && *loaded);
  name(directory / "gone.so");
  EXPECT_EQ(bundle->load().value_or(nullptr), *loaded) << "once loaded it stays";
}

TEST_F(AdaptorBundleTest, NamesTheFileAndTheReason) {
  EXPECT_THAT(refusalOf(directory / "none.so"),
              testing::AllOf(HasSubstr("adaptors.conf: QuillAdaptor: "), HasSubstr("none.so: No such file")));
  EXPECT_THAT(refusalOf("quill.so"), HasSubstr("\"quill.so\" is not an absolute path"));
  EXPECT_THAT(refusalOf("../quill.so"), HasSubstr("is not an absolute path"));
  EXPECT_THAT(refusalOf(directory.path()), HasSubstr("is not a regular file"));
  EXPECT_THAT(refusalOf("/dev/zero"), HasSubstr("is not a regular file"));
  EXPECT_THAT(refusalOf(install(VELK_MUTE_ADAPTOR, "mute.so")),
              HasSubstr("mute.so has no function VelkReportingCreateQuillAdaptor"));
}

TEST_F(AdaptorBundleTest, RefusesWhatIsNoLibrary) {
  for (const std::string contents : {"", "\x7f",
                                     "\x7f"
                                     "ELF",
                                     "not a library", "#!/bin/sh\n"}) {
    EXPECT_THAT(refusalOf(directory.write("text.so", contents)), HasSubstr("is not a shared object of this machine"));
  }
  EXPECT_THAT(refusalOf(directory.write("page.so", std::string(8192, '\0'))), HasSubstr("is not a shared object"));
}

TEST_F(AdaptorBundleTest, RefusesALibraryThatWasCutShort) {
  const auto whole = install(VELK_SAMPLE_ADAPTOR, "quill.so");
  const auto size = std::filesystem::file_size(whole);
  for (const auto part : {std::uintmax_t{64}, std::uintmax_t{100}, std::uintmax_t{4096}, size / 2}) {
    if (part >= size) continue;
    const auto cut = directory / "cut.so";
    std::filesystem::copy_file(whole, cut, std::filesystem::copy_options::overwrite_existing);
    std::filesystem::resize_file(cut, part);
    EXPECT_THAT(refusalOf(cut), Not(HasSubstr("(none)"))) << part << " of " << size;
  }
}

TEST_F(AdaptorBundleTest, RefusesWhatOthersCouldHaveWritten) {
  const auto path = install(VELK_SAMPLE_ADAPTOR, "quill.so");
  ::chmod(path.c_str(), 0660);
  EXPECT_THAT(refusalOf(path), HasSubstr("quill.so can be written by others than its owner"));
  ::chmod(path.c_str(), 0600);
  ::chmod(directory.path().c_str(), 0770);
  EXPECT_THAT(refusalOf(path), HasSubstr("others can write it; no adaptor is loaded")) << "nor such a configuration";
  ::chmod(directory.path().c_str(), 0700);
  EXPECT_EQ(refusalOf(path), "(none)");
  if (::geteuid() != 0) GTEST_SKIP() << "only root can give files away";
  ASSERT_EQ(::chown(path.c_str(), 65534, 65534), 0);
  EXPECT_THAT(refusalOf(path), HasSubstr("belongs to user 65534"));
}

TEST_F(AdaptorBundleTest, RefusesAConfigurationThatOthersCanWrite) {
  name(install(VELK_SAMPLE_ADAPTOR, "quill.so"));
  ::chmod((directory / "adaptors.conf").c_str(), 0622);
  const auto loaded = bundle->load();
  ASSERT_FALSE(loaded);
  EXPECT_THAT(loaded.error().description, HasSubstr("adaptors.conf: others can write it"));
}

TEST_F(AdaptorBundleTest, TurnsStatusesAndExceptionsIntoErrors) {
  const auto adaptor = makeHostile();
  ASSERT_TRUE(adaptor);
  const auto failureOf = [&](const char* dict) {
    const auto sent = adaptor->sendMessageWithMethod(1, 2, dict);
    return sent ? "(none)" : sent.error().description;
  };
  EXPECT_THAT(failureOf("throw an error"), HasSubstr("hostile.so> threw: an error with a"));
  EXPECT_THAT(failureOf("throw a number"), HasSubstr("hostile.so> threw an exception"));
  EXPECT_THAT(failureOf("refuse"), HasSubstr("hostile.so> failed with status 7"));
  EXPECT_EQ(failureOf("go on"), "(none)") << "none of it is held against it";
}

TEST_F(AdaptorBundleTest, SurvivesAnAdaptorThatMakesNoInstance) {
  for (const auto& [wish, reason] :
       {std::pair("refuse", "failed with status 9"), std::pair("throw", "threw: not today")}) {
    ::setenv("HOSTILE_ADAPTOR", wish, 1);
    std::filesystem::remove(directory / "hostile.so");
    name(install(VELK_HOSTILE_ADAPTOR, "hostile.so"));
    const auto made = bundle->load().value()->makeInstance();
    ASSERT_FALSE(made);
    EXPECT_THAT(made.error().description, HasSubstr(reason));
  }
}

TEST_F(AdaptorBundleTest, ShowsAnAdaptorThatTakesNoEvents) {
  ::setenv("HOSTILE_ADAPTOR", "deaf", 1);
  const auto adaptor = makeHostile();
  ASSERT_TRUE(adaptor);
  EXPECT_FALSE(adaptor->respondsToSendMessage());
  EXPECT_FALSE(adaptor->sendMessageWithMethod(1, 1, "{}"));
}

TEST_F(AdaptorBundleTest, CallsNothingOnceItIsStopped) {
  const auto adaptor = makeHostile();
  ASSERT_TRUE(adaptor);
  EXPECT_TRUE(bundle->stop(Duration::zero()));
  EXPECT_FALSE(adaptor->sendMessageWithMethod(1, 1, "{}"));
  EXPECT_FALSE(bundle->load().value()->makeInstance());
  testing::internal::CaptureStderr();
  adaptor->release();
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
}

TEST_F(AdaptorBundleTest, ReleasesAnInstanceOnlyWhenAsked) {
  auto adaptor = makeHostile();
  ASSERT_TRUE(adaptor);
  testing::internal::CaptureStderr();
  adaptor->release();
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "hostile adaptor: released\n");
  adaptor = makeFrom(*bundle);
  testing::internal::CaptureStderr();
  adaptor.reset();
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
}

TEST(ForeignCalls, AdmitsSoManyAtOnce) {
  ForeignCalls calls(2);
  {
    const ForeignCalls::Scope first(calls);
    const ForeignCalls::Scope second(calls);
    EXPECT_TRUE(first.isEntered() && second.isEntered());
    EXPECT_FALSE(ForeignCalls::Scope(calls).isEntered());
    EXPECT_FALSE(ForeignCalls::Scope(calls).isEntered()) << "one that was refused does not count";
  }
  EXPECT_TRUE(ForeignCalls::Scope(calls).isEntered());
}

TEST(ForeignCalls, StoppingWaitsForThoseUnderWay) {
  ForeignCalls calls(2);
  auto scope = std::make_unique<ForeignCalls::Scope>(calls);
  EXPECT_FALSE(calls.stop(Duration::zero())) << "one is still under way";
  EXPECT_FALSE(ForeignCalls::Scope(calls).isEntered()) << "and none begins";
  std::thread returning([&] { scope.reset(); });
  EXPECT_TRUE(calls.stop(std::chrono::seconds(60)));
  returning.join();
}

}  // namespace
}  // namespace velk
