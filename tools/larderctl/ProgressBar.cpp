#include "tools/larderctl/ProgressBar.h"

#include <unistd.h>

#include <algorithm>
#include <cmath>

namespace larder {
namespace {

constexpr std::size_t kBarWidth = 30;

}  // namespace

ProgressBar::ProgressBar(std::FILE* stream)
    : stream_(stream), enabled_(::isatty(::fileno(stream)) == 1) {}

ProgressBar::~ProgressBar() {
  clear();
}

std::string ProgressBar::render(double fraction, const std::string& label, std::size_t width) {
  const double clamped = std::isnan(fraction) ? 0.0 : std::clamp(fraction, 0.0, 1.0);
  const auto filled = static_cast<std::size_t>(clamped * static_cast<double>(width));
  const auto percent = static_cast<int>(clamped * 100.0);
  std::string line = "[" + std::string(filled, '#') + std::string(width - filled, '.') + "] ";
  const std::string number = std::to_string(percent);
  line += std::string(3 - std::min<std::size_t>(3, number.size()), ' ') + number + "%  " + label;
  return line;
}

void ProgressBar::show(double fraction, const std::string& label) {
  if (!enabled_) return;
  // "\033[K" clears what a longer earlier line left behind.
  std::fprintf(stream_, "\r%s\033[K", render(fraction, label, kBarWidth).c_str());
  std::fflush(stream_);
  drawn_ = true;
}

void ProgressBar::clear() {
  if (!drawn_) return;
  std::fprintf(stream_, "\r\033[K");
  std::fflush(stream_);
  drawn_ = false;
}

}  // namespace larder
