#include "store-runtime/sysup/SysupStateFileWatcher.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>

#include "platform/log/TillLogManager.h"
#include "platform/system/FileIO.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "SysupStateFileWatcher";
// A rename onto the name (how PlatformStateFile writes), a rewrite in place
// (a person's editor) and a removal (a reset) all change what is stored.
constexpr std::uint32_t kWatchedEvents = IN_MOVED_TO | IN_CLOSE_WRITE | IN_DELETE | IN_CREATE;

}  // namespace

SysupStateFileWatcher::SysupStateFileWatcher(std::string filePath, ChangeHandler changed)
    : filePath_(std::move(filePath)),
      fileName_(std::filesystem::path(filePath_).filename().string()),
      changed_(std::move(changed)),
      inotify_(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC)),
      stopEvent_(::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC)) {
  const std::string folder = std::filesystem::path(filePath_).parent_path().string();
  (void)FileIO::createDirectories(folder);
  if (!inotify_.valid() || !stopEvent_.valid() ||
      ::inotify_add_watch(inotify_.get(), folder.c_str(), kWatchedEvents) < 0) {
    TILL_LOG(1, "%@: Cannot watch %@: %@", kSpeaker, folder, std::strerror(errno));
    return;
  }
  watching_ = true;
  thread_ = std::thread([this] { watch(); });
  TILL_LOG(3, "%@: Watching %@", kSpeaker, filePath_);
}

SysupStateFileWatcher::~SysupStateFileWatcher() {
  if (!thread_.joinable()) return;
  const std::uint64_t one = 1;
  (void)!::write(stopEvent_.get(), &one, sizeof one);
  thread_.join();
}

void SysupStateFileWatcher::watch() {
  std::array<pollfd, 2> descriptors{pollfd{inotify_.get(), POLLIN, 0},
                                    pollfd{stopEvent_.get(), POLLIN, 0}};
  while (true) {
    if (::poll(descriptors.data(), descriptors.size(), -1) < 0) {
      if (errno == EINTR) continue;
      TILL_LOG(1, "%@: Stopped watching %@: %@", kSpeaker, filePath_, std::strerror(errno));
      return;
    }
    if (descriptors[1].revents != 0) return;
    if (readEventsNamingFile()) changed_();
  }
}

bool SysupStateFileWatcher::readEventsNamingFile() {
  alignas(inotify_event) std::array<char, 4096> buffer{};
  bool named = false;
  while (true) {
    const ssize_t length = ::read(inotify_.get(), buffer.data(), buffer.size());
    if (length <= 0) return named;
    for (ssize_t offset = 0; offset < length;) {
      const auto* event = reinterpret_cast<const inotify_event*>(buffer.data() + offset);
      // An overflow lost events that may have named the file.
      if ((event->mask & IN_Q_OVERFLOW) != 0) named = true;
      if (event->len > 0 && fileName_ == event->name) named = true;
      offset += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
    }
  }
}

}  // namespace larder
