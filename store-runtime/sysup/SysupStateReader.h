#pragma once

#include <sys/types.h>

#include <ctime>
#include <memory>
#include <string>

#include "platform/system/Mutex.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/sysup/SysupUpdateState.h"

namespace larder {

// The framework's state as the file holds it, parsed once per version of
// the file. Questions come in bursts (the badge asks whether each OS update
// needs a restart), and every change, by this process or another, lands
// with an atomic rename, so a file with the same inode, size and times is
// the one already parsed; a change made in place by hand moves its times.
class SysupStateReader {
 public:
  std::shared_ptr<const SysupUpdateState> read(const PlatformStateFile& file);

 private:
  struct Identity {
    std::string path;
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = -1;
    timespec modified{};
    timespec changed{};
    bool operator==(const Identity& other) const;
  };
  static Identity identityOf(const std::string& path);

  Mutex mutex_;
  Identity identity_ GUARDED_BY(mutex_);
  std::shared_ptr<const SysupUpdateState> state_ GUARDED_BY(mutex_);
};

}  // namespace larder
