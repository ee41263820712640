// larder-store as a benchmark starts it beside itself.
#pragma once

#include <cctype>
#include <cstdio>
#include <filesystem>
#include <stdexcept>
#include <string>
#include <string_view>

#include "bench/BenchProcesses.h"

namespace larder::bench {

// The exit status of a child, 128 + the signal when one ended it; -1 when
// it cannot be waited for.
inline int waitFor(pid_t pid) {
  int status = 0;
  if (pid < 0 || ::waitpid(pid, &status, 0) != pid) return -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

// larder-store (at `program`) on a free loopback port, stopped with the
// object.
class StoreProcess {
 public:
  StoreProcess(const std::string& program, const std::filesystem::path& catalogue) {
    int ends[2];
    if (::pipe(ends) != 0) throw std::runtime_error("pipe");
    pid_ = spawn({program, "--catalogue", catalogue.string(), "--port", "0", "--exit-with-parent"},
                 {}, ends[1]);
    ::close(ends[1]);
    FILE* output = ::fdopen(ends[0], "r");
    char line[512] = {};
    const std::string text = std::fgets(line, sizeof(line), output) ? line : "";
    std::fclose(output);
    constexpr std::string_view kListening = "larder-store listening on ";
    if (pid_ < 0 || !text.starts_with(kListening)) {
      throw std::runtime_error("larder-store did not start: " + text);
    }
    baseURL_ = text.substr(kListening.size());
    while (!baseURL_.empty() && std::isspace(static_cast<unsigned char>(baseURL_.back()))) {
      baseURL_.pop_back();
    }
  }
  ~StoreProcess() {
    ::kill(pid_, SIGTERM);
    waitFor(pid_);
  }
  StoreProcess(const StoreProcess&) = delete;
  StoreProcess& operator=(const StoreProcess&) = delete;

  [[nodiscard]] std::string bagURL() const { return baseURL_ + "/bag.plist"; }

 private:
  pid_t pid_ = -1;
  std::string baseURL_;
};

}  // namespace larder::bench
