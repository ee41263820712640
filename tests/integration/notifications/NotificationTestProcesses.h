// The processes the notification tests start: a session bus of the test's
// own, and the programs of a desktop (an X server, a notification server).
// Each is stopped when its object goes, whatever way the test ends.
#pragma once

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <fstream>
#include <map>
#include <memory>
#include <optional>
#include <sstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include <sdbus-c++/IConnection.h>

#include "tests/unit/TemporaryFolder.h"

extern char** environ;

namespace larder::testing {

inline std::string readWholeFile(const std::string& path) {
  std::ifstream file(path);
  std::stringstream text;
  text << file.rdbuf();
  return text.str();
}

// A child process with this process's environment and `environment` over
// it, its output and errors in `logPath`. When `passedDescriptor` is set,
// the child has it as its descriptor 3.
class ChildProcess {
 public:
  ChildProcess(std::vector<std::string> arguments,
               const std::map<std::string, std::string>& environment, const std::string& logPath,
               std::optional<int> passedDescriptor = std::nullopt)
      : logPath_(logPath) {
    std::map<std::string, std::string> merged;
    for (char** entry = environ; *entry != nullptr; ++entry) {
      const std::string text(*entry);
      const std::size_t equals = text.find('=');
      if (equals != std::string::npos) merged[text.substr(0, equals)] = text.substr(equals + 1);
    }
    for (const auto& [name, value] : environment) merged[name] = value;
    std::vector<std::string> variables;
    for (const auto& [name, value] : merged) variables.push_back(name + "=" + value);

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 1, logPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                     0644);
    posix_spawn_file_actions_adddup2(&actions, 1, 2);
    if (passedDescriptor) posix_spawn_file_actions_adddup2(&actions, *passedDescriptor, 3);
    std::vector<char*> argv = pointers(arguments);
    std::vector<char*> envp = pointers(variables);
    const int result = posix_spawn(&pid_, argv[0], &actions, nullptr, argv.data(), envp.data());
    posix_spawn_file_actions_destroy(&actions);
    if (result != 0) throw std::runtime_error("cannot start " + arguments[0]);
  }
  ~ChildProcess() { stop(); }
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  [[nodiscard]] bool isRunning() {
    int status = 0;
    if (!exited_ && waitpid(pid_, &status, WNOHANG) == pid_) exited_ = true;
    return !exited_;
  }
  [[nodiscard]] std::string log() const { return readWholeFile(logPath_); }

  // Asks it to end, and ends it when it does not within a second.
  void stop() {
    if (!isRunning()) return;
    kill(pid_, SIGTERM);
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(1);
    while (isRunning() && std::chrono::steady_clock::now() < deadline) {
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    if (isRunning()) kill(pid_, SIGKILL);
    int status = 0;
    while (!exited_ && waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
    }
    exited_ = true;
  }

 private:
  static std::vector<char*> pointers(std::vector<std::string>& strings) {
    std::vector<char*> result;
    for (std::string& text : strings) result.push_back(text.data());
    result.push_back(nullptr);
    return result;
  }

  std::string logPath_;
  pid_t pid_ = -1;
  bool exited_ = false;
};

// A session bus of one test. It starts no service on demand, so that a
// name nobody owns stays unowned (a notification server installed on the
// machine would otherwise be started by the first call).
class PrivateSessionBus {
 public:
  PrivateSessionBus() {
    const std::string config = folder_ / "session.conf";
    std::ofstream(config) << R"(<!DOCTYPE busconfig PUBLIC
 "-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN"
 "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">
<busconfig>
  <type>session</type>
  <listen>unix:tmpdir=/tmp</listen>
  <auth>EXTERNAL</auth>
  <policy context="default">
    <allow send_destination="*" eavesdrop="true"/>
    <allow eavesdrop="true"/>
    <allow own="*"/>
  </policy>
</busconfig>
)";
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0) throw std::runtime_error("pipe");
    daemon_ = std::make_unique<ChildProcess>(
        std::vector<std::string>{"/usr/bin/dbus-daemon", "--config-file=" + config, "--nofork",
                                 "--nopidfile", "--print-address=3"},
        std::map<std::string, std::string>{}, folder_ / "dbus-daemon.log", ends[1]);
    close(ends[1]);
    address_ = readLine(ends[0], std::chrono::seconds(10));
    close(ends[0]);
    if (address_.empty())
      throw std::runtime_error("dbus-daemon gave no address: " + daemon_->log());
  }

  [[nodiscard]] const std::string& address() const { return address_; }
  [[nodiscard]] std::unique_ptr<sdbus::IConnection> connect() const {
    return sdbus::createSessionBusConnectionWithAddress(address_);
  }
  [[nodiscard]] const TemporaryFolder& folder() const { return folder_; }

  // The first line written to `descriptor`, without its end; empty when
  // none comes in time.
  static std::string readLine(int descriptor, std::chrono::milliseconds timeout) {
    std::string line;
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
      pollfd ready{descriptor, POLLIN, 0};
      if (poll(&ready, 1, 100) <= 0) continue;
      char character = 0;
      if (read(descriptor, &character, 1) != 1) break;
      if (character == '\n') return line;
      line += character;
    }
    return line;
  }

 private:
  TemporaryFolder folder_{"larder-notification-bus"};
  std::unique_ptr<ChildProcess> daemon_;
  std::string address_;
};

}  // namespace larder::testing
