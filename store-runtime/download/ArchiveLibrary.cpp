#include "store-runtime/download/ArchiveLibrary.h"

#include <optional>
#include <string>

#include "platform/system/SharedLibrary.h"

namespace larder {

namespace {

Result<ArchiveLibrary> load() {
  Result<SharedLibrary> library = SharedLibrary::open("libarchive.so.13");
  if (!library) return library.error();
  ArchiveLibrary f;
  const bool resolved =
      library->resolve(f.readNew, "archive_read_new") &&
      library->resolve(f.readFree, "archive_read_free") &&
      library->resolve(f.readSupportFormatTar, "archive_read_support_format_tar") &&
      library->resolve(f.readOpenFilename, "archive_read_open_filename") &&
      library->resolve(f.readNextHeader, "archive_read_next_header") &&
      library->resolve(f.readDataBlock, "archive_read_data_block") &&
      library->resolve(f.writeDiskNew, "archive_write_disk_new") &&
      library->resolve(f.writeDiskSetOptions, "archive_write_disk_set_options") &&
      library->resolve(f.writeHeader, "archive_write_header") &&
      library->resolve(f.writeDataBlock, "archive_write_data_block") &&
      library->resolve(f.writeFinishEntry, "archive_write_finish_entry") &&
      library->resolve(f.writeClose, "archive_write_close") &&
      library->resolve(f.writeFree, "archive_write_free") &&
      library->resolve(f.errorString, "archive_error_string") &&
      library->resolve(f.entryPathname, "archive_entry_pathname") &&
      library->resolve(f.entryHardlink, "archive_entry_hardlink") &&
      library->resolve(f.entrySymlink, "archive_entry_symlink") &&
      library->resolve(f.entryFiletype, "archive_entry_filetype") &&
      library->resolve(f.entrySparseCount, "archive_entry_sparse_count") &&
      library->resolve(f.entrySize, "archive_entry_size") &&
      library->resolve(f.entrySetPathname, "archive_entry_set_pathname") &&
      library->resolve(f.entrySetHardlink, "archive_entry_set_hardlink");
  if (!resolved) return library->missingSymbolError();
  return f;
}

}  // namespace

const ArchiveLibrary& ArchiveLibrary::shared() {
  return SharedLibrary::sharedTable("libarchive", &load);
}

}  // namespace larder
