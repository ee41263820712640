#include "store-runtime/host/LedgerQuaymartLauncher.h"

#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <optional>
#include <thread>

#include "platform/log/TillLogManager.h"
#include "platform/system/Environment.h"
#include "store-runtime/host/PlatformStateFile.h"

extern char** environ;  // NOLINT: the process environment, handed on to the child

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerQuaymartLauncher";

PlatformStateFile stateFile() {
  return PlatformStateFile::named("store-app.plist");
}

// Starts `program url`; a detached thread reaps it so that no zombie stays.
std::optional<pid_t> spawnStoreApplication(const std::string& program, const std::string& url) {
  std::string programArgument = program;
  std::string urlArgument = url;
  char* arguments[] = {programArgument.data(), urlArgument.data(), nullptr};
  pid_t pid = 0;
  int status = ::posix_spawn(&pid, program.c_str(), nullptr, nullptr, arguments, environ);
  if (status != 0) {
    TILL_LOG(1, "%@: Cannot start the store application %@: %@", kSpeaker, program,
             std::string(std::strerror(status)));
    return std::nullopt;
  }
  std::thread([pid] {
    int childStatus = 0;
    while (::waitpid(pid, &childStatus, 0) < 0 && errno == EINTR) {
    }
  }).detach();
  return pid;
}

void recordLaunch(std::string_view url, bool launched) {
  stateFile().updateDictionary([&](PlistDictionary& state) {
    PlistValue& launches = state["launches"];
    if (!launches.isArray()) launches = PlistArray{};
    PlistArray& list = *launches.array();
    list.push_back(PlistDictionary{{"url", PlistValue(url)},
                                   {"date", PlistValue(PlistDate::now())},
                                   {"launched", PlistValue(launched)}});
    if (list.size() > LedgerQuaymartLauncher::kRecordedLaunches) {
      list.erase(list.begin(),
                 list.begin() + static_cast<std::ptrdiff_t>(
                                    list.size() - LedgerQuaymartLauncher::kRecordedLaunches));
    }
  });
}

}  // namespace

LedgerQuaymartLauncher& LedgerQuaymartLauncher::sharedInstance() {
  static LedgerQuaymartLauncher instance;
  return instance;
}

std::string LedgerQuaymartLauncher::stateFilePath() {
  return stateFile().path();
}

bool LedgerQuaymartLauncher::launchQuaymartWithURL(std::string_view url) {
  TILL_LOG(2, "%@: Launching the store application with %@", kSpeaker, url);
  std::string program = Environment::variable("LARDER_STORE_APP");
  bool launched = false;
  bool ok = true;
  if (!program.empty()) {
    launched = spawnStoreApplication(program, std::string(url)).has_value();
    ok = launched;
  }
  recordLaunch(url, launched);
  return ok;
}

}  // namespace larder
