#include "tools/collector/CollectorOptions.h"

#include <gtest/gtest.h>

#include <sstream>

namespace velk::collector {
namespace {

using tools::ExitCode;

class CollectorOptionsTest : public ::testing::Test {
 protected:
  std::variant<CollectorOptions, ExitCode> read(std::vector<std::string> arguments) {
    return readCollectorOptions(std::move(arguments), out, error);
  }

  std::ostringstream out;
  std::ostringstream error;
};

TEST_F(CollectorOptionsTest, ListensOnThisMachineOnlyUnlessTold) {
  const auto options = std::get<CollectorOptions>(read({}));
  EXPECT_EQ(options.listenAddress, "127.0.0.1");
  EXPECT_EQ(options.maxAgeSeconds, 600);
  EXPECT_FALSE(options.digestKey);
  EXPECT_FALSE(options.postStatus);
}

TEST_F(CollectorOptionsTest, ReadsWhatItIsTold) {
  const auto options = std::get<CollectorOptions>(
      read({"--port", "0", "--state", "/s/", "--storebags=/b", "--digest-key", "00ff", "--json", "--delay", "0.5",
            "--storebag-status", "404", "--post-status", "503", "--max-age", "0", "--sink"}));
  EXPECT_EQ(options.port, 0);
  EXPECT_EQ(options.stateDirectory, "/s");
  EXPECT_EQ(options.storebagDirectory, "/b");
  EXPECT_EQ(options.digestKey, (ByteData{0, 255}));
  EXPECT_TRUE(options.json);
  EXPECT_TRUE(options.sink);
  EXPECT_EQ(options.storebagDelaySeconds, 0.5);
  EXPECT_EQ(options.storebagStatus, 404);
  EXPECT_EQ(options.postStatus, 503);
  EXPECT_EQ(options.maxAgeSeconds, 0);
}

TEST_F(CollectorOptionsTest, TakesDatagramsWhenTold) {
  EXPECT_FALSE(std::get<CollectorOptions>(read({})).dashboardPort);
  EXPECT_EQ(std::get<CollectorOptions>(read({"--dashboard"})).dashboardPort, 0);
  EXPECT_EQ(std::get<CollectorOptions>(read({"--dashboard-port", "7000"})).dashboardPort, 7000);
  const auto faults = std::get<CollectorOptions>(read({"--dashboard-drop", "0.3", "--dashboard-drop-acks", "1",
                                                       "--dashboard-seed", "17", "--dashboard-ack-delay", "2.5"}))
                          .dashboard;
  EXPECT_EQ(faults.drop, 0.3);
  EXPECT_EQ(faults.dropAcknowledgements, 1.0);
  EXPECT_EQ(faults.seed, 17U);
  EXPECT_EQ(faults.acknowledgementDelaySeconds, 2.5);
  for (const char* option : {"--dashboard-drop", "--dashboard-drop-acks", "--dashboard-ack-delay"}) {
    for (const char* value : {"-0.1", "3601", "nan", "x"}) {
      EXPECT_EQ(std::get<ExitCode>(read({option, value})), ExitCode::usage) << option << " " << value;
    }
  }
}

TEST_F(CollectorOptionsTest, KeepsStorebagsInTheStateDirectoryUnlessTold) {
  EXPECT_EQ(std::get<CollectorOptions>(read({"--state", "/s"})).storebagDirectory, "/s/storebags");
}

TEST_F(CollectorOptionsTest, RefusesWhatItDoesNotKnow) {
  for (const auto& arguments : std::vector<std::vector<std::string>>{{"--prot", "1"},
                                                                     {"--port", "65536"},
                                                                     {"--port", "x"},
                                                                     {"--delay", "-1"},
                                                                     {"--delay", "nan"},
                                                                     {"--post-status", "1"},
                                                                     {"--certificate", "/c"},
                                                                     {"extra"}}) {
    EXPECT_EQ(std::get<ExitCode>(read(arguments)), ExitCode::usage) << arguments[0];
  }
  EXPECT_NE(error.str(), "");
}

TEST_F(CollectorOptionsTest, SaysWhenTheKeyFileIsMissing) {
  EXPECT_EQ(std::get<ExitCode>(read({"--digest-key", "/nowhere/key"})), ExitCode::noInput);
}

TEST_F(CollectorOptionsTest, PrintsHelp) {
  EXPECT_EQ(std::get<ExitCode>(read({"--help"})), ExitCode::ok);
  EXPECT_NE(out.str().find("--storebags"), std::string::npos);
}

}  // namespace
}  // namespace velk::collector
