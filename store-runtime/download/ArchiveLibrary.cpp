#include "store-runtime/download/ArchiveLibrary.h"

#include <optional>
#include <string>

#include "platform/system/SharedLibrary.h"

namespace larder {

namespace {

std::optional<ArchiveLibrary> load(std::string* error) {
  std::optional<SharedLibrary> library = SharedLibrary::open("libarchive.so.13", error);
  if (!library) return std::nullopt;
  ArchiveLibrary f;
  const bool resolved =
      library->resolve(f.readNew, "archive_read_new", error) &&
      library->resolve(f.readFree, "archive_read_free", error) &&
      library->resolve(f.readSupportFormatTar, "archive_read_support_format_tar", error) &&
      library->resolve(f.readOpenFilename, "archive_read_open_filename", error) &&
      library->resolve(f.readNextHeader, "archive_read_next_header", error) &&
      library->resolve(f.readDataBlock, "archive_read_data_block", error) &&
      library->resolve(f.writeDiskNew, "archive_write_disk_new", error) &&
      library->resolve(f.writeDiskSetOptions, "archive_write_disk_set_options", error) &&
      library->resolve(f.writeHeader, "archive_write_header", error) &&
      library->resolve(f.writeDataBlock, "archive_write_data_block", error) &&
      library->resolve(f.writeFinishEntry, "archive_write_finish_entry", error) &&
      library->resolve(f.writeClose, "archive_write_close", error) &&
      library->resolve(f.writeFree, "archive_write_free", error) &&
      library->resolve(f.errorString, "archive_error_string", error) &&
      library->resolve(f.entryPathname, "archive_entry_pathname", error) &&
      library->resolve(f.entryHardlink, "archive_entry_hardlink", error) &&
      library->resolve(f.entrySymlink, "archive_entry_symlink", error) &&
      library->resolve(f.entryFiletype, "archive_entry_filetype", error) &&
      library->resolve(f.entrySparseCount, "archive_entry_sparse_count", error) &&
      library->resolve(f.entrySize, "archive_entry_size", error) &&
      library->resolve(f.entrySetPathname, "archive_entry_set_pathname", error) &&
      library->resolve(f.entrySetHardlink, "archive_entry_set_hardlink", error);
  if (!resolved) return std::nullopt;
  return f;
}

}  // namespace

const ArchiveLibrary& ArchiveLibrary::shared() {
  return SharedLibrary::sharedTable("libarchive", &load);
}

}  // namespace larder
