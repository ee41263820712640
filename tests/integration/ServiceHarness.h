#pragma once

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <sstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include <sdbus-c++/IProxy.h>

#include "client/ServiceClient.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "platform/value/PlistValue.h"

extern char** environ;

namespace larder::testing {

inline bool eventually(const std::function<bool()>& condition,
                       std::chrono::milliseconds timeout = std::chrono::seconds(10)) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (std::chrono::steady_clock::now() < deadline) {
    if (condition()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return condition();
}

// The whole file; empty when it cannot be read.
inline std::string readFile(const std::string& path) {
  std::ifstream file(path);
  std::stringstream text;
  text << file.rdbuf();
  return text.str();
}

// argv or envp for posix_spawn; points into `strings`.
inline std::vector<char*> pointers(std::vector<std::string>& strings) {
  std::vector<char*> result;
  for (std::string& text : strings) result.push_back(text.data());
  result.push_back(nullptr);
  return result;
}

// A child process with its standard output and error in files, and the
// environment of this process with `env` over it.
class ChildProcess {
 public:
  ChildProcess(std::vector<std::string> argv, const std::map<std::string, std::string>& env,
               const std::string& outputPath, const std::string& errorPath) {
    std::map<std::string, std::string> merged;
    for (char** entry = environ; *entry; ++entry) {
      const std::string text(*entry);
      const std::size_t equals = text.find('=');
      if (equals != std::string::npos) merged[text.substr(0, equals)] = text.substr(equals + 1);
    }
    for (const auto& [key, value] : env) merged[key] = value;
    std::vector<std::string> environment;
    for (const auto& [key, value] : merged) environment.push_back(key + "=" + value);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 1, outputPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                     0644);
    posix_spawn_file_actions_addopen(&actions, 2, errorPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                     0644);
    std::vector<char*> argumentPointers = pointers(argv);
    std::vector<char*> environmentPointers = pointers(environment);
    const int result = posix_spawn(&pid_, argumentPointers[0], &actions, nullptr,
                                   argumentPointers.data(), environmentPointers.data());
    posix_spawn_file_actions_destroy(&actions);
    if (result != 0) throw std::runtime_error("cannot start " + argv[0]);
  }
  ~ChildProcess() {
    if (!status_) stop(SIGKILL);
  }
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;

  [[nodiscard]] pid_t pid() const { return pid_; }
  [[nodiscard]] bool isRunning() {
    int status = 0;
    if (!status_ && waitpid(pid_, &status, WNOHANG) == pid_) status_ = exitStatus(status);
    return !status_;
  }
  // Sends `signal` and waits for the exit; the exit status, or 128+signal.
  int stop(int signal = SIGTERM) {
    if (!isRunning()) return *status_;
    kill(pid_, signal);
    return wait();
  }
  int wait() {
    int status = 0;
    while (!status_ && waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
    }
    if (!status_) status_ = exitStatus(status);
    return *status_;
  }

 private:
  static int exitStatus(int status) {
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }

  pid_t pid_ = -1;
  std::optional<int> status_;
};

// A private session bus for one test, so that tests never share the
// service's well-known name.
class PrivateBus {
 public:
  PrivateBus() {
    int pipeEnds[2];
    if (pipe(pipeEnds) != 0) throw std::runtime_error("pipe");
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, pipeEnds[1], 1);
    posix_spawn_file_actions_addclose(&actions, pipeEnds[0]);
    posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
    std::vector<std::string> arguments{"/usr/bin/dbus-daemon", "--session", "--nofork",
                                       "--nopidfile", "--print-address=1"};
    std::vector<char*> argumentPointers = pointers(arguments);
    const int result = posix_spawn(&pid_, argumentPointers[0], &actions, nullptr,
                                   argumentPointers.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    close(pipeEnds[1]);
    if (result != 0) throw std::runtime_error("cannot start dbus-daemon");
    char character = 0;
    while (read(pipeEnds[0], &character, 1) == 1 && character != '\n') address_ += character;
    close(pipeEnds[0]);
    if (address_.empty()) throw std::runtime_error("dbus-daemon gave no address");
  }
  ~PrivateBus() {
    kill(pid_, SIGTERM);
    int status = 0;
    waitpid(pid_, &status, 0);
  }
  [[nodiscard]] const std::string& address() const { return address_; }
  [[nodiscard]] std::unique_ptr<sdbus::IConnection> connect() const {
    return sdbus::createSessionBusConnectionWithAddress(address_);
  }

 private:
  pid_t pid_ = -1;
  std::string address_;
};

// A temporary platform root and home, with helpers to lay out bundles.
class TemporaryPlatform {
 public:
  TemporaryPlatform() {
    std::string pattern = (std::filesystem::temp_directory_path() / "larder-test-XXXXXX").string();
    if (!mkdtemp(pattern.data())) throw std::runtime_error("mkdtemp");
    directory_ = pattern;
    std::filesystem::create_directories(root() + "/Applications");
    std::filesystem::create_directories(home() + "/Applications");
  }
  ~TemporaryPlatform() {
    std::error_code code;
    std::filesystem::remove_all(directory_, code);
  }

  [[nodiscard]] const std::string& directory() const { return directory_; }
  [[nodiscard]] std::string root() const { return directory_ + "/root"; }
  [[nodiscard]] std::string home() const { return directory_ + "/home"; }
  [[nodiscard]] std::string cacheHome() const { return directory_ + "/home/.cache"; }
  [[nodiscard]] std::string stateHome() const { return directory_ + "/home/.local/state"; }
  [[nodiscard]] std::string persistedStorePath() const {
    return cacheHome() + "/com.orvane.tradeline/SoftwareMap";
  }

  struct BundleSpec {
    std::string folder;  // absolute path of the folder that holds the bundle
    std::string name;    // "Foo" makes "Foo.app"
    std::string bundleIdentifier;
    std::string version = "1.0";
    std::optional<std::uint64_t> itemIdentifier;  // store software when set
    std::int64_t versionIdentifier = 1;
    std::string iconBytes;  // written to resources/icon.png when not empty
  };
  // Writes the bundle; returns its path.
  std::string installBundle(const BundleSpec& spec) const {
    const std::string path = spec.folder + "/" + spec.name + ".app";
    std::filesystem::create_directories(path + "/resources");
    std::filesystem::create_directories(path + "/bin");
    PlistDictionary info{{"HostBundleIdentifier", spec.bundleIdentifier},
                         {"HostBundleShortVersionString", spec.version},
                         {"HostBundleVersion", spec.version},
                         {"HostBundleExecutable", spec.name}};
    if (!spec.iconBytes.empty()) {
      info.emplace("HostBundleIconFile", "icon");
      write(path + "/resources/icon.png", spec.iconBytes);
    }
    write(path + "/bundle.plist", PropertyListSerialization::writeXml(info));
    if (spec.itemIdentifier) {
      writePurchaseRecord(path, spec.bundleIdentifier, spec.version, *spec.itemIdentifier,
                          spec.versionIdentifier);
    }
    return path;
  }
  // Gives the bundle a program that runs sleep from inside the bundle once
  // it is installed at `installedPath` (the same path by default), so that
  // the process belongs to the bundle as the running applications see it.
  static void makeRunnable(const std::string& bundlePath, std::string installedPath = {}) {
    if (installedPath.empty()) installedPath = bundlePath;
    const std::string name = std::filesystem::path(bundlePath).stem();
    std::filesystem::copy_file("/bin/sleep", bundlePath + "/bin/sleep");
    std::filesystem::copy_file("/bin/sh", bundlePath + "/bin/sh");
    write(bundlePath + "/bin/" + name,
          "#!" + installedPath + "/bin/sh\nexec " + installedPath + "/bin/sleep 600\n");
    std::filesystem::permissions(bundlePath + "/bin/" + name, std::filesystem::perms::owner_all);
  }
  // The version the bundle's information list gives.
  static std::string bundleVersion(const std::string& bundlePath) {
    auto info = PropertyListSerialization::read(*FileIO::read(bundlePath + "/bundle.plist"));
    return *(*info)["HostBundleShortVersionString"].string();
  }
  static void writePurchaseRecord(const std::string& bundlePath, const std::string& identifier,
                                  const std::string& version, std::uint64_t itemIdentifier,
                                  std::int64_t versionIdentifier) {
    write(bundlePath + "/purchase.plist", PropertyListSerialization::writeXml(PlistDictionary{
                                              {"bundleIdentifier", identifier},
                                              {"bundleVersion", version},
                                              {"wareID", itemIdentifier},
                                              {"installerVersionID", versionIdentifier},
                                              {"opaqueAccountIDString", "account-1"},
                                              {"purchaseDate", PlistDate{1700000000}}}));
  }

  // The environment a service and its clients run with.
  [[nodiscard]] std::map<std::string, std::string> environment(const PrivateBus& bus) const {
    return {{"DBUS_SESSION_BUS_ADDRESS", bus.address()},
            {"HOME", home()},
            {"LARDER_ROOT", root()},
            {"XDG_CACHE_HOME", cacheHome()},
            {"XDG_STATE_HOME", stateHome()},
            {"XDG_CONFIG_HOME", home() + "/.config"},
            {"XDG_DATA_HOME", home() + "/.local/share"},
            {"LARDER_LOG_LEVEL", "3"}};
  }

 private:
  static void write(const std::string& path, std::string_view contents) {
    if (!FileIO::writeAtomically(path, contents)) throw std::runtime_error("cannot write " + path);
  }

  std::string directory_;
};

// larderd on a private bus with a temporary platform.
class ServiceProcess {
 public:
  ServiceProcess(const TemporaryPlatform& platform, const PrivateBus& bus,
                 std::vector<std::string> arguments = {},
                 const std::map<std::string, std::string>& extraEnvironment = {})
      : bus_(bus),
        logPath_(platform.directory() + "/larderd-" +
                 std::to_string(std::chrono::steady_clock::now().time_since_epoch().count()) +
                 ".log"),
        process_(withProgram(std::move(arguments)),
                 withExtra(platform.environment(bus), extraEnvironment), "/dev/null", logPath_) {}
  ~ServiceProcess() { process_.stop(SIGKILL); }

  // Waits until `busName` has an owner on the bus; false on time-out or if
  // the process ended.
  bool waitUntilServing(const std::string& busName = "com.orvane.larderd",
                        std::chrono::milliseconds timeout = std::chrono::seconds(10)) {
    auto connection = bus_.connect();
    auto proxy = sdbus::createProxy(*connection, "org.freedesktop.DBus", "/org/freedesktop/DBus");
    const auto owned = [&] {
      bool owner = false;
      proxy->callMethod("NameHasOwner")
          .onInterface("org.freedesktop.DBus")
          .withArguments(busName)
          .storeResultsTo(owner);
      return owner;
    };
    return eventually([&] { return !process_.isRunning() || owned(); }, timeout) &&
           process_.isRunning();
  }
  [[nodiscard]] std::string log() const { return readFile(logPath_); }
  // Lines of the log that contain `text`.
  [[nodiscard]] std::vector<std::string> logLines(const std::string& text) const {
    std::vector<std::string> lines;
    std::istringstream stream(log());
    for (std::string line; std::getline(stream, line);) {
      if (line.find(text) != std::string::npos) lines.push_back(line);
    }
    return lines;
  }
  bool waitForLog(const std::string& text,
                  std::chrono::milliseconds timeout = std::chrono::seconds(10)) const {
    return eventually([&] { return !logLines(text).empty(); }, timeout);
  }
  int stop() { return process_.stop(); }
  ChildProcess& process() { return process_; }

 private:
  static std::vector<std::string> withProgram(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), LARDERD_PATH);
    return arguments;
  }
  static std::map<std::string, std::string> withExtra(
      std::map<std::string, std::string> environment,
      const std::map<std::string, std::string>& extra) {
    for (const auto& [key, value] : extra) environment[key] = value;
    return environment;
  }

  const PrivateBus& bus_;
  std::string logPath_;
  ChildProcess process_;
};

// A client of the service on the private bus.
inline std::unique_ptr<ServiceClient> connectClient(
    const PrivateBus& bus, const std::string& busName = "com.orvane.larderd") {
  return std::make_unique<ServiceClient>(bus.connect(), busName, 10'000'000);
}

}  // namespace larder::testing
