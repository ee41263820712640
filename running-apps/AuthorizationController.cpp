#include "running-apps/AuthorizationController.h"

#include <unistd.h>

#include "platform/log/TillLogManager.h"
#include "store-runtime/host/LedgerAuthorizationService.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "store-runtime/host/VendManagedRestrictions.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "AuthorizationController";
constexpr uid_t kGuestUserID = 201;

const std::vector<std::string> kInstallRights = {"system.install.quaymart-software",
                                                 "system.install.orvane-software",
                                                 "system.install.software.mdm-provided"};
const std::vector<std::string> kStandardUserRights = {
    "system.install.quaymart-software.standard-user",
    "system.install.orvane-software.standard-user"};
const std::vector<std::string> kInteractiveRights = {"system.install.software"};

bool isGuestUser() {
  return ::getuid() == kGuestUserID || LedgerCurrentUserIsGuestUser();
}

}  // namespace

AuthorizationController& AuthorizationController::sharedInstance() {
  static AuthorizationController controller;
  return controller;
}

bool AuthorizationController::hasAuthorization() const {
  MutexLock lock(authLock_);
  return authorization_.has_value();
}

bool AuthorizationController::authorizeForSoftwareInstall() {
  if (LedgerOnRecoveryPartition()) return true;
  MutexLock lock(authLock_);
  if (authorization_) return true;
  if (!attemptNonInteractiveAuthorization() && !attemptInteractiveAuthorization()) {
    TILL_LOG(1, "%@: Unable to get authorization for software install", kSpeaker);
  }
  if (authorization_) {
    // This platform has no package installer of its own to register with
    // yet; the system update framework is the one installer there is.
    TILL_LOG(1, "%@: authorizing CrateInstallClient and SysupQuaymartUpdateController", kSpeaker);
    SysupQuaymartUpdateController::sharedUpdateController().setAuthorization(*authorization_);
  }
  return authorization_.has_value();
}

bool AuthorizationController::interactiveAuthRequiredForSoftwareInstall() {
  if (LedgerOnRecoveryPartition()) return false;
  MutexLock lock(authLock_);
  return !attemptNonInteractiveAuthorization();
}

bool AuthorizationController::allowSoftwareInstallForNonAdminUser() {
  if (isGuestUser()) {
    TILL_LOG(1, "%@: Requiring admin authorization for software install from guest user", kSpeaker);
    return false;
  }
  if (VendManagedRestrictions::isRestrictedTo(
          LedgerRestrictStoreToRequireAdminForSoftwareInstall)) {
    TILL_LOG(1, "%@: Requiring admin authorization for software install by managed preference",
             kSpeaker);
    return false;
  }
  return true;
}

bool AuthorizationController::ask(const std::vector<std::string>& rights, bool interactive,
                                  const char* successLog) {
  std::int32_t status = LedgerAuthorizationService::copyRights(rights, interactive);
  if (status != LedgerAuthorizationService::kGranted) {
    lastStatus_ = status;
    return false;
  }
  TILL_LOG(1, successLog, kSpeaker);
  authorization_ = rights;
  return true;
}

bool AuthorizationController::attemptNonInteractiveAuthorization() {
  if (authorization_) return true;
  if (ask(kInstallRights, false, "%@: Non-interactive authorization succeeded")) return true;
  if (allowSoftwareInstallForNonAdminUser()) {
    return attemptNonInteractiveAuthorizationForNonAdminUser();
  }
  TILL_LOG(1, "%@: pantryd was not able to get non-interactive authorization", kSpeaker);
  return false;
}

bool AuthorizationController::attemptNonInteractiveAuthorizationForNonAdminUser() {
  if (authorization_) return true;
  if (ask(kStandardUserRights, false,
          "%@: Non-interactive authorization succeeded for non-admin user")) {
    return true;
  }
  TILL_LOG(1,
           "%@: pantryd was not able to get non-interactive authorization for non-admin user "
           "(%i)",
           kSpeaker, lastStatus_);
  return false;
}

bool AuthorizationController::attemptInteractiveAuthorization() {
  if (authorization_) return true;
  if (ask(kInteractiveRights, true,
          "%@: Interactive authorization for software install was successful")) {
    return true;
  }
  TILL_LOG(1, "%@: Authorization failed with status %@", kSpeaker, lastStatus_);
  return false;
}

}  // namespace larder
