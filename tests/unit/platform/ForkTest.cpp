#include "platform/Fork.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <memory>
#include <vector>

#include "platform/FileDescriptor.h"

namespace velk {
namespace {

/// Whether a child that is forked now has the descriptor.
bool aChildHas(int descriptor) {
  const pid_t child = ::fork();
  if (child == 0) ::_exit(::fcntl(descriptor, F_GETFD) >= 0 ? 1 : 0);
  int status = -1;
  EXPECT_EQ(::waitpid(child, &status, 0), child);
  return WEXITSTATUS(status) == 1;
}

TEST(NotForChildren, ClosesTheCopiesOfChildrenAndNothingElse) {
  const FileDescriptor own(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  const FileDescriptor shared(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  {
    const NotForChildren kept(own.get());
    EXPECT_TRUE(kept);
    EXPECT_FALSE(aChildHas(own.get()));
    EXPECT_TRUE(aChildHas(shared.get()));
    EXPECT_GE(::fcntl(own.get(), F_GETFD), 0) << "it is still the parent's";
    EXPECT_FALSE(aChildHas(own.get())) << "the next child's as well";
  }
  EXPECT_TRUE(aChildHas(own.get())) << "its number may be another descriptor's";
}

TEST(NotForChildren, FindsNoPlaceBeyondItsBound) {
  const FileDescriptor descriptor(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  std::vector<std::unique_ptr<NotForChildren>> all;
  while (all.size() < NotForChildren::kMaximum) all.push_back(std::make_unique<NotForChildren>(descriptor.get()));
  EXPECT_TRUE(*all.back());
  EXPECT_FALSE(NotForChildren(descriptor.get()));
  all.front().reset();
  EXPECT_TRUE(NotForChildren(descriptor.get())) << "a place is free again";
}

TEST(NotForChildren, LeavesAloneWhatAChildOpens) {
  const FileDescriptor descriptor(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  auto kept = std::make_unique<NotForChildren>(descriptor.get());
  const pid_t child = ::fork();
  if (child == 0) {
    const NotForChildren own(::open("/dev/null", O_RDONLY | O_CLOEXEC));  // in the parent's place, with its number
    kept.reset();
    ::_exit(aChildHas(descriptor.get()) ? 1 : 0);
  }
  int status = -1;
  EXPECT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

}  // namespace
}  // namespace velk
