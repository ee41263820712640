#include "larder-store/PackageBuilder.h"

#include <archive.h>
#include <archive_entry.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <memory>
#include <vector>

#include "platform/log/TillLogManager.h"
#include "platform/system/FileDescriptor.h"

namespace larder {
namespace {

namespace fs = std::filesystem;

constexpr std::size_t kCopyBlockSize = 1u << 20u;

struct ArchiveDeleter {
  void operator()(archive* writer) const { archive_write_free(writer); }
};
struct EntryDeleter {
  void operator()(archive_entry* entry) const { archive_entry_free(entry); }
};
using ArchiveWriter = std::unique_ptr<archive, ArchiveDeleter>;
using ArchiveEntry = std::unique_ptr<archive_entry, EntryDeleter>;

bool fail(std::string* error, std::string why) {
  if (error) *error = std::move(why);
  return false;
}

// Every path below `root`, parents before children, in a stable order.
std::vector<fs::path> treeBelow(const fs::path& root, std::error_code& code) {
  std::vector<fs::path> paths;
  for (fs::recursive_directory_iterator entry(root, code), end; !code && entry != end;
       entry.increment(code)) {
    paths.push_back(entry->path());
  }
  std::sort(paths.begin(), paths.end());
  return paths;
}

class TarWriter {
 public:
  bool open(const std::string& path, std::string* error) {
    writer_.reset(archive_write_new());
    if (!writer_ || archive_write_set_format_pax_restricted(writer_.get()) != ARCHIVE_OK ||
        archive_write_add_filter_none(writer_.get()) != ARCHIVE_OK ||
        archive_write_open_filename(writer_.get(), path.c_str()) != ARCHIVE_OK) {
      return fail(error, "cannot write " + path + ": " + lastError());
    }
    return true;
  }

  // Adds `path` as `name`; other kinds of file than folders, files and
  // links are left out with a message.
  bool add(const fs::path& path, const std::string& name, std::string* error) {
    struct stat status {};
    if (::lstat(path.c_str(), &status) != 0) {
      return fail(error, "cannot read " + path.string() + ": " + std::strerror(errno));
    }
    if (!S_ISDIR(status.st_mode) && !S_ISREG(status.st_mode) && !S_ISLNK(status.st_mode)) {
      TILL_LOG(1, "%@: leaving out %@, which is no file, folder or link", "PackageBuilder",
               path.string());
      return true;
    }
    ArchiveEntry entry(archive_entry_new());
    archive_entry_set_pathname(entry.get(), name.c_str());
    archive_entry_set_mode(entry.get(), status.st_mode);
    archive_entry_set_mtime(entry.get(), status.st_mtim.tv_sec, 0);
    if (S_ISREG(status.st_mode)) archive_entry_set_size(entry.get(), status.st_size);
    if (S_ISLNK(status.st_mode)) {
      std::error_code code;
      const fs::path target = fs::read_symlink(path, code);
      if (code) return fail(error, "cannot read the link " + path.string());
      archive_entry_set_symlink(entry.get(), target.c_str());
    }
    if (archive_write_header(writer_.get(), entry.get()) != ARCHIVE_OK) {
      return fail(error, "cannot add " + name + ": " + lastError());
    }
    return !S_ISREG(status.st_mode) || copyContents(path, error);
  }

  bool close(std::string* error) {
    if (archive_write_close(writer_.get()) != ARCHIVE_OK) {
      return fail(error, "cannot finish the archive: " + lastError());
    }
    return true;
  }

 private:
  bool copyContents(const fs::path& path, std::string* error) {
    FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!file.valid())
      return fail(error, "cannot open " + path.string() + ": " + std::strerror(errno));
    std::vector<char> block(kCopyBlockSize);
    for (;;) {
      const ssize_t got = ::read(file.get(), block.data(), block.size());
      if (got < 0 && errno == EINTR) continue;
      if (got < 0) return fail(error, "cannot read " + path.string() + ": " + std::strerror(errno));
      if (got == 0) return true;
      if (archive_write_data(writer_.get(), block.data(), static_cast<std::size_t>(got)) != got) {
        return fail(error, "cannot write the contents of " + path.string() + ": " + lastError());
      }
    }
  }

  std::string lastError() const {
    const char* text = writer_ ? archive_error_string(writer_.get()) : nullptr;
    return text ? text : "unknown error";
  }

  ArchiveWriter writer_;
};

bool writeTree(const fs::path& root, const std::string& topName, const std::string& outputPath,
               std::string* error) {
  std::error_code code;
  const std::vector<fs::path> tree = treeBelow(root, code);
  if (code) return fail(error, "cannot list " + root.string() + ": " + code.message());
  TarWriter writer;
  if (!writer.open(outputPath, error) || !writer.add(root, topName + "/", error)) return false;
  for (const fs::path& path : tree) {
    std::string name = topName + "/" + path.lexically_relative(root).string();
    if (fs::is_directory(fs::symlink_status(path, code))) name += "/";
    if (!writer.add(path, name, error)) return false;
  }
  return writer.close(error);
}

}  // namespace

std::string PackageBuilder::topLevelName(const std::string& bundleDirectory) {
  std::error_code code;
  fs::path path = fs::absolute(bundleDirectory, code).lexically_normal();
  if (!path.has_filename()) path = path.parent_path();
  std::string name = path.filename().string();
  if (!name.ends_with(".app")) name += ".app";
  return name;
}

Result<void> PackageBuilder::pack(const std::string& bundleDirectory,
                                  const std::string& outputPath) {
  const auto failed = [](std::string why) {
    return VendError::withDomain(std::string(kErrorDomain), 1, std::move(why));
  };
  std::error_code code;
  if (!fs::is_directory(bundleDirectory, code)) return failed(bundleDirectory + " is not a folder");
  const std::string partialPath = outputPath + ".partial-" + std::to_string(::getpid());
  if (std::string why;
      !writeTree(fs::path(bundleDirectory), topLevelName(bundleDirectory), partialPath, &why)) {
    fs::remove(partialPath, code);
    return failed(why);
  }
  fs::rename(partialPath, outputPath, code);
  if (code) {
    fs::remove(partialPath, code);
    return failed("cannot put the archive at " + outputPath + ": " + code.message());
  }
  return {};
}

}  // namespace larder
