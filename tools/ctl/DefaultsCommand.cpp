#include <CLI/CLI.hpp>
#include <memory>

#include "foundation/Text.h"
#include "tools/ctl/Commands.h"
#include "tools/ctl/Suite.h"

namespace velk::ctl {
namespace {

using tools::ExitCode;

struct DefaultsOptions {
  std::string directory;
  std::string key;
  std::string value;
};

void readAll(Context& context, const UserDefaults& suite) {
  const PropertyDictionary values = suite.allValues();
  std::string words;
  for (const PropertyDictionary::Entry& entry : values) {
    words += (words.empty() ? "" : "\n") + entry.key + " = " + wordsOf(entry.value);
  }
  context.report(values, words);
}

void read(Context& context, const DefaultsOptions& options) {
  const auto suite = openSuite(options.directory);
  if (options.key.empty()) return readAll(context, *suite);
  const std::optional<PropertyValue> value = suite->value(options.key);
  if (!value) return context.fail(ExitCode::noInput, "there is no value for \"" + options.key + "\"");
  context.report({{"key", options.key}, {"value", *value}}, wordsOf(*value));
}

void write(Context& context, const DefaultsOptions& options) {
  if (!isUtf8(options.key) || !isUtf8(options.value)) return context.fail(ExitCode::data, "that is not UTF-8");
  const PropertyValue value = valueFromArgument(options.value);
  const Result<void> written = openSuite(options.directory)->set(options.key, value);
  if (!written) return context.fail(exitCodeForWriting(written.error()), written.error().description);
  context.report({{"key", options.key}, {"value", value}}, "");
}

void remove(Context& context, const DefaultsOptions& options) {
  const Result<void> removed = openSuite(options.directory)->remove(options.key);
  if (!removed) return context.fail(exitCodeForWriting(removed.error()), removed.error().description);
  context.report({{"key", options.key}, {"value", nullptr}}, "");
}

}  // namespace

void addDefaultsCommand(CLI::App& app, Context& context) {
  auto options = std::make_shared<DefaultsOptions>();
  auto* defaults = app.add_subcommand("defaults", "Read and change the settings of the suite");
  defaults->require_subcommand(1);
  defaults->fallthrough();
  defaults->add_option("--suite-directory", options->directory, "State directory that holds the suite");
  auto* reading = defaults->add_subcommand("read", "Print a setting, or all of them");
  reading->add_option("key", options->key, "The setting");
  reading->callback([&context, options] { read(context, *options); });
  auto* writing = defaults->add_subcommand("write", "Set a setting");
  writing->add_option("key", options->key, "The setting")->required();
  writing->add_option("value", options->value, "JSON; a bare word is a string")->required();
  writing->callback([&context, options] { write(context, *options); });
  auto* removing = defaults->add_subcommand("delete", "Remove a setting");
  removing->add_option("key", options->key, "The setting")->required();
  removing->callback([&context, options] { remove(context, *options); });
}

}  // namespace velk::ctl
