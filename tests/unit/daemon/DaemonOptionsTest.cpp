#include "daemon/DaemonOptions.h"

#include <gtest/gtest.h>

#include <vector>

namespace velk {
namespace {

std::variant<DaemonOptions, int> parse(std::vector<const char*> arguments) {
  arguments.insert(arguments.begin(), "velkreportingd");
  return parseDaemonOptions(static_cast<int>(arguments.size()), arguments.data());
}

TEST(DaemonOptions, HaveDefaults) {
  const auto parsed = parse({});
  const auto& options = std::get<DaemonOptions>(parsed);
  EXPECT_EQ(options.idleExitSeconds, std::nullopt);
  EXPECT_EQ(options.logLevel, log::Level::standard);
  EXPECT_FALSE(options.foreground);
}

TEST(DaemonOptions, AreRead) {
  const auto parsed = parse({"--socket", "/tmp/s", "--idle-exit", "0", "--log-level", "debug", "--foreground"});
  const auto& options = std::get<DaemonOptions>(parsed);
  EXPECT_EQ(options.socketPath, "/tmp/s");
  EXPECT_EQ(options.idleExitSeconds, 0);
  EXPECT_EQ(options.logLevel, log::Level::debug);
  EXPECT_TRUE(options.foreground);
}

TEST(DaemonOptions, OfWrongUseExitWithTheUsualStatus) {
  for (const std::vector<const char*>& wrong : {std::vector<const char*>{"--idle-exit", "-1"},
                                                {"--idle-exit", "soon"},
                                                {"--log-level", "loud"},
                                                {"--unknown"},
                                                {"argument"}}) {
    EXPECT_EQ(std::get<int>(parse(wrong)), 64);
  }
}

TEST(DaemonOptions, HelpAndVersionExitWithSuccess) {
  EXPECT_EQ(std::get<int>(parse({"--help"})), 0);
  EXPECT_EQ(std::get<int>(parse({"--version"})), 0);
}

}  // namespace
}  // namespace velk
