#include "tools/ctl/Program.h"

#include <gtest/gtest.h>

#include <sstream>

#include "platform/UserDefaults.h"
#include "tests/support/TemporaryDirectory.h"

namespace velk::ctl {
namespace {

using tools::ExitCode;

class CtlProgram : public ::testing::Test {
 protected:
  ExitCode run(std::vector<std::string> arguments) {
    out.str("");
    error.str("");
    return ctl::run(std::move(arguments), out, error);
  }
  std::string path(const std::string& name) const { return directory.path() + "/" + name; }

  const test::TemporaryDirectory directory;
  std::ostringstream out;
  std::ostringstream error;
};

TEST_F(CtlProgram, WantsACommandThatItKnows) {
  EXPECT_EQ(run({}), ExitCode::usage);
  EXPECT_EQ(run({"dance"}), ExitCode::usage);
  EXPECT_EQ(run({"storebag"}), ExitCode::usage);
  EXPECT_EQ(run({"status", "--no-such-option"}), ExitCode::usage);
  EXPECT_EQ(run({"send", "--type", "x"}), ExitCode::usage);
  EXPECT_EQ(run({"--help"}), ExitCode::ok);
}

TEST_F(CtlProgram, TellsProgramsWhatIsWrongWithACommandLine) {
  EXPECT_EQ(run({"status", "--no-such-option", "--json"}), ExitCode::usage);
  EXPECT_EQ(error.str(), "{\"error\":\"The following argument was not expected: --no-such-option\",\"status\":64}\n");
  EXPECT_EQ(out.str(), "");
}

TEST_F(CtlProgram, SignsAndVerifiesAStorebag) {
  const std::string bag = directory.write("bag.json", R"({"version":"7","release":{}})");
  ASSERT_EQ(run({"storebag", "keygen", "--out", path("keys")}), ExitCode::ok) << error.str();
  ASSERT_EQ(run({"storebag", "sign", "--key", path("keys/privateKey.pem"), bag, "-o", path("envelope")}), ExitCode::ok)
      << error.str();
  EXPECT_EQ(run({"storebag", "verify", "--public", path("keys/publicKey.der"), path("envelope")}), ExitCode::ok);
  EXPECT_EQ(run({"storebag", "show", path("envelope"), "--json"}), ExitCode::ok);
  EXPECT_EQ(out.str(), "{\"version\":\"7\",\"release\":{}}\n");
}

TEST_F(CtlProgram, SaysWhenAnEnvelopeDoesNotVerify) {
  const std::string bag = directory.write("bag.json", "{}");
  ASSERT_EQ(run({"storebag", "keygen", "--private", path("a.pem"), "--public", path("a.der")}), ExitCode::ok);
  ASSERT_EQ(run({"storebag", "keygen", "--private", path("b.pem"), "--public", path("b.der")}), ExitCode::ok);
  ASSERT_EQ(run({"storebag", "sign", "--key", path("a.pem"), bag, "-o", path("envelope")}), ExitCode::ok);
  EXPECT_EQ(run({"storebag", "verify", "--public", path("b.der"), path("envelope")}), ExitCode::data);
  EXPECT_EQ(run({"storebag", "verify", "--public", path("a.der"), bag}), ExitCode::data);
  EXPECT_EQ(run({"storebag", "verify", "--public", path("a.der"), path("none")}), ExitCode::noInput);
}

TEST_F(CtlProgram, NeverReplacesAPrivateKeyUnasked) {
  ASSERT_EQ(run({"storebag", "keygen", "--out", directory.path()}), ExitCode::ok);
  const std::string key = directory.read("privateKey.pem");
  EXPECT_EQ(run({"storebag", "keygen", "--out", directory.path()}), ExitCode::cannotCreate);
  EXPECT_EQ(directory.read("privateKey.pem"), key);
  EXPECT_EQ(run({"storebag", "keygen", "--out", directory.path(), "--force"}), ExitCode::ok);
  EXPECT_NE(directory.read("privateKey.pem"), key);
}

TEST_F(CtlProgram, WantsToKnowWhereKeysGo) {
  EXPECT_EQ(run({"storebag", "keygen"}), ExitCode::usage);
  EXPECT_EQ(run({"storebag", "keygen", "--private", path("a.pem")}), ExitCode::usage);
}

TEST_F(CtlProgram, RefusesToSignWhatIsNoBag) {
  ASSERT_EQ(run({"storebag", "keygen", "--out", directory.path()}), ExitCode::ok);
  const std::string key = path("privateKey.pem");
  EXPECT_EQ(run({"storebag", "sign", "--key", key, directory.write("a", "[1]")}), ExitCode::data);
  EXPECT_EQ(run({"storebag", "sign", "--key", key, directory.write("b", "{\"a\":null}")}), ExitCode::data);
  EXPECT_EQ(run({"storebag", "sign", "--key", key, path("none")}), ExitCode::noInput);
  EXPECT_EQ(run({"storebag", "sign", "--key", directory.write("c", "x"), directory.write("d", "{}")}), ExitCode::data);
}

TEST_F(CtlProgram, ReadsBackTheSettingThatItWrote) {
  const std::vector<std::string> suite = {"--suite-directory", directory.path()};
  const auto with = [&](std::vector<std::string> arguments) {
    arguments.insert(arguments.end(), suite.begin(), suite.end());
    return run(arguments);
  };
  EXPECT_EQ(with({"defaults", "write", "environmentType", "2"}), ExitCode::ok) << error.str();
  EXPECT_EQ(with({"defaults", "write", "httpsPostURL", "https://localhost/post"}), ExitCode::ok);
  EXPECT_EQ(with({"defaults", "write", "list", "[1,\"a\"]"}), ExitCode::ok);
  EXPECT_EQ(with({"defaults", "read", "environmentType"}), ExitCode::ok);
  EXPECT_EQ(out.str(), "2\n");
  EXPECT_EQ(with({"defaults", "read", "httpsPostURL"}), ExitCode::ok);
  EXPECT_EQ(out.str(), "https://localhost/post\n");
  EXPECT_EQ(with({"defaults", "read", "list", "--json"}), ExitCode::ok);
  EXPECT_EQ(out.str(), "{\"key\":\"list\",\"value\":[1,\"a\"]}\n");
  EXPECT_EQ(with({"defaults", "delete", "list"}), ExitCode::ok);
  EXPECT_EQ(with({"defaults", "read", "list"}), ExitCode::noInput);
  EXPECT_EQ(with({"defaults", "read", "--json"}), ExitCode::ok);
  EXPECT_EQ(out.str(), "{\"environmentType\":2,\"httpsPostURL\":\"https://localhost/post\"}\n");
}

TEST_F(CtlProgram, SaysWhatItSetAside) {
  const std::string suite = std::string(kVelkReportingDefaultsSuite) + ".json";
  directory.write(suite, "{\"cut");
  EXPECT_EQ(run({"consent", "show", "--suite-directory", directory.path()}), ExitCode::ok);
  EXPECT_EQ(out.str(), "Diagnostics and usage data may not be reported.\n");
  EXPECT_EQ(error.str().rfind("velkreportingctl: UserDefaults: Set aside unusable " + path(suite) + " as ", 0), 0U)
      << error.str();
  directory.write(suite, "[1]");
  EXPECT_EQ(run({"consent", "show", "--suite-directory", directory.path(), "--json"}), ExitCode::ok);
  EXPECT_EQ(error.str().rfind("{\"warning\":\"UserDefaults: Set aside ", 0), 0U) << error.str();
  EXPECT_EQ(run({"consent", "show", "--suite-directory", directory.path()}), ExitCode::ok);
  EXPECT_EQ(error.str(), "") << "told once";
}

TEST_F(CtlProgram, TurnsConsentOnAndOff) {
  const auto consent = [&](const std::string& command) {
    return run({"consent", command, "--suite-directory", directory.path(), "--json"});
  };
  EXPECT_EQ(consent("show"), ExitCode::ok);
  EXPECT_EQ(out.str(), "{\"consent\":false}\n");
  EXPECT_EQ(consent("on"), ExitCode::ok);
  EXPECT_EQ(consent("show"), ExitCode::ok);
  EXPECT_EQ(out.str(), "{\"consent\":true}\n");
  EXPECT_EQ(consent("off"), ExitCode::ok);
  EXPECT_EQ(consent("show"), ExitCode::ok);
  EXPECT_EQ(out.str(), "{\"consent\":false}\n");
}

TEST_F(CtlProgram, SaysWhenNoDaemonAnswers) {
  EXPECT_EQ(run({"status", "--socket", path("none")}), ExitCode::unavailable);
  EXPECT_NE(error.str().find("no daemon answers at " + path("none")), std::string::npos) << error.str();
  EXPECT_EQ(run({"send", "--type", "5", "--category", "1", "--event-type", "2", "--socket", path("none")}),
            ExitCode::unavailable);
}

TEST_F(CtlProgram, RefusesAPayloadThatIsNoObject) {
  const auto send = [&](const std::string& payload) {
    return run({"send", "--type", "5", "--category", "1", "--event-type", "2", "--payload", payload});
  };
  EXPECT_EQ(send("{"), ExitCode::data);
  EXPECT_EQ(send("[1]"), ExitCode::data);
}

}  // namespace
}  // namespace velk::ctl
