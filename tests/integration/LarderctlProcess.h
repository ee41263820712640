#pragma once

#include <chrono>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "tests/integration/ServiceHarness.h"

namespace larder::testing {

inline std::string readFile(const std::string& path) {
  std::ifstream file(path);
  std::stringstream text;
  text << file.rdbuf();
  return text.str();
}

// A larderctl process with its output in files.
class Larderctl {
 public:
  Larderctl(const TemporaryPlatform& platform, const PrivateBus& bus,
            const std::vector<std::string>& arguments, const std::string& name)
      : outputPath_(platform.directory() + "/" + name + ".out"),
        errorPath_(platform.directory() + "/" + name + ".err"),
        process_(
            [&] {
              std::vector<std::string> argv{LARDERCTL_PATH};
              argv.insert(argv.end(), arguments.begin(), arguments.end());
              return argv;
            }(),
            platform.environment(bus), outputPath_, errorPath_) {}

  // Through the shell, to give the process a standard input.
  Larderctl(const TemporaryPlatform& platform, const PrivateBus& bus, const std::string& arguments,
            const std::string& inputPath, const std::string& name)
      : outputPath_(platform.directory() + "/" + name + ".out"),
        errorPath_(platform.directory() + "/" + name + ".err"),
        process_({"/bin/sh", "-c",
                  std::string("exec ") + LARDERCTL_PATH + " " + arguments + " < " + inputPath},
                 platform.environment(bus), outputPath_, errorPath_) {}

  [[nodiscard]] std::string output() const { return readFile(outputPath_); }
  [[nodiscard]] std::string errors() const { return readFile(errorPath_); }
  bool waitForError(const std::string& text,
                    std::chrono::milliseconds timeout = std::chrono::seconds(10)) {
    return eventually([&] { return errors().find(text) != std::string::npos; }, timeout);
  }
  // True when the process ended within `timeout`.
  bool waitForExit(std::chrono::milliseconds timeout = std::chrono::seconds(20)) {
    return eventually([&] { return !process_.isRunning(); }, timeout);
  }
  ChildProcess& process() { return process_; }

 private:
  std::string outputPath_;
  std::string errorPath_;
  ChildProcess process_;
};

// What one larderctl run ended with; status -1 when it did not end in time.
struct LarderctlRun {
  int status = -1;
  std::string output;
  std::string errors;
};

// Runs larderctl to its end, at most `timeout`; `name` names its files.
inline LarderctlRun runLarderctl(const TemporaryPlatform& platform, const PrivateBus& bus,
                                 const std::vector<std::string>& arguments, const std::string& name,
                                 std::chrono::milliseconds timeout = std::chrono::seconds(90)) {
  Larderctl larderctl(platform, bus, arguments, name);
  LarderctlRun run;
  if (larderctl.waitForExit(timeout)) run.status = larderctl.process().wait();
  run.output = larderctl.output();
  run.errors = larderctl.errors();
  return run;
}

}  // namespace larder::testing
