#pragma once

#include <chrono>
#include <map>
#include <string>
#include <vector>

#include "tests/integration/ServiceHarness.h"

namespace larder::testing {

// A larderctl process with its output in files "<filesPrefix>.out" and ".err".
class Larderctl {
 public:
  Larderctl(const std::string& filesPrefix, std::vector<std::string> argv,
            const std::map<std::string, std::string>& environment)
      : outputPath_(filesPrefix + ".out"),
        errorPath_(filesPrefix + ".err"),
        process_(argv, environment, outputPath_, errorPath_) {}

  Larderctl(const TemporaryPlatform& platform, const PrivateBus& bus,
            const std::vector<std::string>& arguments, const std::string& name)
      : Larderctl(platform.directory() + "/" + name, withProgram(arguments),
                  platform.environment(bus)) {}

  // Through the shell, to give the process a standard input.
  Larderctl(const TemporaryPlatform& platform, const PrivateBus& bus, const std::string& arguments,
            const std::string& inputPath, const std::string& name)
      : Larderctl(platform.directory() + "/" + name,
                  {"/bin/sh", "-c",
                   std::string("exec ") + LARDERCTL_PATH + " " + arguments + " < " + inputPath},
                  platform.environment(bus)) {}

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

  static std::vector<std::string> withProgram(const std::vector<std::string>& arguments) {
    std::vector<std::string> argv{LARDERCTL_PATH};
    argv.insert(argv.end(), arguments.begin(), arguments.end());
    return argv;
  }

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

// Runs larderctl to its end, at most `timeout`.
inline LarderctlRun runLarderctl(const std::string& filesPrefix,
                                 const std::vector<std::string>& arguments,
                                 const std::map<std::string, std::string>& environment,
                                 std::chrono::milliseconds timeout = std::chrono::seconds(90)) {
  Larderctl larderctl(filesPrefix, Larderctl::withProgram(arguments), environment);
  LarderctlRun run;
  if (larderctl.waitForExit(timeout)) run.status = larderctl.process().wait();
  run.output = larderctl.output();
  run.errors = larderctl.errors();
  return run;
}

}  // namespace larder::testing
