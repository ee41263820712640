#include "store-runtime/host/LedgerAuthorizationService.h"

#include <sdbus-c++/sdbus-c++.h>
#include <algorithm>
#include <memory>

#include "platform/log/TillLogManager.h"
#include "platform/system/Environment.h"
#include "platform/system/Mutex.h"
#include "store-runtime/host/PlatformStateFile.h"
#include "store-runtime/host/PolkitAuthority.h"
#include "store-runtime/host/VendManagedRestrictions.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerAuthorizationService";
constexpr std::string_view kFileName = "authorization.plist";
constexpr std::string_view kStandardUserSuffix = ".standard-user";

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

std::int32_t copySimulatedRights(const std::vector<std::string>& rights, bool interactionAllowed) {
  std::int32_t status = LedgerAuthorizationService::kDenied;
  PlatformStateFile(LedgerAuthorizationService::stateFilePath())
      .updateDictionary([&](PlistDictionary& state) {
        PlistArray names(rights.begin(), rights.end());
        PlistValue& requests = state["requests"];
        if (!requests.array()) requests = PlistArray{};
        requests.array()->push_back(
            PlistDictionary{{"rights", names}, {"interactive", interactionAllowed}});
        bool quiet = std::ranges::all_of(
            rights, [&](const std::string& right) { return isGranted(state, right); });
        if (quiet) {
          status = LedgerAuthorizationService::kGranted;
        } else if (interactionAllowed) {
          auto answer = state.find("interactiveGrant");
          bool granted =
              answer != state.end() && answer->second.isBoolean() && answer->second.boolValue();
          status = granted ? LedgerAuthorizationService::kGranted
                           : LedgerAuthorizationService::kCanceled;
        }
      });
  return status;
}

bool isStandardUserRight(std::string_view right) {
  return right.ends_with(kStandardUserSuffix);
}

// The administrator's restriction leaves a standard user only the rights a
// person with a password grants.
bool restrictionDenies(const std::vector<std::string>& rights) {
  return std::ranges::any_of(rights, isStandardUserRight) &&
         VendManagedRestrictions::isRestrictedTo(
             LedgerRestrictStoreToRequireAdminForSoftwareInstall);
}

// The test switch needs an explicit bus: without one it would reach the
// machine's polkit from a test tree.
bool polkitSelectedForTests() {
  return Environment::variable(LedgerAuthorizationService::kPolkitSwitchVariable) == "1" &&
         !Environment::variable("DBUS_SYSTEM_BUS_ADDRESS").empty();
}

std::unique_ptr<PolkitAuthority> chooseAuthority() {
  if (Environment::platformRoot() != "/" && !polkitSelectedForTests()) return nullptr;
  try {
    std::unique_ptr<sdbus::IConnection> connection = sdbus::createSystemBusConnection();
    if (!PolkitAuthority::isPresent(*connection)) return nullptr;
    return std::make_unique<PolkitAuthority>(std::move(connection));
  } catch (const sdbus::Error& error) {
    TILL_LOG(2, "%@: No system bus (%@)", kSpeaker, error.getMessage());
    return nullptr;
  }
}

// The backend the process chose at its first request. Its connection is
// used by one caller at a time.
class ProcessAuthority {
 public:
  static ProcessAuthority& shared() {
    static ProcessAuthority instance;
    return instance;
  }

  LedgerAuthorizationService::Backend backend() const {
    return polkit_ ? LedgerAuthorizationService::Backend::kPolkit
                   : LedgerAuthorizationService::Backend::kSimulated;
  }

  std::int32_t copyRights(const std::vector<std::string>& rights, bool interactionAllowed) {
    if (!polkit_) return copySimulatedRights(rights, interactionAllowed);
    MutexLock lock(mutex_);
    return LedgerAuthorizationService::copyRightsFromPolkit(*polkit_, rights, interactionAllowed);
  }

 private:
  ProcessAuthority() : polkit_(chooseAuthority()) {
    TILL_LOG(2, "%@: Authorization through %@", kSpeaker,
             polkit_ ? "polkit" : "the simulated authority");
  }

  Mutex mutex_;
  const std::unique_ptr<PolkitAuthority> polkit_ PT_GUARDED_BY(mutex_);
};

}  // namespace

std::string LedgerAuthorizationService::stateFilePath() {
  return PlatformStateFile::pathForName(kFileName);
}

std::string_view LedgerAuthorizationService::polkitActionForRight(std::string_view right) {
  return isStandardUserRight(right) ? kStandardUserInstallAction : kInstallAction;
}

LedgerAuthorizationService::Backend LedgerAuthorizationService::chooseBackend() {
  return chooseAuthority() ? Backend::kPolkit : Backend::kSimulated;
}

LedgerAuthorizationService::Backend LedgerAuthorizationService::processBackend() {
  return ProcessAuthority::shared().backend();
}

std::int32_t LedgerAuthorizationService::copyRights(const std::vector<std::string>& rights,
                                                    bool interactionAllowed) {
  if (restrictionDenies(rights)) {
    TILL_LOG(2, "%@: The standard user's rights are restricted to administrators", kSpeaker);
    return kDenied;
  }
  return ProcessAuthority::shared().copyRights(rights, interactionAllowed);
}

std::int32_t LedgerAuthorizationService::copyRightsFromPolkit(
    PolkitAuthority& authority, const std::vector<std::string>& rights, bool interactionAllowed) {
  std::vector<std::string_view> actions;
  for (const std::string& right : rights) {
    std::string_view action = polkitActionForRight(right);
    if (std::ranges::find(actions, action) == actions.end()) actions.push_back(action);
  }
  for (std::string_view action : actions) {
    Result<PolkitAuthority::Answer> answer =
        authority.checkAuthorization(std::string(action), interactionAllowed);
    if (!answer) {
      TILL_LOG(1, "%@: %@", kSpeaker, answer.error().descriptionText());
      return kInternalError;
    }
    if (!answer->authorized) {
      TILL_LOG(2, "%@: polkit did not authorize %@%@", kSpeaker, action,
               answer->dismissed ? " (dismissed)" : "");
      return answer->dismissed ? kCanceled : kDenied;
    }
  }
  return kGranted;
}

}  // namespace larder
