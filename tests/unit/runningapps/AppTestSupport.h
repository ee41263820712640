// A private platform root with application bundles whose programs are real
// processes: a copy of /bin/sleep run from inside the bundle, so that
// /proc/<pid>/exe lies in it.
#pragma once

#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/value/PlistValue.h"
#include "running-apps/RunningApplication.h"
#include "running-apps/RunningApplicationFacts.h"
#include "tests/unit/ScopedEnvironment.h"
#include "tests/unit/TemporaryFolder.h"

namespace larder::testing {

namespace fs = std::filesystem;

// Polls `condition` until it holds or `limit` passes: the positive signal a
// test waits for.
inline bool eventually(const std::function<bool()>& condition,
                       std::chrono::milliseconds limit = std::chrono::seconds(10)) {
  auto deadline = std::chrono::steady_clock::now() + limit;
  while (std::chrono::steady_clock::now() < deadline) {
    if (condition()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return condition();
}

class AppTestRoot {
 public:
  enum class Program { kSleeps, kIgnoresTerm };

  AppTestRoot() : folder_("larder-apps") {
    fs::create_directories(folder_ / "root/Applications");
    fs::create_directories(folder_ / "home");
    environment_.set("LARDER_ROOT", folder_ / "root");
    environment_.set("HOME", folder_ / "home");
    environment_.unset("XDG_CONFIG_HOME");
    environment_.unset("XDG_STATE_HOME");
    environment_.unset("XDG_CACHE_HOME");
  }
  ~AppTestRoot() { killAll(); }
  AppTestRoot(const AppTestRoot&) = delete;
  AppTestRoot& operator=(const AppTestRoot&) = delete;

  [[nodiscard]] std::string root() const { return folder_ / "root"; }
  [[nodiscard]] std::string applications() const { return folder_ / "root/Applications"; }

  // "<root>/Applications/<name>.app" (or under `parent`; no spaces: the
  // path goes into a "#!" line), whose program
  // sleeps; the one of kIgnoresTerm does not obey SIGTERM.
  std::string makeBundle(const std::string& name, const std::string& identifier,
                         Program program = Program::kSleeps, PlistDictionary extraInfo = {},
                         const std::string& parent = {}) {
    std::string path = (parent.empty() ? applications() : parent) + "/" + name + ".app";
    fs::create_directories(path + "/bin");
    PlistDictionary info = std::move(extraInfo);
    info["HostBundleIdentifier"] = identifier;
    info["HostBundleExecutable"] = "run";
    writeFile(path + "/bundle.plist", PropertyListSerialization::writeXml(PlistValue(info)));
    fs::copy_file("/bin/sleep", path + "/bin/sleep");
    fs::copy_file("/bin/sh", path + "/bin/sh");
    // exec keeps an ignored signal ignored, so the sleep inherits the trap.
    std::string script = "#!" + path + "/bin/sh\n";
    if (program == Program::kIgnoresTerm) script += "trap '' TERM\n";
    script += "exec " + path + "/bin/sleep 600\n";
    writeFile(path + "/bin/run", script);
    fs::permissions(path + "/bin/run", fs::perms::owner_all);
    bundles_.push_back(path);
    return path;
  }

  // Starts the bundle's program and waits until it runs the sleep of the
  // bundle (the shell has done its work).
  pid_t launch(const std::string& bundlePath) {
    Result<pid_t> pid = RunningApplication::launchBundle(bundlePath);
    EXPECT_TRUE(pid) << pid.errorDescription();
    if (!pid) return -1;
    EXPECT_TRUE(eventually([&] { return runsSleepOf(*pid, bundlePath); }))
        << "pid " << *pid << " never ran the sleep of " << bundlePath;
    return *pid;
  }

  static bool runsSleepOf(pid_t pid, const std::string& bundlePath) {
    std::error_code error;
    fs::path exe = fs::read_symlink("/proc/" + std::to_string(pid) + "/exe", error);
    return !error && exe == fs::path(bundlePath + "/bin/sleep");
  }

  // Every process that runs from a bundle of this root.
  void killAll() {
    for (const auto& application : RunningApplication::allRunningApplications()) {
      if (application->bundleURL() && application->bundleURL()->starts_with(root())) {
        ::kill(application->pid(), SIGKILL);
      }
    }
  }

  static void writeFile(const std::string& path, const std::string& contents) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << contents;
  }

 private:
  TemporaryFolder folder_;
  ScopedEnvironment environment_;
  std::vector<std::string> bundles_;
};

inline bool processIsGone(pid_t pid) {
  std::ifstream stat("/proc/" + std::to_string(pid) + "/stat");
  if (!stat) return true;
  std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
  std::size_t close = text.rfind(')');
  return close != std::string::npos && close + 2 < text.size() &&
         (text[close + 2] == 'Z' || text[close + 2] == 'X');
}

}  // namespace larder::testing
