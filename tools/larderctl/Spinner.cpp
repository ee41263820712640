#include "tools/larderctl/Spinner.h"

#include <unistd.h>

#include <array>

namespace larder {
namespace {

constexpr std::chrono::milliseconds kFrameInterval{120};
// A call that answers at once leaves no trace on the screen.
constexpr std::chrono::milliseconds kFirstFrameDelay{300};

}  // namespace

Spinner::Spinner(std::FILE* stream, std::string activity)
    : stream_(stream), activity_(std::move(activity)) {
  if (::isatty(::fileno(stream_)) == 1) drawer_ = std::thread([this] { draw(); });
}

Spinner::~Spinner() {
  if (!drawer_.joinable()) return;
  {
    MutexLock lock(mutex_);
    stopping_ = true;
  }
  wake_.notify_all();
  drawer_.join();
}

std::string Spinner::render(const std::string& activity, std::size_t frame,
                            std::chrono::seconds elapsed) {
  static constexpr std::array<char, 4> kFrames{'-', '\\', '|', '/'};
  std::string line(1, kFrames[frame % kFrames.size()]);
  line += ' ';
  line += activity;
  if (elapsed.count() > 0) line += " (" + std::to_string(elapsed.count()) + " s)";
  return line;
}

void Spinner::draw() {
  const auto started = std::chrono::steady_clock::now();
  MutexLock lock(mutex_);
  bool drawn = false;
  auto next = started + kFirstFrameDelay;
  for (std::size_t frame = 0;; ++frame) {
    while (!stopping_ && wake_.wait_until(lock, next) != std::cv_status::timeout) {
    }
    if (stopping_) break;
    const auto elapsed = std::chrono::duration_cast<std::chrono::seconds>(
        std::chrono::steady_clock::now() - started);
    // "\033[K" clears what a longer earlier line left behind.
    std::fprintf(stream_, "\r%s\033[K", render(activity_, frame, elapsed).c_str());
    std::fflush(stream_);
    drawn = true;
    next += kFrameInterval;
  }
  if (drawn) {
    std::fprintf(stream_, "\r\033[K");
    std::fflush(stream_);
  }
}

}  // namespace larder
