#include "store-runtime/sysup/SysupStateReader.h"

#include <sys/stat.h>

namespace larder {

bool SysupStateReader::Identity::operator==(const Identity& other) const {
  return path == other.path && device == other.device && inode == other.inode &&
         size == other.size && modified.tv_sec == other.modified.tv_sec &&
         modified.tv_nsec == other.modified.tv_nsec && changed.tv_sec == other.changed.tv_sec &&
         changed.tv_nsec == other.changed.tv_nsec;
}

SysupStateReader::Identity SysupStateReader::identityOf(const std::string& path) {
  Identity identity{.path = path};
  struct stat status {};
  if (::stat(path.c_str(), &status) == 0) {
    identity.device = status.st_dev;
    identity.inode = status.st_ino;
    identity.size = status.st_size;
    identity.modified = status.st_mtim;
    identity.changed = status.st_ctim;
  }
  return identity;
}

std::shared_ptr<const SysupUpdateState> SysupStateReader::read(const PlatformStateFile& file) {
  Identity identity = identityOf(file.path());
  {
    MutexLock lock(mutex_);
    if (state_ && identity == identity_) return state_;
  }
  // Parsed outside the lock; a racing reader parses the same file too.
  auto state = std::make_shared<const SysupUpdateState>(file.readDictionary());
  MutexLock lock(mutex_);
  identity_ = std::move(identity);
  state_ = state;
  return state;
}

}  // namespace larder
