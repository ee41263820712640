#include "store-runtime/host/LedgerAuthorizationService.h"

#include <algorithm>

#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kFileName = "authorization.plist";

// Everything but the right that needs a person to agree.
bool isDefaultGrant(const std::string& right) {
  return right != "system.install.software";
}

bool isGranted(const PlistDictionary& state, const std::string& right) {
  auto found = state.find("grantedRights");
  if (found == state.end() || !found->second.array()) return isDefaultGrant(right);
  const PlistArray& granted = *found->second.array();
  return std::ranges::any_of(
      granted, [&](const PlistValue& entry) { return entry.string() && *entry.string() == right; });
}

}  // namespace

std::string LedgerAuthorizationService::stateFilePath() {
  return PlatformStateFile::pathForName(kFileName);
}

std::int32_t LedgerAuthorizationService::copyRights(const std::vector<std::string>& rights,
                                                    bool interactionAllowed) {
  std::int32_t status = kDenied;
  PlatformStateFile(stateFilePath()).updateDictionary([&](PlistDictionary& state) {
    PlistArray names(rights.begin(), rights.end());
    PlistValue& requests = state["requests"];
    if (!requests.array()) requests = PlistArray{};
    requests.array()->push_back(
        PlistDictionary{{"rights", names}, {"interactive", interactionAllowed}});
    bool quiet = std::ranges::all_of(
        rights, [&](const std::string& right) { return isGranted(state, right); });
    if (quiet) {
      status = kGranted;
    } else if (interactionAllowed) {
      auto answer = state.find("interactiveGrant");
      bool granted =
          answer != state.end() && answer->second.isBoolean() && answer->second.boolValue();
      status = granted ? kGranted : kCanceled;
    }
  });
  return status;
}

}  // namespace larder
