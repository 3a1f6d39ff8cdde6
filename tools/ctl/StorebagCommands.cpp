#include <CLI/CLI.hpp>
#include <memory>
#include <ostream>

#include "platform/Cryptography.h"
#include "platform/Files.h"
#include "tools/JsonLines.h"
#include "tools/ctl/Commands.h"
#include "tools/ctl/StorebagEnvelope.h"

namespace velk::ctl {
namespace {

using tools::ExitCode;

constexpr std::size_t kMaximumBagBytes = std::size_t{16} * 1024 * 1024;
constexpr std::size_t kMaximumKeyBytes = 64 * 1024;

/// The bytes of a file, or nothing: then the context knows why.
std::optional<ByteData> readFile(Context& context, const std::string& path, std::size_t maximumBytes) {
  Result<ByteData> bytes = files::read(path, maximumBytes);
  if (bytes) return std::move(*bytes);
  context.fail(exitCodeForReading(bytes.error()), bytes.error().description);
  return std::nullopt;
}

bool writeFile(Context& context, const std::string& path, std::span<const std::uint8_t> bytes, unsigned mode) {
  const Result<void> written = files::writeAtomically(path, bytes, mode);
  if (!written) context.fail(exitCodeForWriting(written.error()), written.error().description);
  return written.has_value();
}

std::span<const std::uint8_t> bytesOf(const std::string& text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

struct KeygenOptions {
  std::string directory;
  std::string privatePath;
  std::string publicPath;
  bool force = false;
};

bool choosePaths(Context& context, KeygenOptions& options) {
  if (!options.directory.empty()) {
    if (const Result<void> made = files::createDirectories(options.directory, 0700); !made) {
      context.fail(exitCodeForWriting(made.error()), made.error().description);
      return false;
    }
    if (options.privatePath.empty()) options.privatePath = options.directory + "/privateKey.pem";
    if (options.publicPath.empty()) options.publicPath = options.directory + "/publicKey.der";
  }
  if (options.privatePath.empty() || options.publicPath.empty()) {
    context.fail(ExitCode::usage, "say where the keys go: --out DIR, or --private FILE and --public FILE");
    return false;
  }
  if (!options.force && files::exists(options.privatePath)) {
    context.fail(ExitCode::cannotCreate, options.privatePath + " is there already; --force replaces it");
    return false;
  }
  return true;
}

void keygen(Context& context, KeygenOptions& options) {
  if (!choosePaths(context, options)) return;
  const Result<RsaKeyPair> pair = generateRsaKeyPair();
  if (!pair) return context.fail(ExitCode::software, pair.error().description);
  if (!writeFile(context, options.privatePath, bytesOf(pair->privateKeyPem), 0600)) return;
  if (!writeFile(context, options.publicPath, pair->publicKeyDer, 0644)) return;
  context.report({{"private", options.privatePath}, {"public", options.publicPath}},
                 "Wrote " + options.privatePath + " (keep it secret) and " + options.publicPath + ".");
}

struct SignOptions {
  std::string keyPath;
  std::string bagPath;
  std::string outputPath;
};

void sign(Context& context, const SignOptions& options) {
  const auto key = readFile(context, options.keyPath, kMaximumKeyBytes);
  if (!key) return;
  const auto bytes = readFile(context, options.bagPath, kMaximumBagBytes);
  if (!bytes) return;
  const Result<PropertyDictionary> bag = readBag(*bytes);
  if (!bag) return context.fail(ExitCode::data, options.bagPath + ": " + bag.error().description);
  const Result<ByteData> envelope = signBag(*bag, std::string(key->begin(), key->end()));
  if (!envelope) return context.fail(ExitCode::data, envelope.error().description);
  if (options.outputPath.empty()) {
    context.out.write(reinterpret_cast<const char*>(envelope->data()), static_cast<std::streamsize>(envelope->size()));
    context.out.flush();
    if (!context.out) context.fail(ExitCode::ioError, "the envelope could not be written to standard output");
    return;
  }
  if (!writeFile(context, options.outputPath, *envelope, 0644)) return;
  context.report({{"envelope", options.outputPath}, {"bytes", envelope->size()}},
                 "Signed " + options.bagPath + " into " + options.outputPath + ".");
}

struct EnvelopeOptions {
  std::string publicKeyPath;
  std::string envelopePath;
};

std::optional<OpenedEnvelope> readEnvelope(Context& context, const std::string& path) {
  const auto bytes = readFile(context, path, kMaximumBagBytes);
  if (!bytes) return std::nullopt;
  Result<OpenedEnvelope> envelope = openEnvelope(*bytes);
  if (envelope) return std::move(*envelope);
  context.fail(ExitCode::data, path + ": " + envelope.error().description);
  return std::nullopt;
}

void verify(Context& context, const EnvelopeOptions& options) {
  const auto key = readFile(context, options.publicKeyPath, kMaximumKeyBytes);
  if (!key) return;
  const auto envelope = readEnvelope(context, options.envelopePath);
  if (!envelope) return;
  const Result<void> verified = verifyEnvelope(*envelope, *key);
  if (!verified) return context.fail(ExitCode::data, options.envelopePath + ": " + verified.error().description);
  const std::string* version = envelope->bag.string("version");
  context.report(
      {{"verified", true}, {"version", version != nullptr ? PropertyValue(*version) : PropertyValue()}},
      options.envelopePath + " is signed with this key" + (version != nullptr ? " (version " + *version + ")." : "."));
}

void show(Context& context, const EnvelopeOptions& options) {
  const auto envelope = readEnvelope(context, options.envelopePath);
  if (envelope) context.report(envelope->bag, tools::prettyJsonText(envelope->bag));
}

void addKeygen(CLI::App& storebag, Context& context) {
  auto options = std::make_shared<KeygenOptions>();
  auto* command = storebag.add_subcommand("keygen", "Make a key pair for signing storebags");
  command->add_option("--out", options->directory, "Directory for privateKey.pem and publicKey.der");
  command->add_option("--private", options->privatePath, "File for the private key (PEM)");
  command->add_option("--public", options->publicPath, "File for the public key (DER)");
  command->add_flag("--force", options->force, "Replace a private key that is there");
  command->callback([&context, options] { keygen(context, *options); });
}

void addSign(CLI::App& storebag, Context& context) {
  auto options = std::make_shared<SignOptions>();
  auto* command = storebag.add_subcommand("sign", "Sign a bag given as JSON or as a property list");
  command->add_option("--key", options->keyPath, "Private key (PEM)")->required();
  command->add_option("bag", options->bagPath, "The bag")->required();
  command->add_option("-o,--output", options->outputPath, "File for the envelope; standard output without it");
  command->callback([&context, options] { sign(context, *options); });
}

void addVerifyAndShow(CLI::App& storebag, Context& context) {
  auto options = std::make_shared<EnvelopeOptions>();
  auto* verifying = storebag.add_subcommand("verify", "Check the signature of an envelope");
  verifying->add_option("--public", options->publicKeyPath, "Public key (DER)")->required();
  verifying->add_option("file", options->envelopePath, "The envelope")->required();
  verifying->callback([&context, options] { verify(context, *options); });
  auto* showing = storebag.add_subcommand("show", "Print the bag in an envelope");
  showing->add_option("file", options->envelopePath, "The envelope")->required();
  showing->callback([&context, options] { show(context, *options); });
}

}  // namespace

void addStorebagCommands(CLI::App& app, Context& context) {
  auto* storebag = app.add_subcommand("storebag", "Make keys, sign, check and show storebags");
  storebag->require_subcommand(1);
  addKeygen(*storebag, context);
  addSign(*storebag, context);
  addVerifyAndShow(*storebag, context);
}

}  // namespace velk::ctl
