#pragma once

#include <functional>
#include <string>
#include <thread>

#include "platform/system/FileDescriptor.h"

namespace larder {

// Tells when another writer replaced or rewrote one file, by watching its
// folder with inotify on a thread of its own. The folder, not the file, is
// watched because state files land by an atomic rename: a watch on the file
// itself would follow the old inode and hear nothing after the first
// change. The folder is made when it is not there yet.
class SysupStateFileWatcher {
 public:
  using ChangeHandler = std::function<void()>;

  // Watches `filePath` until destroyed; `changed` is called on the watching
  // thread, so it must be quick and must not destroy the watcher.
  SysupStateFileWatcher(std::string filePath, ChangeHandler changed);
  ~SysupStateFileWatcher();
  SysupStateFileWatcher(const SysupStateFileWatcher&) = delete;
  SysupStateFileWatcher& operator=(const SysupStateFileWatcher&) = delete;

  [[nodiscard]] const std::string& filePath() const { return filePath_; }
  // False when inotify or the folder could not be set up (logged).
  [[nodiscard]] bool isWatching() const { return watching_; }

 private:
  void watch();
  // True when one of the events read names the watched file.
  [[nodiscard]] bool readEventsNamingFile();

  std::string filePath_;
  std::string fileName_;
  ChangeHandler changed_;
  FileDescriptor inotify_;
  FileDescriptor stopEvent_;
  bool watching_ = false;
  std::thread thread_;
};

}  // namespace larder
