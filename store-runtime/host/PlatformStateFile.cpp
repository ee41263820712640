#include "store-runtime/host/PlatformStateFile.h"

#include <fcntl.h>
#include <sys/file.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/Environment.h"
#include "platform/system/FileDescriptor.h"
#include "platform/system/FileIO.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "PlatformStateFile";
constexpr std::size_t kMaxStateBytes = 16u << 20u;

// Holds an exclusive flock on "<path>.lock" for its lifetime. flock locks
// belong to the open file description, so two threads of one process that
// each open the lock file exclude each other as two processes do.
class ExclusiveFileLock {
 public:
  explicit ExclusiveFileLock(const std::string& path) : descriptor_(openLockFile(path + ".lock")) {
    if (!descriptor_.valid()) {
      error_ = errno;
      return;
    }
    int result;
    do {
      result = ::flock(descriptor_.get(), LOCK_EX);
    } while (result != 0 && errno == EINTR);
    locked_ = result == 0;
    if (!locked_) error_ = errno;
  }
  ~ExclusiveFileLock() {
    if (locked_) ::flock(descriptor_.get(), LOCK_UN);
  }
  ExclusiveFileLock(const ExclusiveFileLock&) = delete;
  ExclusiveFileLock& operator=(const ExclusiveFileLock&) = delete;

  [[nodiscard]] bool isLocked() const { return locked_; }
  // The errno of the open or flock that failed.
  [[nodiscard]] int error() const { return error_; }

 private:
  static int openLockFile(const std::string& lockPath) {
    // A folder that cannot be made shows as the open below failing.
    (void)FileIO::createDirectories(std::filesystem::path(lockPath).parent_path().string());
    return ::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  }

  FileDescriptor descriptor_;
  bool locked_ = false;
  int error_ = 0;
};

}  // namespace

std::string PlatformStateFile::pathForName(std::string_view name) {
  return Environment::rootedPath("/var/lib/larder-platform/") + std::string(name);
}

PlistValue PlatformStateFile::read() const {
  std::optional<PlistData> bytes = FileIO::read(path_, kMaxStateBytes).optional();
  if (!bytes) return {};
  auto value = PropertyListSerialization::read(*bytes);
  if (!value) {
    TILL_LOG(1, "%@: Ignoring damaged state file %@: %@", kSpeaker, path_,
             value.errorDescription());
    return {};
  }
  return std::move(*value);
}

PlistDictionary PlatformStateFile::readDictionary() const {
  PlistValue value = read();
  if (PlistDictionary* dictionary = value.dictionary()) return std::move(*dictionary);
  return {};
}

Result<void> PlatformStateFile::update(const std::function<void(PlistValue&)>& change) const {
  ExclusiveFileLock lock(path_);
  if (!lock.isLocked()) {
    return VendError::withDomain(std::string(FileIO::kErrorDomain), lock.error(),
                                 "Cannot lock " + path_ + ".lock: " + std::strerror(lock.error()));
  }
  PlistValue value = read();
  change(value);
  if (format_ == Format::Binary) {
    return FileIO::writeAtomically(path_, PropertyListSerialization::writeBinary(value));
  }
  return FileIO::writeAtomically(path_, PropertyListSerialization::writeXml(value));
}

bool PlatformStateFile::updateValue(const std::function<void(PlistValue&)>& change) const {
  Result<void> updated = update(change);
  if (!updated)
    TILL_LOG(1, "%@: Cannot change state file %@: %@", kSpeaker, path_, updated.errorDescription());
  return updated.has_value();
}

bool PlatformStateFile::updateDictionary(
    const std::function<void(PlistDictionary&)>& change) const {
  return updateValue([&](PlistValue& value) {
    PlistDictionary dictionary;
    if (PlistDictionary* stored = value.dictionary()) dictionary = std::move(*stored);
    change(dictionary);
    value = PlistValue(std::move(dictionary));
  });
}

}  // namespace larder
