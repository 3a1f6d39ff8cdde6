#include "tests/support/TemporaryDirectory.h"

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>

namespace velk::test {

TemporaryDirectory::TemporaryDirectory() : _path((std::filesystem::temp_directory_path() / "velk-XXXXXX").string()) {
  if (::mkdtemp(_path.data()) == nullptr) std::abort();
}

TemporaryDirectory::~TemporaryDirectory() {
  std::error_code ignored;
  std::filesystem::remove_all(_path, ignored);
}

std::string TemporaryDirectory::write(std::string_view name, std::string_view contents) const {
  const std::filesystem::path path = *this / name;
  std::filesystem::create_directories(path.parent_path());
  std::ofstream(path, std::ios::binary) << contents;
  std::filesystem::permissions(path, std::filesystem::perms::owner_read | std::filesystem::perms::owner_write);
  return path.string();
}

std::string TemporaryDirectory::read(std::string_view name) const {
  std::ifstream file(*this / name, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
}

}  // namespace velk::test
