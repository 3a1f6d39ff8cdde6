#include <CLI/CLI.hpp>
#include <memory>

#include "platform/Platform.h"
#include "tools/ctl/Commands.h"
#include "tools/ctl/Suite.h"

namespace velk::ctl {
namespace {

void report(Context& context, bool consent) {
  context.report({{"consent", consent}}, consent ? "Diagnostics and usage data may be reported."
                                                 : "Diagnostics and usage data may not be reported.");
}

void show(Context& context, const std::string& directory) {
  const auto suite = openSuite(directory);
  report(context, makeConsent(*suite)->diagnosticsAndUsageEnabled());
}

void set(Context& context, const std::string& directory, bool consent) {
  const Result<void> written = openSuite(directory)->set(kDiagnosticsAndUsageSetting, consent);
  if (!written) return context.fail(exitCodeForWriting(written.error()), written.error().description);
  report(context, consent);
}

}  // namespace

void addConsentCommand(CLI::App& app, Context& context) {
  auto directory = std::make_shared<std::string>();
  auto* consent = app.add_subcommand("consent", "Agree to reporting diagnostics and usage data, or withdraw it");
  consent->require_subcommand(1);
  consent->fallthrough();
  consent->add_option("--suite-directory", *directory, "State directory that holds the suite");
  consent->add_subcommand("on", "Agree")->callback([&context, directory] { set(context, *directory, true); });
  consent->add_subcommand("off", "Withdraw")->callback([&context, directory] { set(context, *directory, false); });
  consent->add_subcommand("show", "Print what holds")->callback([&context, directory] { show(context, *directory); });
}

}  // namespace velk::ctl
