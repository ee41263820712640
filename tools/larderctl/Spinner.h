#pragma once

#include <chrono>
#include <cstdio>
#include <string>
#include <thread>

#include "platform/system/Mutex.h"

namespace larder {

// "- asking the store for updates (12 s)" on a terminal while a blocking
// call runs, so that a wait for a slow store is not silence; removed when
// the spinner goes. Off a terminal it draws nothing, so that scripts and
// logs see only the result.
class Spinner {
 public:
  Spinner(std::FILE* stream, std::string activity);
  ~Spinner();
  Spinner(const Spinner&) = delete;
  Spinner& operator=(const Spinner&) = delete;

  static std::string render(const std::string& activity, std::size_t frame,
                            std::chrono::seconds elapsed);

 private:
  void draw();

  std::FILE* stream_;
  std::string activity_;
  Mutex mutex_;
  ConditionVariable wake_;
  bool stopping_ GUARDED_BY(mutex_) = false;
  std::thread drawer_;
};

}  // namespace larder
