#include "notifications/activation/UserNotificationCenterDelegate.h"

#include <algorithm>
#include <cctype>
#include <utility>
#include <vector>

#include "notifications/catalogue/UpdateNotificationCatalogue.h"
#include "notifications/center/UserNotificationCenter.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/host/LedgerQuaymartLauncher.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "store-runtime/host/LedgerTraceMessage.h"
#include "store-runtime/host/LedgerTwilightAgent.h"
#include "store-runtime/host/VendManagedRestrictions.h"
#include "update-controller/UpdateController.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UserNotificationCenterDelegate";

// Sources that have rules of their own here and nowhere in the catalogue.
constexpr std::string_view kSourceInvitation = "OVP";
constexpr std::string_view kSourcePushFirstBuy = "PushFirstBuy";
constexpr std::string_view kSourceSilentCriticalUpdate = "SilentCriticalUpdate";

using Catalogue = UpdateNotificationCatalogue;

// What the notification's user info says about a key: missing keys and
// values of another type are false.
bool isTrue(const PlistValue& value) {
  return value.boolValue();
}
// The flags that must have been written as numbers (booleans count): a
// string that happens to read as a number does not turn them on.
bool isTrueNumber(const PlistValue& value) {
  return value.isNumber() && value.boolValue();
}

// A value that names something to open: a scheme, a colon and the rest,
// without white space. Anything else opens nothing.
std::optional<std::string> urlFrom(const PlistValue& value) {
  const std::string* text = value.string();
  if (!text) return std::nullopt;
  const std::size_t colon = text->find(':');
  if (colon == 0 || colon == std::string::npos || colon + 1 == text->size()) return std::nullopt;
  if (!std::isalpha(static_cast<unsigned char>((*text)[0]))) return std::nullopt;
  for (std::size_t index = 0; index < colon; ++index) {
    const auto c = static_cast<unsigned char>((*text)[index]);
    if (!std::isalnum(c) && c != '+' && c != '-' && c != '.') return std::nullopt;
  }
  if (std::ranges::any_of(*text,
                          [](char c) { return std::isspace(static_cast<unsigned char>(c)); }))
    return std::nullopt;
  return *text;
}

void openURL(std::string_view url) {
  LedgerQuaymartLauncher::sharedInstance().launchQuaymartWithURL(url);
}

bool isDelivered(const UserNotificationCenter& center, const UserNotification& notification) {
  return std::ranges::any_of(center.deliveredNotifications(), [&](const UserNotification& listed) {
    return listed.identifier == notification.identifier;
  });
}

// Two significant digits, as a number formatter gives them: the rest goes
// to zero, rounding half to even.
std::int64_t twoSignificantDigits(std::int64_t value) {
  if (value < 100) return value;
  std::int64_t unit = 1;
  while (value / unit >= 100) unit *= 10;
  std::int64_t kept = value / unit;
  const std::int64_t rest = value % unit;
  if (rest * 2 > unit || (rest * 2 == unit && kept % 2 == 1)) ++kept;
  return kept * unit;
}

// A wish that the user answered yes or no to the automatic update offer.
void traceOffer(std::string_view domain, bool accepted) {
  LedgerTraceMessage(domain, {{"result", accepted ? "pass" : "fail"}});
}

}  // namespace

// What every rule reads of one activation.
struct UserNotificationCenterDelegate::Activation {
  const UserNotification& notification;
  PlistValue userInfo;
  std::string source;
  // Null when the client is unknown: calls on it do nothing, the traces
  // still go out.
  std::shared_ptr<UpdateController> controller;

  [[nodiscard]] const PlistValue& operator[](std::string_view key) const { return userInfo[key]; }

  // Only logged: what the user acted on, for the record of a failure.
  void logAuditInfo() const {
    std::optional<PlistDictionary> audit;
    if (const std::string* key = userInfo["auditInfoCacheKey"].string(); key && controller) {
      audit = controller->cachedUpdateAuditInfoWithKey(*key);
    }
    TILL_LOG(1, "%@: Notification audit info is %@", kSpeaker,
             audit ? PlistValue(*audit) : PlistValue("(null)"));
  }

  // The first reaction to a delayed critical update starts its clock.
  void createCriticalUpdateTimeStampIfDelayed() const {
    if (!LedgerCriticalUpdateTimeStamp() && isTrueNumber(userInfo["CriticalUpdateDelayed"])) {
      LedgerCreateCriticalUpdateTimeStamp();
    }
  }

  [[nodiscard]] bool isFailure() const {
    return isTrue(userInfo["isDoItLaterFailure"]) || isTrue(userInfo["isAutoUpdateFailure"]) ||
           isTrue(userInfo["isPostLogoutUpdateFailure"]);
  }

  // The failure details of the audit the notification kept; without a key
  // the page opens all the same, with a token that finds nothing.
  void showFailureDetails() const {
    if (!controller) return;
    const std::string* key = userInfo["auditInfoCacheKey"].string();
    controller->launchQuaymartAndShowUpdateFailureWithAuditInfoCacheKey(key ? *key : "");
  }

  void clickTrace(std::string_view action, bool critical, bool intervalInSeconds = false) const {
    const auto now = std::chrono::system_clock::now();
    const std::int64_t interval = intervalInSeconds ? displayedIntervalInSeconds(notification, now)
                                                    : displayedIntervalInHours(notification, now);
    const PlistDictionary message{
        {"source", source},
        {"is_critical_update", critical},
        {"displayed_interval", interval},
        {"button_clicked",
         notification.activationType == UserNotification::kContentsClicked ? "false" : "true"},
        {"action_taken", std::string(action)},
    };
    TILL_LOG(3, "%@: Message tracing com.orvane.Quaymart.update_notification.clicked - %@",
             kSpeaker, PlistValue(message));
    LedgerTraceMessage(kClickTraceDomain, message);
  }
};

class UserNotificationCenterDelegate::Responder : public UserNotificationCenter::Delegate {
 public:
  explicit Responder(const UserNotificationCenterDelegate& owner) : owner_(owner) {}

  void didActivateNotification(UserNotificationCenter& center,
                               const UserNotification& notification) override {
    owner_.didActivateNotification(center, notification);
  }
  void didDismissAlert(UserNotificationCenter& center,
                       const UserNotification& notification) override {
    owner_.didDismissAlert(center, notification);
  }
  void didSnoozeAlert(UserNotificationCenter& center,
                      const UserNotification& notification) override {
    owner_.didSnoozeAlert(center, notification);
  }
  bool shouldPresentNotification(UserNotificationCenter& center,
                                 const UserNotification& notification) override {
    return owner_.shouldPresentNotification(center, notification);
  }

 private:
  const UserNotificationCenterDelegate& owner_;
};

// --- Making and starting ---

UserNotificationCenterDelegate::UserNotificationCenterDelegate(
    ControllerFinder finder, std::shared_ptr<UserNotificationCenter> applicationCenter)
    : finder_(std::move(finder)),
      applicationCenterForTesting_(std::move(applicationCenter)),
      responder_(std::make_shared<Responder>(*this)) {}

UserNotificationCenterDelegate::~UserNotificationCenterDelegate() = default;

UserNotificationCenterDelegate& UserNotificationCenterDelegate::sharedInstance() {
  static UserNotificationCenterDelegate instance(
      [](const VendStoreClient& storeClient) {
        return UpdateController::updateControllerForStoreClient(&storeClient);
      },
      nullptr);
  return instance;
}

std::unique_ptr<UserNotificationCenterDelegate> UserNotificationCenterDelegate::makeForTesting(
    ControllerFinder finder, std::shared_ptr<UserNotificationCenter> applicationCenter) {
  // The constructor is private; make_unique cannot reach it.
  return std::unique_ptr<UserNotificationCenterDelegate>(
      new UserNotificationCenterDelegate(std::move(finder), std::move(applicationCenter)));
}

void UserNotificationCenterDelegate::start() {
  if (started_.exchange(true)) return;
  attachTo(*applicationCenter());
  attachTo(*UserNotificationCenter::centerForIdentifier(
      std::string(UserNotificationCenter::kServiceIdentifier),
      UserNotificationCenter::kSystemCenter));
  TILL_LOG(3, "%@: started", kSpeaker);
}

void UserNotificationCenterDelegate::attachTo(UserNotificationCenter& center) {
  center.setDelegate(responder_);
}

std::shared_ptr<UserNotificationCenter> UserNotificationCenterDelegate::applicationCenter() const {
  if (applicationCenterForTesting_) return applicationCenterForTesting_;
  return UserNotificationCenter::centerForIdentifier(std::string(kApplicationIdentifier),
                                                     UserNotificationCenter::kApplicationCenter);
}

// --- Finding the controller again ---

std::optional<VendStoreClient> UserNotificationCenterDelegate::storeClientForNotification(
    const UserNotification& notification) {
  const PlistValue info(notification.userInfo);
  const std::string* identifier = info["storeClientIdentifier"].string();
  if (!identifier) return std::nullopt;
  return VendStoreClient::knownClientWithIdentifier(
      *identifier, info["storeClientFrameworkVersion"].int64Value());
}

std::shared_ptr<UpdateController> UserNotificationCenterDelegate::updateControllerForNotification(
    const UserNotification& notification) const {
  const std::optional<VendStoreClient> client = storeClientForNotification(notification);
  if (!client) return nullptr;
  return finder_(*client);
}

// --- Displayed interval ---

std::int64_t UserNotificationCenterDelegate::displayedIntervalInSeconds(
    const UserNotification& notification, std::chrono::system_clock::time_point now) {
  if (!notification.actualDeliveryDate) return 0;
  return std::chrono::duration_cast<std::chrono::seconds>(now - *notification.actualDeliveryDate)
      .count();
}

std::int64_t UserNotificationCenterDelegate::displayedIntervalInHours(
    const UserNotification& notification, std::chrono::system_clock::time_point now) {
  return twoSignificantDigits(displayedIntervalInSeconds(notification, now) / 3600);
}

// --- Presenting and snoozing ---

bool UserNotificationCenterDelegate::shouldPresentNotification(
    UserNotificationCenter& /*center*/, const UserNotification& notification) const {
  return !(notification.source() == Catalogue::kSourceAppUpdate &&
           VendManagedRestrictions::isRestrictedTo(
               LedgerRestrictStoreToDisableSoftwareUpdateNotifications));
}

// Only the restart countdown comes back: a restart must not slip by unseen.
void UserNotificationCenterDelegate::didSnoozeAlert(UserNotificationCenter& center,
                                                    const UserNotification& notification) const {
  TILL_LOG(2, "%@: Got didSnoozeAlert for notification: %@", kSpeaker, notification.identifier);
  if (!isTrue(PlistValue(notification.userInfo)["isRestartCountdown"])) return;
  TILL_LOG(2, "%@: Snoozed restart countdown %@ delivered again", kSpeaker,
           notification.identifier);
  // Delivered again under a new identifier: the snoozed record must not
  // stay beside it.
  center.removeDeliveredNotification(notification);
  center.deliverNotification(notification);
}

// --- Activation ---

void UserNotificationCenterDelegate::didActivateNotification(
    UserNotificationCenter& center, const UserNotification& notification) const {
  TILL_LOG(1,
           "%@: Got didActivateNotification for notification: %@ with userInfo: %@ and activation "
           "type %ld",
           kSpeaker, notification.identifier, PlistValue(notification.userInfo),
           notification.activationType);
  const std::string source = notification.source();
  // The countdown's buttons answer the deferred-install agent; a click on
  // its contents answers nothing.
  if (source == Catalogue::kSourceRestartCountdown) {
    if (std::optional<std::int64_t> answer =
            Catalogue::restartCountdownAnswer(notification, false)) {
      LedgerTwilightAgent::answerRestartCountdown(*answer);
    }
    return;
  }
  const bool contentsClick = notification.activationType == UserNotification::kContentsClicked;
  if (source == kSourceInvitation) {
    TILL_LOG(1,
             "%@: No organisation invitation handling in this service; activation of %@ not "
             "acted on",
             kSpeaker, notification.identifier);
    return;
  }
  if (source == Catalogue::kSourceClaimedButNotDownloaded) {
    openURL(kPurchasesPageURL);
    if (contentsClick) center.removeDisplayedNotification(notification);
    return;
  }
  if (source == Catalogue::kSourceCriticalPostInstall ||
      source == Catalogue::kSourceAdminInstalled) {
    if (std::optional<std::string> url = urlFrom(PlistValue(notification.userInfo)["URL"])) {
      openURL(*url);
    }
    if (contentsClick) center.removeDisplayedNotification(notification);
    return;
  }
  const Activation activation{notification, PlistValue(notification.userInfo), source,
                              updateControllerForNotification(notification)};
  if (source == Catalogue::kSourceMajorOSUpdate) {
    if (activation.controller)
      activation.controller->didActivateMajorOSUpdateNotification(notification);
    if (contentsClick) center.removeDisplayedNotification(notification);
    return;
  }
  if (notification.activationType == UserNotification::kActionButtonClicked) {
    activateByMainButton(center, activation);
    center.removeDeliveredNotification(notification);
  } else if (contentsClick) {
    activateByContentsClick(center, activation);
  }
}

void UserNotificationCenterDelegate::activateByMainButton(UserNotificationCenter& center,
                                                          const Activation& activation) const {
  const std::string& source = activation.source;
  const std::shared_ptr<UpdateController>& controller = activation.controller;
  if (source == Catalogue::kSourceAppUpdate) {
    activateAppUpdateButton(center, activation);
  } else if (source == kSourceSilentCriticalUpdate) {
    if (std::optional<std::string> url = urlFrom(activation["URL"])) openURL(*url);
  } else if (source == Catalogue::kSourceCriticalInstallNow) {
    if (controller) controller->installAvailableCriticalUpdates();
    activation.clickTrace("InstallCriticalUpdates", isTrue(activation["CriticalUpdate"]));
  } else if (source == Catalogue::kSourceAutoUpdateOptIn) {
    if (controller) controller->setAutoUpdateEnabled(true);
    traceOffer(kOptInTraceDomain, true);
  } else if (source == Catalogue::kSourceRestartRequiredOptIn) {
    if (controller) {
      controller->setAutoUpdateEnabled(true);
      controller->setAutoUpdateOfRestartRequiredUpdatesEnabled(true);
    }
    traceOffer(kRestartRequiredOptInTraceDomain, true);
  } else if (source == Catalogue::kSourceLaterSuccess) {
    openURL(kUpdatesPageURL);
  } else if (source != kSourcePushFirstBuy) {
    TILL_LOG(3, "%@: The main button of %@ (source \"%@\") does nothing", kSpeaker,
             activation.notification.identifier, source);
  }
}

// The main button of an updates notification, or an entry of its menu. The
// menu comes in two forms: the later options alone (the button itself then
// means "later"), or led by "install now" (the button installs).
void UserNotificationCenterDelegate::activateAppUpdateButton(UserNotificationCenter& /*center*/,
                                                             const Activation& activation) const {
  const UserNotification& notification = activation.notification;
  UpdateController* controller = activation.controller.get();
  const bool critical = isTrue(activation["CriticalUpdate"]);
  activation.logAuditInfo();
  activation.createCriticalUpdateTimeStampIfDelayed();
  if (isTrueNumber(activation["CriticalUpdate"])) {
    if (controller) controller->installAvailableCriticalUpdates();
    activation.clickTrace("InstallCriticalUpdates", critical);
    return;
  }

  const bool includesInstallNow = isTrue(activation["alternateActionsIncludeInstallNow"]);
  const bool hasMenu = !notification.alternateActionButtonTitles.empty();
  const std::int64_t chosen = notification.alternateActionIndex;
  const bool entryChosen = chosen != 0 && chosen != UserNotification::kNoAlternateAction;
  const bool menuChoice = (!includesInstallNow && hasMenu) || (includesInstallNow && entryChosen) ||
                          (!includesInstallNow && !hasMenu && entryChosen);

  std::string_view action;
  if (!menuChoice) {
    if (!hasMenu && isTrue(activation["actionButtonIsRemindMe"])) {
      if (controller) {
        controller->installAvailableUpdatesLaterWithMode(UpdateController::kLaterRemindTomorrow);
      }
      action = "DoItLater-RemindMe";
    } else {
      if (controller) controller->installAllAvailableUpdates();
      action = "InstallUpdates";
    }
  } else {
    // 0 stands for the first later option in both forms of the menu.
    const std::int64_t option = includesInstallNow ? chosen - 1 : chosen;
    std::optional<std::int64_t> mode;
    switch (option) {
      case 0:
        mode = UpdateController::kLaterInAnHour;
        action = "DoItLater-1Hour";
        break;
      case 1:
        mode = UpdateController::kLaterTonight;
        action = "DoItLater-Overnight";
        break;
      case 2:
        mode = UpdateController::kLaterRemindTomorrow;
        action = "DoItLater-RemindMe";
        break;
      case 3:
        // Whatever its text says, the fourth entry only switches automatic
        // updates on: no install, and no question about what was answered.
        if (controller) controller->setAutoUpdateEnabled(true);
        activation.clickTrace("DoItLater-EnableAutoUpdate", critical);
        return;
      default:
        mode = UpdateController::kLaterTonight;
        action = "DoItLater";
        break;
    }
    if (controller) controller->installAvailableUpdatesLaterWithMode(*mode);
  }
  if (controller && controller->shouldPromptForAutoUpdateOptIn()) {
    controller->promptUserToOptInForAutoUpdateWithShowNotification(true);
  }
  activation.clickTrace(action, critical);
}

void UserNotificationCenterDelegate::activateByContentsClick(UserNotificationCenter& center,
                                                             const Activation& activation) const {
  const UserNotification& notification = activation.notification;
  const std::string& source = activation.source;
  if (source == kSourceSilentCriticalUpdate && !activation["URL"].isNull()) {
    if (std::optional<std::string> url = urlFrom(activation["URL"])) openURL(*url);
    center.removeDisplayedNotification(notification);
    return;
  }
  if (source == Catalogue::kSourceLaterSuccess || source == Catalogue::kSourceLaterHelper) {
    center.removeDisplayedNotification(notification);
    return;
  }
  if (source == Catalogue::kSourceAppUpdate &&
      (isTrue(activation["CriticalUpdate"]) || isDelivered(center, notification))) {
    activation.createCriticalUpdateTimeStampIfDelayed();
  }
  activation.logAuditInfo();
  std::string_view action;
  if (activation.isFailure()) {
    activation.showFailureDetails();
    action = "LaunchToUpdateFailureDetails";
  } else {
    openURL(kUpdatesPageURL);
    action = "LaunchToUpdates";
  }
  activation.clickTrace(action, isTrue(activation["CriticalUpdate"]));
  // A notification whose one button installs stays until that button is used.
  if (!isTrue(activation["InstallOnDismiss"])) center.removeDisplayedNotification(notification);
}

// --- The second button ---

void UserNotificationCenterDelegate::didDismissAlert(UserNotificationCenter& center,
                                                     const UserNotification& notification) const {
  TILL_LOG(1, "%@: Got didDismissAlert for notification: %@ with userInfo: %@", kSpeaker,
           notification.identifier, PlistValue(notification.userInfo));
  const std::string source = notification.source();
  if (source == Catalogue::kSourceRestartCountdown) {
    if (std::optional<std::int64_t> answer =
            Catalogue::restartCountdownAnswer(notification, true)) {
      LedgerTwilightAgent::answerRestartCountdown(*answer);
    }
    return;
  }
  const Activation activation{notification, PlistValue(notification.userInfo), source,
                              updateControllerForNotification(notification)};
  if (source == Catalogue::kSourceAppUpdate) {
    dismissAppUpdate(center, activation);
  } else if (source == Catalogue::kSourceCriticalInstallNow) {
    if (!isTrue(activation["InstallOnDismiss"])) return;
    if (activation.controller) activation.controller->installAvailableCriticalUpdates();
    // Here the time on screen is told to the second.
    activation.clickTrace("InstallCriticalUpdates", isTrue(activation["CriticalUpdate"]), true);
  } else if (source == kSourceInvitation) {
    TILL_LOG(1,
             "%@: No organisation invitation handling in this service; dismissal of %@ not "
             "acted on",
             kSpeaker, notification.identifier);
  } else if (source == Catalogue::kSourceAutoUpdateOptIn) {
    traceOffer(kOptInTraceDomain, false);
  } else if (source == Catalogue::kSourceRestartRequiredOptIn) {
    traceOffer(kRestartRequiredOptInTraceDomain, false);
  } else if (source == Catalogue::kSourceClaimedButNotDownloaded) {
    keepInApplicationList(notification);
  } else if (source == Catalogue::kSourceMajorOSUpdate) {
    if (activation.controller)
      activation.controller->didDismissMajorOSUpdateNotification(notification);
  } else {
    std::vector<UserNotification> delivered = center.deliveredNotifications();
    std::erase_if(delivered, [&](const UserNotification& listed) {
      return listed.identifier == notification.identifier;
    });
    center.setDeliveredNotifications(std::move(delivered));
  }
}

void UserNotificationCenterDelegate::dismissAppUpdate(UserNotificationCenter& center,
                                                      const Activation& activation) const {
  const UserNotification& notification = activation.notification;
  const bool critical = isTrue(activation["CriticalUpdate"]);
  if (!critical && !isDelivered(center, notification)) {
    // The alert was on screen and its second button acted.
    activation.logAuditInfo();
    if (!isTrue(activation["OtherButtonIsDetails"])) {
      // The second button was the install button.
      UpdateController* controller = activation.controller.get();
      if (controller && controller->shouldPromptForAutoUpdateOptIn()) {
        controller->promptUserToOptInForAutoUpdateWithShowNotification(true);
      }
      if (controller) controller->installAllAvailableUpdates();
      center.removeDeliveredNotification(notification);
      activation.clickTrace("InstallUpdates", false);
      return;
    }
    if (activation.isFailure()) {
      activation.showFailureDetails();
      activation.clickTrace("LaunchToUpdateFailureDetails", false);
    } else {
      openURL(kUpdatesPageURL);
      activation.clickTrace("LaunchToUpdates", false);
    }
  } else {
    activation.createCriticalUpdateTimeStampIfDelayed();
    openURL(kUpdatesPageURL);
    activation.clickTrace("LaunchToUpdates", critical);
  }
  keepInApplicationList(notification);
}

void UserNotificationCenterDelegate::keepInApplicationList(
    const UserNotification& notification) const {
  UserNotification kept = notification;
  kept.clearable = true;
  // That list is never shown on the desktop.
  kept.displayed = false;
  kept.serverIdentifier = 0;
  applicationCenter()->setDeliveredNotifications({std::move(kept)});
}

}  // namespace larder
