#include "platform/metadata/MetadataIndexWatcher.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>

namespace larder {

namespace {

// Reads per wait are bounded, so that a storm of events cannot keep the waiting thread from
// processing what it already has.
constexpr std::size_t kReadBufferBytes = 64u * 1024u;
constexpr int kMostReadsPerWait = 16;

int pollTimeout(std::optional<std::chrono::milliseconds> timeout) {
  if (!timeout) return -1;
  if (timeout->count() <= 0) return 0;
  constexpr std::chrono::milliseconds kLongest{60'000};
  return static_cast<int>(std::min(*timeout, kLongest).count());
}

void drainWakeEvent(int fd) {
  std::uint64_t count = 0;
  while (::read(fd, &count, sizeof count) < 0 && errno == EINTR) {
  }
}

}  // namespace

MetadataIndexWatcher::MetadataIndexWatcher()
    : inotify_(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC)),
      wakeEvent_(::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC)) {
  if (!inotify_.valid() || !wakeEvent_.valid()) initializationError_ = errno ? errno : EINVAL;
}

int MetadataIndexWatcher::addWatch(const std::string& path, std::uint32_t mask) {
  const int watch = ::inotify_add_watch(inotify_.get(), path.c_str(), mask | IN_MASK_ADD);
  if (watch < 0) return -errno;
  ++references_[watch];
  return watch;
}

void MetadataIndexWatcher::removeWatch(int watch) {
  auto found = references_.find(watch);
  if (found == references_.end()) return;
  if (--found->second > 0) return;
  references_.erase(found);
  // Fails harmlessly when the kernel has removed the watch already.
  ::inotify_rm_watch(inotify_.get(), watch);
}

MetadataIndexWatcher::Batch MetadataIndexWatcher::waitForEvents(
    std::optional<std::chrono::milliseconds> timeout) {
  Batch batch;
  std::array<pollfd, 2> descriptors{{{inotify_.get(), POLLIN, 0}, {wakeEvent_.get(), POLLIN, 0}}};
  const int ready = ::poll(descriptors.data(), descriptors.size(), pollTimeout(timeout));
  if (ready < 0 && errno != EINTR) batch.failed = true;
  if (ready > 0) {
    if (descriptors[1].revents & POLLIN) drainWakeEvent(wakeEvent_.get());
    if (descriptors[0].revents & (POLLERR | POLLNVAL)) batch.failed = true;
    if (descriptors[0].revents & POLLIN) readAvailable(batch);
  }
  if (overflowInjected_.exchange(false)) batch.overflowed = true;
  forgetRemovedWatches(batch);
  return batch;
}

void MetadataIndexWatcher::readAvailable(Batch& batch) {
  // Aligned for the kernel's records, which it writes whole.
  alignas(inotify_event) std::array<std::uint8_t, kReadBufferBytes> buffer;
  for (int round = 0; round < kMostReadsPerWait; ++round) {
    const ssize_t got = ::read(inotify_.get(), buffer.data(), buffer.size());
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) {
      if (errno != EAGAIN) batch.failed = true;
      return;
    }
    if (got == 0) return;
    decode(std::span<const std::uint8_t>(buffer.data(), static_cast<std::size_t>(got)), batch);
  }
}

void MetadataIndexWatcher::decode(std::span<const std::uint8_t> bytes, Batch& batch) {
  while (!bytes.empty()) {
    inotify_event header{};
    if (bytes.size() < sizeof header) {
      batch.failed = true;
      return;
    }
    std::memcpy(&header, bytes.data(), sizeof header);
    if (bytes.size() - sizeof header < header.len) {
      batch.failed = true;
      return;
    }
    if (header.mask & IN_Q_OVERFLOW) batch.overflowed = true;
    Event event{header.wd, header.mask, header.cookie, {}};
    const auto* name = reinterpret_cast<const char*>(bytes.data() + sizeof header);
    event.name.assign(name, ::strnlen(name, header.len));
    if (!(header.mask & IN_Q_OVERFLOW)) batch.events.push_back(std::move(event));
    bytes = bytes.subspan(sizeof header + header.len);
  }
}

void MetadataIndexWatcher::forgetRemovedWatches(const Batch& batch) {
  for (const Event& event : batch.events) {
    if (event.mask & IN_IGNORED) references_.erase(event.watch);
  }
}

void MetadataIndexWatcher::wake() {
  const std::uint64_t one = 1;
  while (::write(wakeEvent_.get(), &one, sizeof one) < 0 && errno == EINTR) {
  }
}

void MetadataIndexWatcher::injectQueueOverflowForTesting() {
  overflowInjected_ = true;
  wake();
}

}  // namespace larder
