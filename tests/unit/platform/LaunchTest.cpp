#include "platform/Launch.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <functional>

#include "tests/support/TemporaryDirectory.h"

namespace velk {
namespace {

FileDescriptor boundSocket(const std::string& path, int type) {
  FileDescriptor socket(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  EXPECT_EQ(::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  return socket;
}

/// Runs in a child, whose descriptors and environment may be rearranged; true when `check` returns true.
bool holdsInChild(const std::function<bool()>& check) {
  const pid_t child = ::fork();
  if (child == 0) ::_exit(check() ? 0 : 1);
  int status = -1;
  return ::waitpid(child, &status, 0) == child && status == 0;
}

void announce(int count) {
  ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
  ::setenv("LISTEN_FDS", std::to_string(count).c_str(), 1);
}

TEST(Launch, HasNoSocketsWhenStartedByHand) {
  EXPECT_TRUE(holdsInChild([] {
    ::unsetenv("LISTEN_FDS");
    ::unsetenv("LISTEN_PID");
    return launch::takeActivatedSockets().empty();
  }));
}

TEST(Launch, TakesListeningSocketsAndClosesTheRest) {
  const test::TemporaryDirectory directory;
  const auto listening = boundSocket(directory / "listening", SOCK_STREAM);
  ASSERT_EQ(::listen(listening.get(), 5), 0);
  const auto datagram = boundSocket(directory / "datagram", SOCK_DGRAM);
  EXPECT_TRUE(holdsInChild([&] {
    // What stands at 3 and 4 may be these very sockets: copies keep them.
    const int first = ::fcntl(listening.get(), F_DUPFD, 50);
    const int second = ::fcntl(datagram.get(), F_DUPFD, 50);
    ::dup2(first, 3);
    ::dup2(second, 4);
    announce(2);
    auto sockets = launch::takeActivatedSockets();
    if (sockets.size() != 1 || sockets[0].get() != 3) return false;
    if ((::fcntl(3, F_GETFD) & FD_CLOEXEC) == 0 || ::fcntl(4, F_GETFD) != -1) return false;
    if (std::getenv("LISTEN_FDS") != nullptr || std::getenv("LISTEN_PID") != nullptr) return false;
    return launch::takeActivatedSockets().empty();
  }));
}

TEST(Launch, LeavesSocketsOfAnotherProcessAlone) {
  EXPECT_TRUE(holdsInChild([] {
    ::setenv("LISTEN_PID", "1", 1);
    ::setenv("LISTEN_FDS", "1", 1);
    return launch::takeActivatedSockets().empty();
  }));
}

TEST(Launch, TellsTheServiceManager) {
  const test::TemporaryDirectory directory;
  const auto manager = boundSocket(directory / "notify", SOCK_DGRAM);
  const auto path = directory / "notify";
  EXPECT_TRUE(holdsInChild([&] {
    ::setenv("NOTIFY_SOCKET", path.c_str(), 1);
    launch::notifyReady("serving");
    launch::notifyStatus("two\nlines");
    launch::notifyStopping();
    return true;
  }));
  std::string heard;
  char buffer[256];
  for (int message = 0; message < 3; ++message) {
    const ssize_t got = ::recv(manager.get(), buffer, sizeof buffer, MSG_DONTWAIT);
    ASSERT_GT(got, 0);
    heard += std::string(buffer, static_cast<std::size_t>(got)) + "|";
  }
  EXPECT_EQ(heard, "READY=1\nSTATUS=serving|STATUS=two lines|STOPPING=1|");
}

TEST(Launch, DoesWithoutAServiceManager) {
  EXPECT_TRUE(holdsInChild([] {
    ::unsetenv("NOTIFY_SOCKET");
    launch::notifyReady();
    launch::notifyStopping();
    return true;
  }));
}

}  // namespace
}  // namespace velk
