#include "running-apps/RunningApplication.h"

#include "running-apps/RunningApplicationFacts.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/close_range.h>
#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <string_view>
#include <unordered_map>

#include "platform/log/TillLogManager.h"
#include "platform/system/Bundle.h"
#include "platform/system/Environment.h"
#include "platform/system/FileDescriptor.h"
#include "platform/system/FileIO.h"
#include "store-runtime/host/PlatformStateFile.h"

extern char** environ;

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "RunningApplication";
constexpr std::string_view kBundleSuffix = ".app";
constexpr auto kWatchInterval = std::chrono::milliseconds(50);

int openPidFd(pid_t pid) {
#ifdef SYS_pidfd_open
  return static_cast<int>(::syscall(SYS_pidfd_open, pid, 0));
#else
  (void)pid;
  errno = ENOSYS;
  return -1;
#endif
}

bool pidFdSendSignal(int pidFd, int signal) {
#ifdef SYS_pidfd_send_signal
  return ::syscall(SYS_pidfd_send_signal, pidFd, signal, nullptr, 0) == 0;
#else
  (void)pidFd;
  (void)signal;
  return false;
#endif
}

std::string procPath(pid_t pid, std::string_view entry) {
  std::string path = "/proc/" + std::to_string(pid);
  if (!entry.empty()) path.append("/").append(entry);
  return path;
}

// Reads a small /proc file with one read; /proc files are not seekable
// streams worth buffering.
std::optional<std::string> readSmallFile(const std::string& path) {
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return std::nullopt;
  std::array<char, 1024> buffer{};
  ssize_t count = ::read(fd, buffer.data(), buffer.size());
  ::close(fd);
  if (count <= 0) return std::nullopt;
  return std::string(buffer.data(), static_cast<std::size_t>(count));
}

struct ProcessStat {
  char state = '?';
  std::uint64_t startTicks = 0;
};

// The fields after the command name, which may itself hold spaces and
// parentheses; the start time is field 22.
std::optional<ProcessStat> readProcessStat(pid_t pid) {
  std::optional<std::string> text = readSmallFile(procPath(pid, "stat"));
  if (!text) return std::nullopt;
  std::size_t close = text->rfind(')');
  if (close == std::string::npos || close + 2 >= text->size()) return std::nullopt;
  std::string_view rest = std::string_view(*text).substr(close + 2);
  ProcessStat stat;
  stat.state = rest.front();
  constexpr int kStartTimeIndex = 19;  // field 22 counted from field 3
  for (int index = 0; index < kStartTimeIndex; ++index) {
    std::size_t space = rest.find(' ');
    if (space == std::string_view::npos) return std::nullopt;
    rest.remove_prefix(space + 1);
  }
  std::from_chars(rest.data(), rest.data() + rest.size(), stat.startTicks);
  return stat;
}

// Seconds since 1970 at which the machine booted; it does not change while
// the process runs.
double bootTime() {
  static const double seconds = [] {
    std::optional<PlistData> bytes = FileIO::read("/proc/stat").optional();
    if (!bytes) return 0.0;
    std::string_view text(reinterpret_cast<const char*>(bytes->data()), bytes->size());
    std::size_t at = text.find("\nbtime ");
    if (at == std::string_view::npos) return 0.0;
    text.remove_prefix(at + 7);
    std::uint64_t value = 0;
    std::from_chars(text.data(), text.data() + text.size(), value);
    return static_cast<double>(value);
  }();
  return seconds;
}

std::optional<PlistDate> launchDateForTicks(std::uint64_t ticks) {
  const long ticksPerSecond = ::sysconf(_SC_CLK_TCK);
  if (ticksPerSecond <= 0 || bootTime() == 0.0) return std::nullopt;
  return PlistDate{bootTime() + static_cast<double>(ticks) / static_cast<double>(ticksPerSecond)};
}

// The innermost folder of `executable` whose name ends in ".app".
std::optional<std::string> bundlePathOfExecutable(std::string_view executable) {
  std::size_t end = executable.rfind('/');
  while (end != std::string_view::npos && end > 0) {
    std::string_view folder = executable.substr(0, end);
    std::size_t start = folder.rfind('/');
    std::string_view name = folder.substr(start == std::string_view::npos ? 0 : start + 1);
    if (name.size() > kBundleSuffix.size() && name.ends_with(kBundleSuffix)) {
      return std::string(folder);
    }
    end = start;
  }
  return std::nullopt;
}

// The program a process started from its absolute path, as its first
// argument says.
std::optional<std::string> absoluteFirstArgument(int procFd, pid_t pid) {
  std::array<char, 32> name{};
  std::snprintf(name.data(), name.size(), "%d/cmdline", static_cast<int>(pid));
  FileDescriptor file(::openat(procFd, name.data(), O_RDONLY | O_CLOEXEC));
  if (!file.valid()) return std::nullopt;
  std::array<char, 4096> buffer{};
  const ssize_t length = ::read(file.get(), buffer.data(), buffer.size() - 1);
  if (length <= 0 || buffer[0] != '/') return std::nullopt;
  return std::string(buffer.data());
}

// The executable of `pid`, read relative to an open /proc: one lookup of
// a short path per process keeps a scan of a thousand of them cheap. A
// sandboxed service may not look at the executable of a process outside
// its sandbox (the kernel treats that as tracing it); the program's first
// argument then stands in. A process can lie there, but a lie only holds
// an update back.
std::optional<std::string> executablePath(int procFd, pid_t pid) {
  std::array<char, 32> link{};
  std::snprintf(link.data(), link.size(), "%d/exe", static_cast<int>(pid));
  std::array<char, 4096> buffer{};
  ssize_t length = ::readlinkat(procFd, link.data(), buffer.data(), buffer.size() - 1);
  if (length > 0) return std::string(buffer.data(), static_cast<std::size_t>(length));
  if (errno == EACCES || errno == EPERM) return absoluteFirstArgument(procFd, pid);
  return std::nullopt;
}

bool ownedBy(int procFd, pid_t pid, uid_t user) {
  std::array<char, 16> name{};
  std::snprintf(name.data(), name.size(), "%d", static_cast<int>(pid));
  struct stat status {};
  return ::fstatat(procFd, name.data(), &status, 0) == 0 && status.st_uid == user;
}

struct BundleFacts {
  std::optional<std::string> identifier;
  std::optional<std::string> name;
};

std::string displayName(const std::optional<Bundle>& bundle, const std::string& bundlePath) {
  for (std::string_view key : {"HostBundleDisplayName", "HostBundleName"}) {
    const std::string* name = bundle ? bundle->infoValue(key).string() : nullptr;
    if (name && !name->empty()) return *name;
  }
  std::string folder = bundlePath.substr(bundlePath.rfind('/') + 1);
  if (folder.ends_with(kBundleSuffix)) folder.resize(folder.size() - kBundleSuffix.size());
  return folder;
}

BundleFacts readBundleFacts(const std::string& bundlePath) {
  BundleFacts facts;
  std::optional<Bundle> bundle = Bundle::open(bundlePath);
  if (bundle) facts.identifier = bundle->identifier();
  facts.name = displayName(bundle, bundlePath);
  return facts;
}

// Bundles seen during one scan: many processes may run from the same one.
using BundleCache = std::unordered_map<std::string, BundleFacts>;

bool isBelow(const std::string& path, const std::string& folder) {
  return path.size() > folder.size() && path.starts_with(folder) && path[folder.size()] == '/';
}

// Under a private platform root the machine is that tree and the user's home:
// a bundle elsewhere belongs to another machine's tests or demo, and its
// processes are none of this one's applications.
bool belongsToThisMachine(const std::string& bundlePath) {
  const std::string root = Environment::platformRoot();
  return root == "/" || isBelow(bundlePath, root) ||
         isBelow(bundlePath, Environment::homeDirectory());
}

std::optional<RunningApplication::Description> describe(int procFd, pid_t pid, uid_t user,
                                                        BundleCache& bundles) {
  // Most processes run from no bundle: that is found with one lookup, and
  // the owner is asked only of the few that do.
  std::optional<std::string> executable = executablePath(procFd, pid);
  if (!executable) return std::nullopt;
  std::optional<std::string> bundlePath = bundlePathOfExecutable(*executable);
  if (!bundlePath || !belongsToThisMachine(*bundlePath) || !ownedBy(procFd, pid, user)) {
    return std::nullopt;
  }
  std::optional<ProcessStat> stat = readProcessStat(pid);
  if (!stat || stat->state == 'Z' || stat->state == 'X') return std::nullopt;
  auto cached = bundles.find(*bundlePath);
  if (cached == bundles.end()) {
    cached = bundles.emplace(*bundlePath, readBundleFacts(*bundlePath)).first;
  }
  RunningApplication::Description description;
  description.pid = pid;
  description.startTicks = stat->startTicks;
  description.bundleIdentifier = cached->second.identifier;
  description.bundleURL = *bundlePath;
  description.launchDate = launchDateForTicks(stat->startTicks);
  description.localizedName = cached->second.name;
  return description;
}

// Every numeric entry of /proc, in pid order.
std::vector<pid_t> allPids(DIR* proc) {
  std::vector<pid_t> pids;
  while (const dirent* entry = ::readdir(proc)) {
    pid_t pid = 0;
    const char* name = entry->d_name;
    auto [end, error] = std::from_chars(name, name + std::strlen(name), pid);
    if (error == std::errc() && *end == '\0' && pid > 0) pids.push_back(pid);
  }
  std::sort(pids.begin(), pids.end());
  return pids;
}

std::vector<std::shared_ptr<RunningApplication>> scan(
    const std::function<bool(const RunningApplication::Description&)>& wanted) {
  std::vector<std::shared_ptr<RunningApplication>> applications;
  DIR* proc = ::opendir("/proc");
  if (!proc) return applications;
  BundleCache bundles;
  const uid_t user = ::getuid();
  for (pid_t pid : allPids(proc)) {
    std::optional<RunningApplication::Description> description =
        describe(::dirfd(proc), pid, user, bundles);
    if (description && wanted(*description)) {
      applications.push_back(RunningApplication::make(std::move(*description)));
    }
  }
  ::closedir(proc);
  return applications;
}

// The two ends of a pipe whose ends close at exec.
struct Pipe {
  std::array<int, 2> fds{-1, -1};
  bool open() { return ::pipe2(fds.data(), O_CLOEXEC) == 0; }
  void closeAll() {
    for (int& fd : fds) {
      if (fd >= 0) ::close(fd);
      fd = -1;
    }
  }
};

// Reads a whole value, or nothing when the other end closed first.
template <typename T>
bool readValue(int fd, T& value) {
  ssize_t count = 0;
  do {
    count = ::read(fd, &value, sizeof value);
  } while (count < 0 && errno == EINTR);
  return count == static_cast<ssize_t>(sizeof value);
}

// What a program started by the service must not inherit from it: signals
// it blocks or ignores (a program that cannot see SIGTERM could never be
// asked to quit) and its descriptors (a lock file held open by an
// application would stall the service). Only async-signal-safe calls: this
// runs between fork and exec.
void resetInheritedState() {
  sigset_t none;
  ::sigemptyset(&none);
  ::sigprocmask(SIG_SETMASK, &none, nullptr);
  struct sigaction standard {};
  standard.sa_handler = SIG_DFL;
  for (int signal = 1; signal < NSIG; ++signal) ::sigaction(signal, &standard, nullptr);
  // Nor its standard streams: an application's output is not the service's
  // log, and a pipe the service was started with must not stay open.
  int nothing = ::open("/dev/null", O_RDWR);
  if (nothing >= 0) {
    for (int stream = 0; stream <= 2; ++stream) ::dup2(nothing, stream);
    if (nothing > 2) ::close(nothing);
  }
#if defined(SYS_close_range) && defined(CLOSE_RANGE_CLOEXEC)
  ::syscall(SYS_close_range, 3U, ~0U, CLOSE_RANGE_CLOEXEC);
#endif
}

}  // namespace

std::shared_ptr<RunningApplication> RunningApplication::make(Description description) {
  return std::shared_ptr<RunningApplication>(new RunningApplication(std::move(description)));
}

RunningApplication::RunningApplication(Description description)
    : description_(std::move(description)) {
  if (description_.pid <= 0) {
    terminated_ = true;
    return;
  }
  pidFd_ = openPidFd(description_.pid);
  // The pidfd pins the process only from now on: make sure it is still the
  // one that was described, not a later one with the same pid.
  if (description_.startTicks != 0) {
    std::optional<ProcessStat> stat = readProcessStat(description_.pid);
    if (!stat || stat->startTicks != description_.startTicks) terminated_ = true;
  }
}

RunningApplication::~RunningApplication() {
  std::jthread watcher;
  {
    MutexLock lock(observersMutex_);
    watcher = std::move(watcher_);
  }
  if (watcher.joinable()) {
    // An observer may drop the last reference on the watcher thread itself.
    if (watcher.get_id() == std::this_thread::get_id()) {
      watcher.detach();
    } else {
      watcher.request_stop();
      watcher.join();
    }
  }
  if (pidFd_ >= 0) ::close(pidFd_);
}

std::shared_ptr<RunningApplication> RunningApplication::withPid(pid_t pid) {
  FileDescriptor proc(::open("/proc", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!proc.valid()) return nullptr;
  BundleCache bundles;
  std::optional<Description> description = describe(proc.get(), pid, ::getuid(), bundles);
  return description ? make(std::move(*description)) : nullptr;
}

std::vector<std::shared_ptr<RunningApplication>>
RunningApplication::runningApplicationsWithBundleIdentifier(std::string_view bundleIdentifier) {
  return scan([&](const Description& description) {
    return description.bundleIdentifier && *description.bundleIdentifier == bundleIdentifier;
  });
}

// A private platform root is a machine of its own: its applications are
// the bundles inside it or inside the user's home, so that a test or a demo
// that quits "every application" never reaches the processes of another
// one beside it, nor the desktop's.
std::vector<std::shared_ptr<RunningApplication>> RunningApplication::allRunningApplications() {
  const std::string root = Environment::platformRoot();
  if (root == "/") return scan([](const Description&) { return true; });
  const std::string home = Environment::homeDirectory();
  auto inside = [](std::string_view path, const std::string& folder) {
    return !folder.empty() && path.size() > folder.size() && path.starts_with(folder) &&
           path[folder.size()] == '/';
  };
  return scan([&](const Description& description) {
    return description.bundleURL &&
           (inside(*description.bundleURL, root) || inside(*description.bundleURL, home));
  });
}

Result<pid_t> RunningApplication::launchBundle(const std::string& bundlePath,
                                               const std::vector<std::string>& arguments) {
  std::optional<Bundle> bundle = Bundle::open(bundlePath);
  if (!bundle)
    return VendError::withDomain("RunningApplication", ENOENT, "No bundle at " + bundlePath);
  const std::string* executableName = bundle->infoValue("HostBundleExecutable").string();
  if (!executableName || executableName->empty() ||
      executableName->find('/') != std::string::npos) {
    return VendError::withDomain("RunningApplication", EINVAL,
                                 "The bundle at " + bundlePath + " names no executable");
  }
  std::string executable = bundlePath + "/bin/" + *executableName;
  if (::access(executable.c_str(), X_OK) != 0) {
    return VendError::withDomain("RunningApplication", errno, executable + " is not executable");
  }
  // Everything the children need is made before fork: after it, only
  // async-signal-safe calls are allowed.
  std::vector<std::string> argumentCopies = arguments;
  std::vector<char*> argv{executable.data()};
  for (std::string& argument : argumentCopies) argv.push_back(argument.data());
  argv.push_back(nullptr);
  Pipe pidPipe;
  Pipe execPipe;
  if (!pidPipe.open() || !execPipe.open()) {
    int error = errno;
    pidPipe.closeAll();
    execPipe.closeAll();
    return VendError::withDomain("RunningApplication", error, "No pipe for the launch");
  }
  pid_t child = ::fork();
  if (child < 0) {
    int error = errno;
    pidPipe.closeAll();
    execPipe.closeAll();
    return VendError::withDomain("RunningApplication", error, "fork failed");
  }
  if (child == 0) {
    // Double fork: the program is nobody's child here and leaves no zombie.
    ::setsid();
    pid_t program = ::fork();
    if (program == 0) {
      resetInheritedState();
      ::execve(argv[0], argv.data(), environ);
      int error = errno;
      (void)::write(execPipe.fds[1], &error, sizeof error);
      ::_exit(127);
    }
    (void)::write(pidPipe.fds[1], &program, sizeof program);
    ::_exit(program > 0 ? 0 : 1);
  }
  ::close(pidPipe.fds[1]);
  pidPipe.fds[1] = -1;
  ::close(execPipe.fds[1]);
  execPipe.fds[1] = -1;
  pid_t program = -1;
  bool gotPid = readValue(pidPipe.fds[0], program);
  int execError = 0;
  bool execFailed = readValue(execPipe.fds[0], execError);
  pidPipe.closeAll();
  execPipe.closeAll();
  int status = 0;
  while (::waitpid(child, &status, 0) < 0 && errno == EINTR) {
  }
  if (!gotPid || program <= 0) {
    return VendError::withDomain("RunningApplication", EAGAIN, "Could not start " + executable);
  }
  if (execFailed) {
    return VendError::withDomain("RunningApplication", execError,
                                 "Could not run " + executable + ": " + std::strerror(execError));
  }
  TILL_LOG(3, "%@: Started %@ as %@", kSpeaker, executable, program);
  return program;
}

std::string RunningApplication::description() const {
  return description_.localizedName.value_or("(unnamed)") + " (" +
         description_.bundleIdentifier.value_or("no identifier") + ", pid " +
         std::to_string(description_.pid) + ")";
}

std::string RunningApplication::displayNameOfBundle(const std::string& bundlePath) {
  return displayName(Bundle::open(bundlePath), bundlePath);
}

bool RunningApplication::isActive() const {
  return description_.bundleIdentifier &&
         RunningApplicationFacts::foremost() == description_.bundleIdentifier;
}

bool RunningApplication::quittingWillBeNoisyOrLoseData() const {
  return reasonThatQuittingWillBeNoisyOrLoseData().has_value();
}

std::optional<std::string> RunningApplication::reasonThatQuittingWillBeNoisyOrLoseData() const {
  if (!description_.bundleIdentifier) return std::nullopt;
  return RunningApplicationFacts::quittingLosesData(*description_.bundleIdentifier);
}

bool RunningApplication::isStoppedInApplicationRegistry() const {
  return description_.bundleIdentifier &&
         RunningApplicationFacts::isStopped(*description_.bundleIdentifier);
}

bool RunningApplication::isProxied() const {
  return description_.bundleIdentifier &&
         RunningApplicationFacts::isProxied(*description_.bundleIdentifier);
}

bool RunningApplication::processHasGone() const {
  std::optional<ProcessStat> stat = readProcessStat(description_.pid);
  if (!stat) return true;
  if (description_.startTicks != 0 && stat->startTicks != description_.startTicks) return true;
  return stat->state == 'Z' || stat->state == 'X';
}

bool RunningApplication::isTerminated() const {
  if (terminated_) return true;
  if (pidFd_ >= 0) {
    pollfd poller{pidFd_, POLLIN, 0};
    return ::poll(&poller, 1, 0) > 0;
  }
  return processHasGone();
}

RunningApplication::ObserverToken RunningApplication::addTerminationObserver(
    TerminationObserver observer) {
  MutexLock lock(observersMutex_);
  ObserverToken token = nextToken_++;
  if (notified_) return token;
  observers_.emplace(token, std::move(observer));
  if (!watcher_.joinable()) {
    watcher_ = std::jthread([this](const std::stop_token& stop) { watchTermination(stop); });
  }
  return token;
}

void RunningApplication::removeTerminationObserver(ObserverToken token) {
  MutexLock lock(observersMutex_);
  observers_.erase(token);
}

void RunningApplication::watchTermination(const std::stop_token& stop) {
  while (!stop.stop_requested()) {
    if (terminated_) break;
    if (pidFd_ >= 0) {
      pollfd poller{pidFd_, POLLIN, 0};
      int ready = ::poll(&poller, 1, static_cast<int>(kWatchInterval.count()));
      if (ready > 0) break;
      if (ready < 0 && errno != EINTR) {
        TILL_LOG(1, "%@: Cannot watch process %@: %@", kSpeaker, description_.pid,
                 std::strerror(errno));
        return;
      }
    } else {
      if (processHasGone()) break;
      std::this_thread::sleep_for(kWatchInterval);
    }
  }
  if (stop.stop_requested()) return;
  notifyTerminated();
  // Nothing of this object may be touched from here: the last reference
  // may have gone with the observers.
}

void RunningApplication::notifyTerminated() {
  terminated_ = true;
  std::shared_ptr<RunningApplication> self = weak_from_this().lock();
  std::vector<TerminationObserver> observers;
  {
    MutexLock lock(observersMutex_);
    if (notified_) return;
    notified_ = true;
    for (auto& [token, observer] : observers_) observers.push_back(observer);
  }
  if (!self) return;
  TILL_LOG(3, "%@: Process %@ of %@ has terminated", kSpeaker, description_.pid,
           description_.bundleIdentifier.value_or("(no identifier)"));
  for (const TerminationObserver& observer : observers) observer(self);
}

bool RunningApplication::sendSignal(int signal) {
  if (terminated_) return false;
  if (pidFd_ >= 0) return pidFdSendSignal(pidFd_, signal);
  if (processHasGone()) return false;
  return ::kill(description_.pid, signal) == 0;
}

bool RunningApplication::forceTerminate() {
  return sendSignal(SIGKILL);
}

bool RunningApplication::requestQuit() {
  return sendSignal(SIGTERM);
}

void RunningApplication::activateWithOptions(unsigned /*options*/) {}

Result<ApplicationSerialNumber> RunningApplication::applicationSerialNumber() const {
  if (description_.pid <= 0 || isTerminated()) {
    return VendError::withDomain("RunningApplication", ESRCH,
                                 "Process " + std::to_string(description_.pid) + " has gone");
  }
  auto value = static_cast<std::uint64_t>(description_.pid);
  return ApplicationSerialNumber{static_cast<std::uint32_t>(value >> 32U),
                                 static_cast<std::uint32_t>(value & 0xffffffffU)};
}

}  // namespace larder
