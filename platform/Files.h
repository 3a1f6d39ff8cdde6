// Whole-file operations: small files, read and written as a unit.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "foundation/Error.h"
#include "foundation/PropertyValue.h"
#include "foundation/TimeValue.h"

namespace velk::files {

enum class Code : int { notFound = 1, tooLarge = 2, notAllowed = 3, other = 4, incomplete = 5 };

/// The bytes of a regular file of at most `maximumBytes`. The error's code is a `Code`, its text names the path.
[[nodiscard]] Result<ByteData> read(const std::string& path, std::size_t maximumBytes);
/// The same from an open descriptor, from its position on; `name` stands in error texts.
[[nodiscard]] Result<ByteData> readDescriptor(int descriptor, const std::string& name, std::size_t maximumBytes);
/// Writes beside the target, syncs and renames over it: readers see the old file or the new one, whole. What root
/// writes into the directory of another user becomes that user's, who could not read it otherwise.
[[nodiscard]] Result<void> writeAtomically(const std::string& path, std::span<const std::uint8_t> bytes,
                                           unsigned mode = 0600);
/// Removes what processes of this user that were cut off in the middle of `writeAtomically` left in the directory
/// (subdirectories are not looked at), and nothing that is being written. Answers how many files those were; 0 for a
/// directory that cannot be read.
std::size_t sweepTemporaries(const std::string& directory);
/// Makes a file without a name in the directory: the error says why no file can be made there.
[[nodiscard]] Result<void> probeWritable(const std::string& directory);
/// Creates the directory and its parents with this mode. Fine when it is there.
[[nodiscard]] Result<void> createDirectories(const std::string& path, unsigned mode = 0700);
/// Gives an existing file or directory exactly this mode.
[[nodiscard]] Result<void> setMode(const std::string& path, unsigned mode);
[[nodiscard]] std::optional<TimeValue> modificationTime(const std::string& path);
/// The time of birth where the file system keeps it.
[[nodiscard]] std::optional<TimeValue> creationTime(const std::string& path);
[[nodiscard]] bool exists(const std::string& path);
[[nodiscard]] std::optional<std::size_t> size(const std::string& path);
/// The names in a directory (without "." and ".."), sorted.
[[nodiscard]] Result<std::vector<std::string>> list(const std::string& directory);
[[nodiscard]] Result<void> remove(const std::string& path);
/// Renames within one file system; a file of the new name is replaced.
[[nodiscard]] Result<void> move(const std::string& from, const std::string& to);
/// Creates an empty file; an error when something of that name is there. The owner is chosen as in `writeAtomically`.
[[nodiscard]] Result<void> createEmpty(const std::string& path, unsigned mode = 0600);
/// Appends to a regular file that is there already. Symbolic links are not followed. `incomplete`: the file was opened,
/// but not all could be written.
[[nodiscard]] Result<void> append(const std::string& path, std::span<const std::uint8_t> bytes);
/// Renames a file that cannot be used to `<path>.corrupt-<n>` (a few of them are kept) and returns the new name.
[[nodiscard]] Result<std::string> setAside(const std::string& path);
/// True when the file and the directory it stands in belong to root or the caller and nobody else may write them.
[[nodiscard]] bool isTrustworthy(const std::string& path);

}  // namespace velk::files
