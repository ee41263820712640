#include "running-apps/PlugInHost.h"

#include <chrono>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/log/TillLogManager.h"
#include "platform/system/Bundle.h"
#include "platform/system/Uuid.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "PlugInHost";

PlatformStateFile stateFile() {
  return PlatformStateFile::named(PlugInHost::kFileName);
}

PlistArray busyEntries() {
  const PlistDictionary state = stateFile().readDictionary();
  auto busy = state.find("busy");
  if (busy == state.end() || !busy->second.array()) return {};
  return *busy->second.array();
}

// The answers come on threads of their own: callers wait for them in line,
// and may themselves run on the global queue.
DispatchQueue& answerQueue() {
  static const std::shared_ptr<DispatchQueue> queue =
      DispatchQueue::create("PlugInHost Answers", DispatchQueue::Kind::Concurrent);
  return *queue;
}

double now() {
  using namespace std::chrono;
  return duration<double>(system_clock::now().time_since_epoch()).count();
}

}  // namespace

void PlugInHost::holdPlugInsInApplication(std::string bundlePath, HoldHandler handler) {
  answerQueue().async([bundlePath = std::move(bundlePath), handler = std::move(handler)] {
    PlistArray blocking;
    for (const PlistValue& entry : busyEntries()) {
      const std::string* containingPath = entry[kContainingPathKey].string();
      if (containingPath && *containingPath == bundlePath) blocking.push_back(entry);
    }
    if (!blocking.empty()) {
      VendError error = VendError::withDomain(std::string(kErrorDomain), kBusyErrorCode,
                                              "Plug-ins of " + bundlePath + " are in use");
      error.userInfo[std::string(kErrorKeyBusyPlugIns)] = std::move(blocking);
      handler(nullptr, std::move(error));
      return;
    }
    auto hold = std::make_shared<PlugInHold>(Uuid::generateString(), bundlePath);
    bool stored = stateFile().updateDictionary([&](PlistDictionary& state) {
      PlistDictionary holds;
      if (const PlistDictionary* old = state["holds"].dictionary()) holds = *old;
      holds[hold->identifier()] =
          PlistDictionary{{"bundlePath", bundlePath}, {"date", PlistDate{now()}}};
      state["holds"] = std::move(holds);
    });
    if (!stored) TILL_LOG(1, "%@: Could not record the hold on %@", kSpeaker, bundlePath);
    handler(std::move(hold), std::nullopt);
  });
}

void PlugInHost::releaseHold(const std::shared_ptr<PlugInHold>& hold) {
  if (!hold) return;
  stateFile().updateDictionary([&](PlistDictionary& state) {
    if (PlistDictionary* holds = state["holds"].dictionary()) holds->erase(hold->identifier());
  });
}

PlistDictionary PlugInHost::informationForPlugInWithPid(pid_t pid) {
  for (const PlistValue& entry : busyEntries()) {
    if (entry[kServicePidKey].int64Value() == pid && entry.dictionary()) return *entry.dictionary();
  }
  return {};
}

std::optional<std::string> PlugInHost::extensionPointOfPlugIn(const std::string& plugInPath) {
  std::optional<Bundle> bundle = Bundle::open(plugInPath);
  if (!bundle) return std::nullopt;
  const std::string* point =
      bundle->infoValue("HostExtension")["HostExtensionPointIdentifier"].string();
  return point ? std::optional<std::string>(*point) : std::nullopt;
}

std::vector<std::string> PlugInHost::containingPathsOfBusyPlugIns() {
  std::vector<std::string> paths;
  for (const PlistValue& entry : busyEntries()) {
    const std::string* path = entry[kContainingPathKey].string();
    if (path && std::find(paths.begin(), paths.end(), *path) == paths.end()) paths.push_back(*path);
  }
  return paths;
}

bool PlugInHost::addBusyPlugIn(PlistDictionary entry) {
  return stateFile().updateDictionary([&](PlistDictionary& state) {
    PlistArray busy;
    if (const PlistArray* old = state["busy"].array()) busy = *old;
    busy.emplace_back(std::move(entry));
    state["busy"] = std::move(busy);
  });
}

bool PlugInHost::removeAllBusyPlugIns() {
  return stateFile().updateDictionary([](PlistDictionary& state) { state.erase("busy"); });
}

PlistDictionary PlugInHost::holds() {
  const PlistDictionary state = stateFile().readDictionary();
  auto holds = state.find("holds");
  if (holds == state.end() || !holds->second.dictionary()) return {};
  return *holds->second.dictionary();
}

}  // namespace larder
