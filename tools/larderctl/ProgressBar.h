#pragma once

#include <cstdio>
#include <string>

namespace larder {

// One line of progress on a terminal: "[#########.........]  45%  Atlas",
// redrawn in place. Off a terminal it draws nothing, so that scripts and
// logs see only the lines that say how the work ended.
class ProgressBar {
 public:
  explicit ProgressBar(std::FILE* stream);
  ~ProgressBar();
  ProgressBar(const ProgressBar&) = delete;
  ProgressBar& operator=(const ProgressBar&) = delete;

  // `fraction` from 0 to 1; values outside are clamped.
  void show(double fraction, const std::string& label);
  // Removes the line, so that the next output starts at its left.
  void clear();

  static std::string render(double fraction, const std::string& label, std::size_t width);

 private:
  std::FILE* stream_;
  bool drawn_ = false;
  bool enabled_;
};

}  // namespace larder
