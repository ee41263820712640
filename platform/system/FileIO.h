#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace larder {

// Whole-file reads and crash-safe writes.
class FileIO {
 public:
  // Contents of the file, or nullopt when it cannot be read or is larger
  // than `maxBytes` (outside data never gets to allocate without bound).
  static std::optional<std::vector<std::uint8_t>> read(const std::string& path,
                                                       std::size_t maxBytes = 256u << 20u,
                                                       std::string* error = nullptr);

  // Writes to a temporary file beside `path`, flushes it to disk and
  // renames it over `path`, so that a reader sees the old or the new
  // contents and never a torn file. Creates missing parent folders.
  static bool writeAtomically(const std::string& path, std::span<const std::uint8_t> bytes,
                              std::string* error = nullptr);
  static bool writeAtomically(const std::string& path, std::string_view text,
                              std::string* error = nullptr);

  // Truncates and rewrites `path` itself, for files whose readers are
  // built to survive a torn write (they start empty on a file that does
  // not parse). Creates missing parent folders; the file is 0600.
  static bool writeInPlace(const std::string& path, std::span<const std::uint8_t> bytes,
                           std::string* error = nullptr);

  static bool createDirectories(const std::string& path, std::string* error = nullptr);

  // Removes the temporary siblings of `path` that `writeAtomically` left
  // behind in a process that died mid-write: those of a process that no
  // longer runs, and those bearing our own process id (called before this
  // process writes `path`, so none of them can be in progress; a reused id
  // is common in containers). Returns how many went.
  static std::size_t removeStaleTemporaries(const std::string& path);
};

}  // namespace larder
