// A directory of a test's own, gone when the test is.
#pragma once

#include <string>
#include <string_view>

namespace velk::test {

class TemporaryDirectory {
 public:
  TemporaryDirectory();
  ~TemporaryDirectory();
  TemporaryDirectory(const TemporaryDirectory&) = delete;
  TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;

  /// Absolute, mode 0700.
  [[nodiscard]] const std::string& path() const noexcept { return _path; }
  [[nodiscard]] std::string operator/(std::string_view name) const { return _path + "/" + std::string(name); }
  /// Writes a file below it (0600), and the directories on the way there; returns its path.
  std::string write(std::string_view name, std::string_view contents) const;
  /// The contents of a file below it; empty when there is none.
  [[nodiscard]] std::string read(std::string_view name) const;

 private:
  std::string _path;
};

}  // namespace velk::test
