// The library's way to the system's log: a log daemon of the test's own, which reads when the test says so.
#include <dirent.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <ctime>
#include <future>
#include <memory>
#include <optional>
#include <set>
#include <string>

#include "platform/FileDescriptor.h"
#include "platform/LogSinks.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

using log::Level;

constexpr std::chrono::seconds kPatience{60};

sockaddr_un addressOf(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  return address;
}

class LogDaemon {
 public:
  explicit LogDaemon(const std::string& path)
      : _path(path), _socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0)) {
    const auto address = addressOf(path);
    EXPECT_EQ(::bind(_socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  }
  ~LogDaemon() { ::unlink(_path.c_str()); }
  LogDaemon(const LogDaemon&) = delete;
  LogDaemon& operator=(const LogDaemon&) = delete;

  /// The next line; nothing when none is there. Senders have sent before they return, so there is no waiting.
  std::string take() {
    std::string buffer(1 << 16, '\0');
    const ssize_t size = ::recv(_socket.get(), buffer.data(), buffer.size(), 0);
    return buffer.substr(0, size < 0 ? 0 : static_cast<std::size_t>(size));
  }
  /// Somebody sends so much that nothing more is taken.
  void fill() const {
    const FileDescriptor sender(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    const auto address = addressOf(_path);
    while (::sendto(sender.get(), "x", 1, 0, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 1) {
    }
    EXPECT_EQ(errno, EAGAIN);
  }
  /// The first line behind what `fill` sent.
  std::string takeBehindFilling() {
    std::string line = take();
    while (line == "x") line = take();
    return line;
  }

 private:
  const std::string _path;
  const FileDescriptor _socket;
};

std::set<int> openDescriptors() {
  std::set<int> numbers;
  DIR* const directory = ::opendir("/proc/self/fd");
  while (const dirent* entry = ::readdir(directory)) {
    const int number = std::atoi(entry->d_name);
    if (entry->d_name[0] != '.' && number != ::dirfd(directory)) numbers.insert(number);
  }
  ::closedir(directory);
  return numbers;
}

/// How log daemons write times, in the English of the C locale that tests run in.
std::string asText(std::time_t time) {
  std::tm local{};
  ::localtime_r(&time, &local);
  char text[32];
  return {text, std::strftime(text, sizeof text, "%b %e %T", &local)};
}

class LibraryLogSinkTest : public testing::Test {
 protected:
  static void SetUpTestSuite() { ::unsetenv("VELKREPORTING_LOG"); }

  void start() { daemon = std::make_unique<LogDaemon>(path); }
  void write(const std::string& line) { sink->write(Level::error, line); }
  /// Whether the line was written, or given up, without anybody reading.
  bool writesAtOnce(const std::string& line) {
    auto writing = std::async(std::launch::async, [&] { write(line); });
    if (writing.wait_for(kPatience) == std::future_status::ready) return true;
    while (writing.wait_for(std::chrono::milliseconds(1)) != std::future_status::ready) daemon->take();
    return false;
  }

  const test::TemporaryDirectory directory;
  const std::string path = directory / "log";
  std::unique_ptr<LogDaemon> daemon;
  const std::shared_ptr<log::Sink> sink = log::makeLibrarySink(path);
};

TEST_F(LibraryLogSinkTest, LinesArriveAsThoseOfTheHost) {
  start();
  const char* const formerZone = std::getenv("TZ");
  const auto restoring = formerZone != nullptr ? std::optional<std::string>(formerZone) : std::nullopt;
  ::setenv("TZ", "Here-5:30", 1);
  ::tzset();
  const std::time_t before = std::time(nullptr);
  write("a \"line\" of 100% text");
  const std::time_t after = std::time(nullptr);
  std::set<std::string> lines;
  for (std::time_t time = before; time <= after; ++time) {
    lines.insert("<11>" + asText(time) + " " + program_invocation_short_name + "[" + std::to_string(::getpid()) +
                 "]: velkreporting: a \"line\" of 100% text");
  }
  EXPECT_THAT(lines, testing::Contains(daemon->take()));
  restoring ? ::setenv("TZ", restoring->c_str(), 1) : ::unsetenv("TZ");
  ::tzset();
}

TEST_F(LibraryLogSinkTest, ErrorsAloneArrive) {
  start();
  sink->write(Level::debug, "a");
  sink->write(Level::standard, "b");
  EXPECT_EQ(daemon->take(), "");
}

TEST_F(LibraryLogSinkTest, LosesALineThatTheDaemonDoesNotTake) {
  start();
  daemon->fill();
  EXPECT_TRUE(writesAtOnce("the first"));
  EXPECT_EQ(daemon->takeBehindFilling(), "");
  write("the second");
  EXPECT_THAT(daemon->take(), testing::EndsWith(": the second"));
  daemon->fill();
  EXPECT_TRUE(writesAtOnce("the third")) << "on the socket that it has";
  EXPECT_EQ(daemon->takeBehindFilling(), "");
  write("the fourth");
  EXPECT_THAT(daemon->take(), testing::EndsWith(": the fourth"));
}

TEST_F(LibraryLogSinkTest, LosesLinesWhileNoDaemonIsThere) {
  write("nobody hears this");
  log::makeLibrarySink("")->write(Level::error, "nor this");
  log::makeLibrarySink("/" + std::string(300, 'x'))->write(Level::error, "nor this");
  start();
  write("but this");
  EXPECT_THAT(daemon->take(), testing::EndsWith(": but this"));
  EXPECT_EQ(daemon->take(), "");
}

TEST_F(LibraryLogSinkTest, ARestartedDaemonGetsTheNextLine) {
  start();
  write("the first");
  EXPECT_THAT(daemon->take(), testing::EndsWith(": the first"));
  daemon.reset();
  start();
  write("the second");
  EXPECT_THAT(daemon->take(), testing::EndsWith(": the second")) << "although nobody had noticed";
  daemon.reset();
  write("the third");
  start();
  write("the fourth");
  EXPECT_THAT(daemon->take(), testing::EndsWith(": the fourth"));
  EXPECT_EQ(daemon->take(), "");
}

TEST_F(LibraryLogSinkTest, ADaemonThatHangsWhileAnotherOneTookItsPlaceKeepsNothingBack) {
  start();
  write("the first");
  daemon->fill();
  const auto hanging = std::move(daemon);
  ASSERT_EQ(::unlink(path.c_str()), 0);
  start();
  write("the second");
  EXPECT_THAT(daemon->take(), testing::EndsWith(": the second"));
}

TEST_F(LibraryLogSinkTest, KeepsOneDescriptorThatNoProgramInherits) {
  start();
  const auto before = openDescriptors();
  for (int turn = 0; turn < 3; ++turn) {
    write("a line");
    daemon.reset();
    write("lost");
    start();
  }
  auto after = openDescriptors();
  for (const int number : before) after.erase(number);
  ASSERT_EQ(after.size(), 1U);
  EXPECT_EQ(::fcntl(*after.begin(), F_GETFD), FD_CLOEXEC);
}

TEST_F(LibraryLogSinkTest, ForkedChildrenWriteInTheirOwnName) {
  start();
  write("the parent's");
  EXPECT_THAT(daemon->take(), testing::EndsWith(": the parent's"));
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    ::alarm(static_cast<unsigned>(kPatience.count()));
    write("the child's");
    ::_exit(0);
  }
  int status = -1;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(status, 0);
  EXPECT_THAT(daemon->take(), testing::EndsWith("[" + std::to_string(child) + "]: velkreporting: the child's"));
  write("the parent's, again");
  EXPECT_THAT(daemon->take(),
              testing::EndsWith("[" + std::to_string(::getpid()) + "]: velkreporting: the parent's, again"));
}

}  // namespace
}  // namespace velk
