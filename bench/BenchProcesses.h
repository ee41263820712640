// Processes a benchmark starts beside itself: programs, and a private
// session bus.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

extern char** environ;

namespace larder::bench {

// Starts `argv` (the program found on the PATH) with this process's
// environment plus `extraEnvironment`; standard output goes to `outputFd`
// when it is one, standard error nowhere. -1 when it cannot be started.
inline pid_t spawn(std::vector<std::string> argv, const std::vector<std::string>& extraEnvironment,
                   int outputFd) {
  std::vector<std::string> environment;
  for (char** entry = environ; *entry; ++entry) environment.emplace_back(*entry);
  environment.insert(environment.end(), extraEnvironment.begin(), extraEnvironment.end());
  std::vector<char*> args;
  for (auto& a : argv) args.push_back(a.data());
  args.push_back(nullptr);
  std::vector<char*> env;
  for (auto& e : environment) env.push_back(e.data());
  env.push_back(nullptr);
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  if (outputFd >= 0) posix_spawn_file_actions_adddup2(&actions, outputFd, 1);
  posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
  pid_t pid = -1;
  const int status = posix_spawnp(&pid, args[0], &actions, nullptr, args.data(), env.data());
  posix_spawn_file_actions_destroy(&actions);
  return status == 0 ? pid : -1;
}

// A session bus of the benchmark's own, stopped when it goes.
class PrivateSessionBus {
 public:
  PrivateSessionBus() {
    int pipeEnds[2];
    if (pipe(pipeEnds) != 0) return;
    pid_ =
        spawn({"/usr/bin/dbus-daemon", "--session", "--nofork", "--nopidfile", "--print-address=1"},
              {}, pipeEnds[1]);
    close(pipeEnds[1]);
    char c = 0;
    while (read(pipeEnds[0], &c, 1) == 1 && c != '\n') address_ += c;
    close(pipeEnds[0]);
  }
  ~PrivateSessionBus() {
    kill(pid_, SIGTERM);
    waitpid(pid_, nullptr, 0);
  }
  PrivateSessionBus(const PrivateSessionBus&) = delete;
  PrivateSessionBus& operator=(const PrivateSessionBus&) = delete;

  [[nodiscard]] const std::string& address() const { return address_; }

 private:
  pid_t pid_ = -1;
  std::string address_;
};

}  // namespace larder::bench
