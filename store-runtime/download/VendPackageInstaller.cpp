#include "store-runtime/download/VendPackageInstaller.h"

#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <functional>
#include <memory>

#include "platform/log/TillLogManager.h"
#include "platform/system/ApplicationRegistry.h"
#include "platform/system/Bundle.h"
#include "platform/system/Environment.h"
#include "platform/system/FileDescriptor.h"
#include "store-runtime/download/ArchiveLibrary.h"
#include "store-runtime/download/VendDownloadError.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/download/VendPackageEntryPolicy.h"

namespace larder {

namespace {

namespace fs = std::filesystem;

constexpr std::string_view kSpeaker = "VendPackageInstaller";
constexpr std::size_t kReadBlockSize = 1u << 20u;

// ARCHIVE_EXTRACT_SECURE_NOABSOLUTEPATHS is not among the flags: every
// entry is re-rooted below the absolute staging path, which that flag
// would refuse. The policy refuses absolute names in the package itself
// before they are re-rooted, which is what the flag guards against.
constexpr int kExtractFlags =
    ARCHIVE_EXTRACT_SECURE_NODOTDOT | ARCHIVE_EXTRACT_SECURE_SYMLINKS | ARCHIVE_EXTRACT_TIME;

const ArchiveLibrary& archiveLibrary() {
  return ArchiveLibrary::shared();
}

struct ReadArchiveDeleter {
  void operator()(archive* handle) const { archiveLibrary().readFree(handle); }
};
struct WriteArchiveDeleter {
  void operator()(archive* handle) const { archiveLibrary().writeFree(handle); }
};
using ReadArchive = std::unique_ptr<archive, ReadArchiveDeleter>;
using WriteArchive = std::unique_ptr<archive, WriteArchiveDeleter>;

VendError unsafe(const std::string& packagePath, const std::string& reason) {
  return VendDownloadError::make(VendDownloadError::kUnsafePackage,
                                 "The package " + packagePath + " was refused: " + reason);
}

VendError installFailure(const std::string& what) {
  return VendDownloadError::make(VendDownloadError::kInstallFailed, what);
}

VendError systemFailure(const std::string& what, const std::string& path, int error) {
  return installFailure("Cannot " + what + " " + path + ": " + std::strerror(error));
}

std::string archiveText(archive* handle) {
  const char* text = archiveLibrary().errorString(handle);
  return text ? text : "unknown archive error";
}

VendPackageEntryPolicy::Kind kindOf(archive_entry* entry) {
  using Kind = VendPackageEntryPolicy::Kind;
  if (archiveLibrary().entryHardlink(entry)) return Kind::kHardLink;
  switch (archiveLibrary().entryFiletype(entry)) {
    case AE_IFREG:
      return Kind::kFile;
    case AE_IFDIR:
      return Kind::kDirectory;
    case AE_IFLNK:
      return Kind::kSymlink;
    default:
      return Kind::kOther;
  }
}

VendPackageEntryPolicy::Entry describe(archive_entry* entry) {
  VendPackageEntryPolicy::Entry described;
  const char* pathname = archiveLibrary().entryPathname(entry);
  described.pathname = pathname ? pathname : "";
  described.kind = kindOf(entry);
  const char* target = described.kind == VendPackageEntryPolicy::Kind::kHardLink
                           ? archiveLibrary().entryHardlink(entry)
                           : archiveLibrary().entrySymlink(entry);
  described.linkTarget = target ? target : "";
  described.sparse = archiveLibrary().entrySparseCount(entry) > 0;
  return described;
}

ReadArchive openPackage(const std::string& packagePath, OptionalError& error) {
  ReadArchive reader(archiveLibrary().readNew());
  archiveLibrary().readSupportFormatTar(reader.get());
  if (archiveLibrary().readOpenFilename(reader.get(), packagePath.c_str(), kReadBlockSize) !=
      ARCHIVE_OK) {
    error =
        installFailure("Cannot open the package " + packagePath + ": " + archiveText(reader.get()));
    return nullptr;
  }
  return reader;
}

// Calls `visit` with each entry and the policy's decision; stops at the
// first refusal or failure.
OptionalError forEachEntry(
    const std::string& packagePath, VendPackageEntryPolicy& policy,
    const std::function<OptionalError(archive*, archive_entry*,
                                      const VendPackageEntryPolicy::Decision&)>& visit) {
  OptionalError error;
  ReadArchive reader = openPackage(packagePath, error);
  if (!reader) return error;
  archive_entry* entry = nullptr;
  for (;;) {
    const int status = archiveLibrary().readNextHeader(reader.get(), &entry);
    if (status == ARCHIVE_EOF) break;
    if (status < ARCHIVE_WARN) {
      return installFailure("The package " + packagePath +
                            " is damaged: " + archiveText(reader.get()));
    }
    const VendPackageEntryPolicy::Decision decision = policy.judge(describe(entry));
    if (!decision.allowed) return unsafe(packagePath, decision.reason);
    if (OptionalError failure = visit(reader.get(), entry, decision)) return failure;
  }
  if (policy.bundleFolderName().empty()) {
    return unsafe(packagePath, "it holds no top-level .app folder");
  }
  return std::nullopt;
}

// First pass: the whole package is judged before anything is written, and
// the bundle folder's name decides where a new bundle goes.
OptionalError scanPackage(const std::string& packagePath, std::string& bundleFolderName) {
  VendPackageEntryPolicy policy;
  OptionalError error = forEachEntry(
      packagePath, policy, [](archive*, archive_entry*, const auto&) { return OptionalError(); });
  bundleFolderName = policy.bundleFolderName();
  return error;
}

OptionalError copyEntryData(archive* reader, archive* writer, const std::string& packagePath) {
  const void* block = nullptr;
  std::size_t size = 0;
  la_int64_t offset = 0;
  for (;;) {
    const int status = archiveLibrary().readDataBlock(reader, &block, &size, &offset);
    if (status == ARCHIVE_EOF) return std::nullopt;
    if (status < ARCHIVE_WARN) {
      return installFailure("The package " + packagePath + " is damaged: " + archiveText(reader));
    }
    if (archiveLibrary().writeDataBlock(writer, block, size, offset) < ARCHIVE_WARN) {
      return installFailure("Cannot extract " + packagePath + ": " + archiveText(writer));
    }
  }
}

OptionalError extractPackage(const std::string& packagePath, const std::string& staging) {
  WriteArchive writer(archiveLibrary().writeDiskNew());
  archiveLibrary().writeDiskSetOptions(writer.get(), kExtractFlags);
  VendPackageEntryPolicy policy;
  OptionalError error = forEachEntry(
      packagePath, policy,
      [&](archive* reader, archive_entry* entry,
          const VendPackageEntryPolicy::Decision& decision) -> OptionalError {
        if (decision.relativePath.empty())
          return std::nullopt;  // the bundle folder is the staging folder
        archiveLibrary().entrySetPathname(entry, (staging + "/" + decision.relativePath).c_str());
        if (!decision.hardLinkRelativePath.empty()) {
          archiveLibrary().entrySetHardlink(
              entry, (staging + "/" + decision.hardLinkRelativePath).c_str());
        }
        if (archiveLibrary().writeHeader(writer.get(), entry) < ARCHIVE_WARN) {
          return installFailure("Cannot extract \"" + decision.relativePath + "\" of " +
                                packagePath + ": " + archiveText(writer.get()));
        }
        if (archiveLibrary().entrySize(entry) > 0) {
          if (OptionalError failure = copyEntryData(reader, writer.get(), packagePath))
            return failure;
        }
        if (archiveLibrary().writeFinishEntry(writer.get()) < ARCHIVE_WARN) {
          return installFailure("Cannot extract \"" + decision.relativePath + "\" of " +
                                packagePath + ": " + archiveText(writer.get()));
        }
        return std::nullopt;
      });
  if (error) return error;
  if (archiveLibrary().writeClose(writer.get()) != ARCHIVE_OK) {
    return installFailure("Cannot finish extracting " + packagePath + ": " +
                          archiveText(writer.get()));
  }
  return std::nullopt;
}

OptionalError syncPath(const fs::path& path) {
  FileDescriptor fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  if (!fd.valid()) return systemFailure("open", path.string(), errno);
  if (::fsync(fd.get()) != 0) return systemFailure("flush", path.string(), errno);
  return std::nullopt;
}

// Every file and folder of the new bundle reaches the disk before the
// rename makes it visible, so that a crash leaves the old bundle or the
// whole new one.
OptionalError syncTree(const fs::path& root) {
  std::error_code code;
  for (fs::recursive_directory_iterator it(root, code), end; !code && it != end;
       it.increment(code)) {
    const fs::file_status status = it->symlink_status(code);
    if (code) break;
    if (fs::is_regular_file(status) || fs::is_directory(status)) {
      if (OptionalError error = syncPath(it->path())) return error;
    }
  }
  if (code) return systemFailure("walk", root.string(), code.value());
  return syncPath(root);
}

// Removes a tree when it goes out of scope, whatever it holds by then: the
// failed extraction, or the old bundle after an exchange.
class TreeRemoval {
 public:
  explicit TreeRemoval(fs::path path) : path_(std::move(path)) {}
  ~TreeRemoval() {
    if (path_.empty()) return;
    std::error_code code;
    fs::remove_all(path_, code);
    if (code) TILL_LOG(1, "%@: Cannot remove %@: %@", kSpeaker, path_.string(), code.message());
  }
  TreeRemoval(const TreeRemoval&) = delete;
  TreeRemoval& operator=(const TreeRemoval&) = delete;

 private:
  fs::path path_;
};

std::optional<fs::path> makeTemporaryFolder(const fs::path& parent, std::string_view prefix,
                                            OptionalError& error) {
  std::string pattern = (parent / (std::string(prefix) + "XXXXXX")).string();
  if (!::mkdtemp(pattern.data())) {
    error = systemFailure("create a folder in", parent.string(), errno);
    return std::nullopt;
  }
  return fs::path(pattern);
}

// A bundle without an identifier could never be found again to be
// updated or replaced, and one with another identifier is not what was
// bought.
OptionalError checkBundleIdentifier(const fs::path& staging, const std::string& expected,
                                    const std::string& packagePath) {
  std::optional<Bundle> bundle = Bundle::open(staging.string());
  std::optional<std::string> found = bundle ? bundle->identifier() : std::nullopt;
  if (!found || found->empty()) return unsafe(packagePath, "its bundle has no identifier");
  if (!expected.empty() && *found != expected) {
    return unsafe(packagePath, "it holds the bundle \"" + *found + "\", the download is for \"" +
                                   expected + "\"");
  }
  return std::nullopt;
}

bool isUnsupportedRename(int error) {
  return error == EINVAL || error == ENOSYS || error == ENOTSUP;
}

OptionalError moveNewBundle(const fs::path& staging, const fs::path& destination) {
  if (::renameat2(AT_FDCWD, staging.c_str(), AT_FDCWD, destination.c_str(), RENAME_NOREPLACE) ==
      0) {
    return std::nullopt;
  }
  if (!isUnsupportedRename(errno))
    return systemFailure("move the new bundle to", destination.string(), errno);
  std::error_code code;
  if (fs::exists(fs::symlink_status(destination, code))) {
    return systemFailure("move the new bundle to", destination.string(), EEXIST);
  }
  if (::rename(staging.c_str(), destination.c_str()) != 0) {
    return systemFailure("move the new bundle to", destination.string(), errno);
  }
  return std::nullopt;
}

// Without exchange: the old bundle goes aside, the new one takes its
// place, and if it cannot, the old one comes back.
OptionalError replaceByRenamingAside(const fs::path& staging, const fs::path& destination) {
  OptionalError error;
  std::optional<fs::path> aside =
      makeTemporaryFolder(destination.parent_path(), ".larder-previous-", error);
  if (!aside) return error;
  TreeRemoval removeAside(*aside);
  if (::rename(destination.c_str(), aside->c_str()) != 0) {
    return systemFailure("move aside the installed bundle", destination.string(), errno);
  }
  if (::rename(staging.c_str(), destination.c_str()) != 0) {
    const int failure = errno;
    if (::rename(aside->c_str(), destination.c_str()) != 0) {
      TILL_LOG(1, "%@: Cannot put back %@ from %@: %@", kSpeaker, destination.string(),
               aside->string(), std::strerror(errno));
    }
    return systemFailure("move the new bundle to", destination.string(), failure);
  }
  return std::nullopt;
}

OptionalError replaceBundle(const fs::path& staging, const fs::path& destination,
                            bool useExchange) {
  if (useExchange) {
    if (::renameat2(AT_FDCWD, staging.c_str(), AT_FDCWD, destination.c_str(), RENAME_EXCHANGE) ==
        0) {
      return std::nullopt;  // the staging path now holds the old bundle
    }
    if (!isUnsupportedRename(errno)) {
      return systemFailure("exchange the new bundle with", destination.string(), errno);
    }
    TILL_LOG(2, "%@: The file system of %@ cannot exchange; renaming aside", kSpeaker,
             destination.string());
  }
  return replaceByRenamingAside(staging, destination);
}

struct Destination {
  fs::path path;
  bool replacing = false;
};

// The identifier comes from the store, which may name any application
// installed here: only store software in an application folder, which
// this user may replace, is taken over.
std::optional<Destination> installedDestination(const std::string& bundleIdentifier,
                                                const std::string& installed,
                                                OptionalError& error) {
  if (VendFileManager::isInstallableAtPath(installed) &&
      VendFileManager::isQuaymartAppAtPath(installed)) {
    return Destination{fs::path(installed), true};
  }
  error = installFailure("Cannot install \"" + bundleIdentifier + "\": the installed bundle " +
                         installed + " is not store software that may be replaced");
  TILL_LOG(1, "%@: Refusing to replace %@: %@", kSpeaker, installed, error->descriptionText());
  return std::nullopt;
}

std::optional<Destination> destinationFor(const std::string& bundleIdentifier,
                                          const std::string& bundleFolderName,
                                          OptionalError& error) {
  if (!bundleIdentifier.empty()) {
    if (std::optional<std::string> installed =
            ApplicationRegistry::pathForBundleIdentifier(bundleIdentifier)) {
      return installedDestination(bundleIdentifier, *installed, error);
    }
  }
  fs::path path = fs::path(Environment::rootedPath("/Applications")) / bundleFolderName;
  std::error_code code;
  if (fs::exists(fs::symlink_status(path, code))) {
    error = installFailure("Cannot install \"" + bundleIdentifier + "\": " + path.string() +
                           " already exists and is not that bundle");
    return std::nullopt;
  }
  return Destination{std::move(path), false};
}

// The destination's folder, created if needed and with every symbolic link
// resolved, so that the staging path holds no link for libarchive to
// refuse or to follow.
std::optional<fs::path> resolvedParent(const fs::path& destination, OptionalError& error) {
  std::error_code code;
  fs::create_directories(destination.parent_path(), code);
  fs::path parent = fs::canonical(destination.parent_path(), code);
  if (code) {
    error = systemFailure("create the folder", destination.parent_path().string(), code.value());
    return std::nullopt;
  }
  return parent;
}

}  // namespace

VendPackageInstaller::Result VendPackageInstaller::install(
    const std::string& packagePath, const std::string& bundleIdentifier) const {
  Result result;
  std::string bundleFolderName;
  if ((result.error = scanPackage(packagePath, bundleFolderName))) return result;

  std::optional<Destination> destination =
      destinationFor(bundleIdentifier, bundleFolderName, result.error);
  if (!destination) return result;
  std::optional<fs::path> parent = resolvedParent(destination->path, result.error);
  if (!parent) return result;
  const fs::path target = *parent / destination->path.filename();
  std::optional<fs::path> staging = makeTemporaryFolder(*parent, ".larder-install-", result.error);
  if (!staging) return result;
  TreeRemoval removeStaging(*staging);

  if ((result.error = extractPackage(packagePath, staging->string()))) return result;
  if ((result.error = checkBundleIdentifier(*staging, bundleIdentifier, packagePath)))
    return result;
  ::chmod(staging->c_str(), 0755);
  if ((result.error = syncTree(*staging))) return result;
  result.error = destination->replacing ? replaceBundle(*staging, target, options_.useExchange)
                                        : moveNewBundle(*staging, target);
  if (result.error) return result;
  if (OptionalError syncError = syncPath(*parent)) {
    TILL_LOG(1, "%@: %@", kSpeaker, syncError->descriptionText());
  }
  result.installedPath = target.string();
  result.replacedExisting = destination->replacing;
  TILL_LOG(2, "%@: Installed %@ at %@%@", kSpeaker, packagePath, result.installedPath,
           destination->replacing ? " (replacing the installed bundle)" : "");
  return result;
}

}  // namespace larder
