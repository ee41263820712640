#pragma once

#include <archive.h>
#include <archive_entry.h>

namespace larder {

// libarchive, opened when the first package is unpacked: it and what it
// pulls in (libxml2 and ICU among them) cost an idle service 1.5 MB of
// pages. The functions are called through the table, never by name, so
// that the service does not link the library.
struct ArchiveLibrary {
  decltype(&::archive_read_new) readNew = nullptr;
  decltype(&::archive_read_free) readFree = nullptr;
  decltype(&::archive_read_support_format_tar) readSupportFormatTar = nullptr;
  decltype(&::archive_read_open_filename) readOpenFilename = nullptr;
  decltype(&::archive_read_next_header) readNextHeader = nullptr;
  decltype(&::archive_read_data_block) readDataBlock = nullptr;
  decltype(&::archive_write_disk_new) writeDiskNew = nullptr;
  decltype(&::archive_write_disk_set_options) writeDiskSetOptions = nullptr;
  decltype(&::archive_write_header) writeHeader = nullptr;
  decltype(&::archive_write_data_block) writeDataBlock = nullptr;
  decltype(&::archive_write_finish_entry) writeFinishEntry = nullptr;
  decltype(&::archive_write_close) writeClose = nullptr;
  decltype(&::archive_write_free) writeFree = nullptr;
  decltype(&::archive_error_string) errorString = nullptr;
  decltype(&::archive_entry_pathname) entryPathname = nullptr;
  decltype(&::archive_entry_hardlink) entryHardlink = nullptr;
  decltype(&::archive_entry_symlink) entrySymlink = nullptr;
  decltype(&::archive_entry_filetype) entryFiletype = nullptr;
  decltype(&::archive_entry_sparse_count) entrySparseCount = nullptr;
  decltype(&::archive_entry_size) entrySize = nullptr;
  decltype(&::archive_entry_set_pathname) entrySetPathname = nullptr;
  decltype(&::archive_entry_set_hardlink) entrySetHardlink = nullptr;

  // The library, opened once. Throws std::runtime_error when it cannot be
  // loaded: no package can be installed without it, and the package that
  // installed the service depends on it.
  static const ArchiveLibrary& shared();
};

}  // namespace larder
