#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "platform/error/Result.h"

namespace larder {

// What tells one version of a file from another without reading it: a
// replacement by rename brings a new inode, a rewrite in place a new
// modification time (nanoseconds) or size.
struct FileIdentity {
  std::uint64_t device = 0;
  std::uint64_t inode = 0;
  std::uint64_t size = 0;
  std::int64_t modifiedNanoseconds = 0;
  bool operator==(const FileIdentity&) const = default;
};

// Whole-file reads and crash-safe writes. A failure is an error of
// `kErrorDomain` whose code is the errno of the call that failed.
class FileIO {
 public:
  static constexpr std::string_view kErrorDomain = "FileIO";

  // Contents of the file, or nullopt when it cannot be read or is larger
  // than `maxBytes` (outside data never gets to allocate without bound).
  static Result<std::vector<std::uint8_t>> read(const std::string& path,
                                                std::size_t maxBytes = 256u << 20u);

  // Writes to a temporary file beside `path`, flushes it to disk and
  // renames it over `path`, so that a reader sees the old or the new
  // contents and never a torn file. Creates missing parent folders.
  // `written`, when given, receives the identity of the new file, taken
  // before the rename so that it is ours even if another process replaces
  // the file right after.
  static Result<void> writeAtomically(const std::string& path, std::span<const std::uint8_t> bytes,
                                      FileIdentity* written = nullptr);
  static Result<void> writeAtomically(const std::string& path, std::string_view text);

  // Truncates and rewrites `path` itself, for files whose readers are
  // built to survive a torn write (they start empty on a file that does
  // not parse). Creates missing parent folders; the file is 0600.
  static Result<void> writeInPlace(const std::string& path, std::span<const std::uint8_t> bytes);

  // The identity of the file at `path` now, or nullopt when there is none.
  static std::optional<FileIdentity> identity(const std::string& path);

  static Result<void> createDirectories(const std::string& path);

  // Removes the temporary siblings of `path` that `writeAtomically` left
  // behind in a process that died mid-write: those of a process that no
  // longer runs, and those bearing our own process id (called before this
  // process writes `path`, so none of them can be in progress; a reused id
  // is common in containers). Returns how many went.
  static std::size_t removeStaleTemporaries(const std::string& path);
};

}  // namespace larder
