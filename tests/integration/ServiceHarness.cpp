#include "tests/integration/ServiceHarness.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <thread>

#include <sdbus-c++/IProxy.h>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"

extern char** environ;

namespace larder::testing {

namespace fs = std::filesystem;

namespace {

std::vector<std::string> mergedEnvironment(const std::map<std::string, std::string>& overrides) {
  std::map<std::string, std::string> merged;
  for (char** entry = environ; *entry; ++entry) {
    std::string text(*entry);
    std::size_t equals = text.find('=');
    if (equals != std::string::npos) merged[text.substr(0, equals)] = text.substr(equals + 1);
  }
  for (const auto& [key, value] : overrides) merged[key] = value;
  std::vector<std::string> result;
  for (const auto& [key, value] : merged) result.push_back(key + "=" + value);
  return result;
}

std::vector<char*> pointers(std::vector<std::string>& strings) {
  std::vector<char*> result;
  for (std::string& text : strings) result.push_back(text.data());
  result.push_back(nullptr);
  return result;
}

void writePlist(const std::string& path, const PlistValue& value) {
  if (!FileIO::writeAtomically(path, PropertyListSerialization::writeXml(value))) {
    throw std::runtime_error("cannot write " + path);
  }
}

}  // namespace

std::string readFile(const std::string& path) {
  std::ifstream file(path);
  std::stringstream text;
  text << file.rdbuf();
  return text.str();
}

ScopedEnvironment::ScopedEnvironment(const std::map<std::string, std::string>& values) {
  for (const auto& [name, value] : values) {
    const char* old = std::getenv(name.c_str());
    saved_.emplace(name, old ? std::optional<std::string>(old) : std::nullopt);
    ::setenv(name.c_str(), value.c_str(), 1);
  }
}

ScopedEnvironment::~ScopedEnvironment() {
  for (const auto& [name, value] : saved_) {
    if (value) {
      ::setenv(name.c_str(), value->c_str(), 1);
    } else {
      ::unsetenv(name.c_str());
    }
  }
}

bool eventually(const std::function<bool()>& condition, std::chrono::milliseconds timeout) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (std::chrono::steady_clock::now() < deadline) {
    if (condition()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return condition();
}

ChildProcess::ChildProcess(const std::vector<std::string>& argv,
                           const std::map<std::string, std::string>& env,
                           const std::string& outputPath, const std::string& errorPath) {
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 1, outputPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                   0644);
  posix_spawn_file_actions_addopen(&actions, 2, errorPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                   0644);
  std::vector<std::string> arguments = argv;
  std::vector<std::string> environment = mergedEnvironment(env);
  std::vector<char*> argumentPointers = pointers(arguments);
  std::vector<char*> environmentPointers = pointers(environment);
  int result = posix_spawn(&pid_, argumentPointers[0], &actions, nullptr, argumentPointers.data(),
                           environmentPointers.data());
  posix_spawn_file_actions_destroy(&actions);
  if (result != 0) throw std::runtime_error("cannot start " + argv[0]);
}

ChildProcess::~ChildProcess() {
  if (!status_) stop(SIGKILL);
}

bool ChildProcess::isRunning() {
  if (status_) return false;
  int status = 0;
  if (waitpid(pid_, &status, WNOHANG) == pid_) {
    status_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    return false;
  }
  return true;
}

int ChildProcess::wait() {
  if (status_) return *status_;
  int status = 0;
  while (waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
  }
  status_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  return *status_;
}

int ChildProcess::stop(int signal) {
  if (!isRunning()) return *status_;
  kill(pid_, signal);
  return wait();
}

PrivateBus::PrivateBus() {
  int pipeEnds[2];
  if (pipe(pipeEnds) != 0) throw std::runtime_error("pipe");
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, pipeEnds[1], 1);
  posix_spawn_file_actions_addclose(&actions, pipeEnds[0]);
  posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
  std::vector<std::string> arguments{"/usr/bin/dbus-daemon", "--session", "--nofork", "--nopidfile",
                                     "--print-address=1"};
  std::vector<char*> argumentPointers = pointers(arguments);
  int result =
      posix_spawn(&pid_, argumentPointers[0], &actions, nullptr, argumentPointers.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  close(pipeEnds[1]);
  if (result != 0) throw std::runtime_error("cannot start dbus-daemon");
  char character = 0;
  while (read(pipeEnds[0], &character, 1) == 1 && character != '\n') address_ += character;
  close(pipeEnds[0]);
  if (address_.empty()) throw std::runtime_error("dbus-daemon gave no address");
}

PrivateBus::~PrivateBus() {
  kill(pid_, SIGTERM);
  int status = 0;
  waitpid(pid_, &status, 0);
}

std::unique_ptr<sdbus::IConnection> PrivateBus::connect() const {
  return sdbus::createSessionBusConnectionWithAddress(address_);
}

TemporaryPlatform::TemporaryPlatform() {
  std::string pattern = (fs::temp_directory_path() / "larder-test-XXXXXX").string();
  if (!mkdtemp(pattern.data())) throw std::runtime_error("mkdtemp");
  directory_ = pattern;
  fs::create_directories(root() + "/Applications");
  fs::create_directories(home() + "/Applications");
}

TemporaryPlatform::~TemporaryPlatform() {
  std::error_code code;
  fs::remove_all(directory_, code);
}

void TemporaryPlatform::writePurchaseRecord(const std::string& bundlePath,
                                            const std::string& identifier,
                                            const std::string& version,
                                            std::uint64_t itemIdentifier,
                                            std::int64_t versionIdentifier) {
  writePlist(bundlePath + "/purchase.plist",
             PlistDictionary{{"bundleIdentifier", identifier},
                             {"bundleVersion", version},
                             {"wareID", itemIdentifier},
                             {"installerVersionID", versionIdentifier},
                             {"opaqueAccountIDString", "account-1"},
                             {"purchaseDate", PlistDate{1700000000}}});
}

std::string TemporaryPlatform::installBundle(const BundleSpec& spec) const {
  std::string path = spec.folder + "/" + spec.name + ".app";
  fs::create_directories(path + "/resources");
  fs::create_directories(path + "/bin");
  PlistDictionary info{{"HostBundleIdentifier", spec.bundleIdentifier},
                       {"HostBundleShortVersionString", spec.version},
                       {"HostBundleVersion", spec.version},
                       {"HostBundleExecutable", spec.name}};
  if (!spec.iconBytes.empty()) {
    info.emplace("HostBundleIconFile", "icon");
    if (!FileIO::writeAtomically(path + "/resources/icon.png", spec.iconBytes)) {
      throw std::runtime_error("cannot write the icon of " + path);
    }
  }
  writePlist(path + "/bundle.plist", info);
  if (spec.itemIdentifier) {
    writePurchaseRecord(path, spec.bundleIdentifier, spec.version, *spec.itemIdentifier,
                        spec.versionIdentifier);
  }
  return path;
}

std::map<std::string, std::string> TemporaryPlatform::environment(const PrivateBus& bus) const {
  return {{"DBUS_SESSION_BUS_ADDRESS", bus.address()},
          {"HOME", home()},
          {"LARDER_ROOT", root()},
          {"XDG_CACHE_HOME", cacheHome()},
          {"XDG_STATE_HOME", stateHome()},
          {"XDG_CONFIG_HOME", home() + "/.config"},
          {"LARDER_LOG_LEVEL", "3"}};
}

ServiceProcess::ServiceProcess(const TemporaryPlatform& platform, const PrivateBus& bus,
                               std::vector<std::string> arguments,
                               std::map<std::string, std::string> extraEnvironment)
    : bus_(bus),
      logPath_(platform.directory() + "/larderd-" + std::to_string(::getpid()) + "-" +
               std::to_string(std::chrono::steady_clock::now().time_since_epoch().count()) +
               ".log"),
      process_(
          [&] {
            std::vector<std::string> argv{LARDERD_PATH};
            argv.insert(argv.end(), arguments.begin(), arguments.end());
            return argv;
          }(),
          [&] {
            auto env = platform.environment(bus);
            for (auto& [key, value] : extraEnvironment) env[key] = value;
            return env;
          }(),
          "/dev/null", logPath_) {}

ServiceProcess::~ServiceProcess() {
  process_.stop(SIGKILL);
}

bool ServiceProcess::waitUntilServing(const std::string& busName,
                                      std::chrono::milliseconds timeout) {
  auto connection = bus_.connect();
  auto proxy = sdbus::createProxy(*connection, "org.freedesktop.DBus", "/org/freedesktop/DBus");
  return eventually(
             [&] {
               if (!process_.isRunning()) return true;
               bool owned = false;
               proxy->callMethod("NameHasOwner")
                   .onInterface("org.freedesktop.DBus")
                   .withArguments(busName)
                   .storeResultsTo(owned);
               return owned;
             },
             timeout) &&
         process_.isRunning();
}

std::string ServiceProcess::log() const {
  return readFile(logPath_);
}

std::vector<std::string> ServiceProcess::logLines(const std::string& text) const {
  std::vector<std::string> lines;
  std::istringstream stream(log());
  for (std::string line; std::getline(stream, line);) {
    if (line.find(text) != std::string::npos) lines.push_back(line);
  }
  return lines;
}

bool ServiceProcess::waitForLog(const std::string& text, std::chrono::milliseconds timeout) const {
  return eventually([&] { return !logLines(text).empty(); }, timeout);
}

std::unique_ptr<ServiceClient> connectClient(const PrivateBus& bus, const std::string& busName) {
  return std::make_unique<ServiceClient>(bus.connect(), busName, 10'000'000);
}

}  // namespace larder::testing
