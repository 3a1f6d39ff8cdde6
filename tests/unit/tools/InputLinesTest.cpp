#include "tools/ctl/InputLines.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <memory>

namespace velk::ctl {
namespace {

using Event = InputLines::Event;
using File = std::unique_ptr<std::FILE, int (*)(std::FILE*)>;

File fileWith(const std::string& text) {
  File file(std::tmpfile(), &std::fclose);
  std::fwrite(text.data(), 1, text.size(), file.get());
  std::rewind(file.get());
  return file;
}

TEST(InputLines, GivesEachLineAndThenTheEnd) {
  const File file = fileWith("one\n\nthree");
  InputLines input(fileno(file.get()), 100);
  std::string line;
  EXPECT_EQ(input.next(line), Event::line);
  EXPECT_EQ(line, "one");
  EXPECT_EQ(input.next(line), Event::line);
  EXPECT_EQ(line, "");
  EXPECT_EQ(input.next(line), Event::line);
  EXPECT_EQ(line, "three");
  EXPECT_EQ(input.next(line), Event::end);
  EXPECT_EQ(input.next(line), Event::end);
}

TEST(InputLines, SkipsALineThatIsTooLongAndGoesOn) {
  const File file = fileWith(std::string(300'000, 'x') + "\nshort\n" + std::string(300'000, 'y'));
  InputLines input(fileno(file.get()), 1000);
  std::string line;
  EXPECT_EQ(input.next(line), Event::tooLong);
  EXPECT_EQ(input.next(line), Event::line);
  EXPECT_EQ(line, "short");
  EXPECT_EQ(input.next(line), Event::tooLong);
  EXPECT_EQ(input.next(line), Event::end);
}

TEST(InputLines, BreaksOffWhenWoken) {
  const File file = fileWith("one\n");
  InputLines input(fileno(file.get()), 100);
  input.wake();
  std::string line;
  EXPECT_EQ(input.next(line), Event::woken);
  EXPECT_EQ(input.next(line), Event::woken);
  EXPECT_FALSE(input.sleep(std::chrono::hours(1)));
}

TEST(InputLines, SleepsNotAtAllForNoTime) {
  InputLines input(-1, 100);
  EXPECT_TRUE(input.sleep(std::chrono::seconds(0)));
}

TEST(InputLines, FailsOnAnInputThatIsClosed) {
  InputLines input(1'000'000, 100);
  std::string line;
  EXPECT_EQ(input.next(line), Event::failed);
}

}  // namespace
}  // namespace velk::ctl
