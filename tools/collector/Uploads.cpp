#include "tools/collector/Uploads.h"

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <system_error>

#include "foundation/Text.h"
#include "foundation/Uuid.h"
#include "platform/Files.h"

namespace velk::collector {
namespace {

constexpr std::string_view kNameParameter = "filename=";
constexpr std::string_view kLastParameter = "&raw=";
constexpr std::string_view kUploadPath = "/upload";
constexpr int kNoRoom = 507;
constexpr const char* kErrorDomain = "upload";

std::string unescaped(std::string_view text) {
  std::string plain;
  for (std::size_t at = 0; at < text.size(); ++at) {
    const bool isEscape = text[at] == '%' && at + 2 < text.size();
    const int high = isEscape ? hexadecimalDigit(text[at + 1]) : -1;
    const int low = isEscape ? hexadecimalDigit(text[at + 2]) : -1;
    if (high < 0 || low < 0) {
      plain += text[at];
    } else {
      plain += static_cast<char>(16 * high + low);
      at += 2;
    }
  }
  return plain;
}

}  // namespace

std::string uploadedFileName(std::string_view target) {
  const auto begin = target.find(kNameParameter);
  if (begin == std::string_view::npos) return {};
  target.remove_prefix(begin + kNameParameter.size());
  return unescaped(target.substr(0, target.rfind(kLastParameter)));
}

IncomingUpload::IncomingUpload(std::string path) : _path(std::move(path)) {
  if (_path.empty()) return;
  if (const auto made = files::createEmpty(_path, 0600); !made) {
    _refusal = Error{kErrorDomain, kNotKept, made.error().description};
    return;
  }
  _file.open(_path, std::ios::binary | std::ios::app);
}

Failure IncomingUpload::notKept() const {
  return failure(kErrorDomain, kNotKept, "cannot write " + _path + ": " + std::generic_category().message(errno));
}

IncomingUpload::~IncomingUpload() {
  std::error_code ignored;
  if (!_path.empty()) std::filesystem::remove(_path, ignored);
}

Result<void> IncomingUpload::add(std::string_view bytes) {
  _wireBytes += bytes.size();
  if (_wireBytes > kMaximumUploadBytes) return failure("upload", 1, "the body is larger than is taken");
  if (const auto sound = _check.take(bytes); !sound) return sound;
  if (_path.empty()) return {};
  _file.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
  if (!_file) return notKept();
  return {};
}

bool IncomingUpload::take(std::string_view bytes) {
  if (_refusal) return false;
  if (const auto added = add(bytes); !added) _refusal = added.error();
  return !_refusal;
}

Result<std::uint64_t> IncomingUpload::finish() {
  if (_refusal) return Failure(*_refusal);
  if (!_path.empty()) {
    _file.close();
    if (!_file) return notKept();
  }
  return _check.finish();
}

std::unique_ptr<IncomingUpload> Uploads::begin() const {
  return std::make_unique<IncomingUpload>(_store != nullptr ? _store->directory() + "/" + randomUuidText() + ".part"
                                                            : std::string());
}

/// Senders are not told where things stand on this machine.
Answer Uploads::cannotKeep(const Error& error) {
  _announcer.refused(std::string(kUploadPath), kNoRoom, error.description);
  return {kNoRoom, "the upload cannot be kept\n", "text/plain", {}};
}

Answer Uploads::end(IncomingUpload& upload, bool whole, const std::string& target) {
  if (_options.postStatus && *_options.postStatus != 200) {
    return refuse(*_options.postStatus, "this collector was told to answer so");
  }
  const Result<std::uint64_t> size = upload.finish();
  if (!size && size.error().domain == kErrorDomain && size.error().code == IncomingUpload::kNotKept)
    return cannotKeep(size.error());
  if (!size) return refuse(400, size.error().description);
  if (!whole) return refuse(400, "the body did not come whole");
  const std::string name = uploadedFileName(target);
  Result<std::int64_t> number = 0;
  if (_store != nullptr) {
    number = _store->keep({upload.path(), name, target, upload.wireBytes(), *size}, _clock.wallTime());
  }
  if (!number) return cannotKeep(number.error());
  _announcer.upload(*number, name, *size, upload.wireBytes());
  return {200, "success", "text/plain", {}};
}

Answer Uploads::refuse(int status, const std::string& reason) {
  _announcer.refused(std::string(kUploadPath), status, reason);
  return {status, reason + "\n", "text/plain", {}};
}

}  // namespace velk::collector
