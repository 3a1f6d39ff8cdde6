// Uploads whole files to a server whose address its storebag section gives: compressed, one post a file. The file comes
// as a descriptor, opened by the client with the client's rights; the path only gives it its name. Nothing is removed
// here: when the server says that it has the file, whoever asked is told so, up to the client, which removes it.
//
// Made by the factory; files are uploaded on the session's upload queue, one at a time, and nothing is kept between
// them.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "backends/FileCompression.h"
#include "backends/VelkReportingBackend.h"

namespace velk {

class UploadBackend final : public VelkReportingBackend {
 public:
  /// What one file may be at most: it takes as much of the disk, at worst, until it is sent.
  static constexpr std::uint64_t kMaximumFileBytes = std::uint64_t{16} * 1024 * 1024 * 1024;
  /// Answers are a few words.
  static constexpr std::size_t kMaximumAnswerBytes = 1024 * 1024;

  /// Null (with an error line) without an address to post to.
  [[nodiscard]] static std::shared_ptr<UploadBackend> initWithName(const BackendContext& context,
                                                                   const std::string& name,
                                                                   const PropertyValue& profile,
                                                                   const std::optional<std::string>& productFamily);

  /// True when the upload was attempted, whatever became of it. Blocks until the server has answered, or the request
  /// has timed out, or the transport has dropped it; counts as blocked all the while.
  [[nodiscard]] bool uploadFileAtPath(FileUpload& upload) override;

  // Any thread.
  [[nodiscard]] std::optional<std::string> uploadURL() const;
  void setUploadURL(std::optional<std::string> uploadURL);

  /// How long a body of that size may take from the first byte to the end of the answer.
  [[nodiscard]] static Duration timeoutFor(std::uint64_t bodyBytes);

 private:
  using VelkReportingBackend::VelkReportingBackend;

  [[nodiscard]] std::string requestAddress(const std::string& uploadURL, const std::string& path) const;
  [[nodiscard]] HttpRequest makeRequest(std::string address, const CompressedFile& body) const;
  /// Whether the server says that it has the file.
  [[nodiscard]] static bool postAndWait(ReportingSessionConnectivityInterface& transport, HttpRequest request,
                                        const std::string& uploadURL);

  mutable Lock _lock;
  std::optional<std::string> _uploadURL VELK_GUARDED_BY(_lock);
};

}  // namespace velk
