#include "store-runtime/dialogs/LocalizedStringTable.h"

#include <algorithm>
#include <array>

namespace larder {

namespace {

using Entry = LocalizedStringEntry;

// Keep sorted by key: the static_assert below checks it at compile time.
constexpr std::array kTradelineStrings = {
    Entry{"AC_POWER_CANCEL_BUTTON", "Cancel"},
    Entry{"AC_POWER_CONTINUE_BUTTON", "Continue"},
    Entry{"AC_POWER_MESSAGE", "Your computer is running on battery power."},
    Entry{"AC_POWER_TITLE",
          "Connect your computer to power before installing updates. If the battery runs out "
          "during the install, the updates may not finish."},
    Entry{"ADMIN_INSTALLED_POST_LOGOUT_UPDATES_POSTINSTALL_NOTIFICATION_TEXT",
          "Your administrator has installed updates that finish installing when you restart."},
    Entry{"ADMIN_INSTALLED_POST_LOGOUT_UPDATES_POSTINSTALL_NOTIFICATION_TITLE", "Restart Required"},
    Entry{"ADMIN_INSTALLED_POST_LOGOUT_UPDATE_POSTINSTALL_NOTIFICATION_TEXT",
          "Your administrator has installed an update that finishes installing when you "
          "restart."},
    Entry{"ADMIN_INSTALLED_POST_LOGOUT_UPDATE_POSTINSTALL_NOTIFICATION_TITLE", "Restart Required"},
    Entry{"ADMIN_INSTALLED_UPDATES_POSTINSTALL_NOTIFICATION_TEXT",
          "Your administrator has installed updates on this computer."},
    Entry{"ADMIN_INSTALLED_UPDATES_POSTINSTALL_NOTIFICATION_TITLE", "Updates Installed"},
    Entry{"ADMIN_INSTALLED_UPDATE_POSTINSTALL_NOTIFICATION_TEXT",
          "Your administrator has installed an update on this computer."},
    Entry{"ADMIN_INSTALLED_UPDATE_POSTINSTALL_NOTIFICATION_TITLE", "Update Installed"},
    Entry{"AUTOUPDATE_OPTIN_BODY",
          "New updates for your apps will be downloaded and installed automatically."},
    Entry{"AUTOUPDATE_OPTIN_CANCEL", "Not Now"},
    Entry{"AUTOUPDATE_OPTIN_NOTIFICATION_BODY",
          "Updates for your apps can be installed automatically overnight."},
    Entry{"AUTOUPDATE_OPTIN_NOTIFICATION_CLOSE", "Not Now"},
    Entry{"AUTOUPDATE_OPTIN_NOTIFICATION_ENABLE", "Turn On"},
    Entry{"AUTOUPDATE_OPTIN_NOTIFICATION_TITLE", "Turn On Automatic Updates?"},
    Entry{"AUTOUPDATE_OPTIN_OK", "Turn On"},
    Entry{"AUTOUPDATE_OPTIN_TITLE", "Do you want to turn on automatic updates?"},
    Entry{"AUTOUPDATE_POSTUPDATE_NOTIFICATION_TEXT_MULTIPLE_AND", " and "},
    Entry{"AUTOUPDATE_POSTUPDATE_NOTIFICATION_TEXT_MULTIPLE_AND_OTHERS", "and others"},
    Entry{"AUTOUPDATE_POSTUPDATE_NOTIFICATION_TEXT_MULTIPLE_WERE_UPDATED",
          "were updated automatically."},
    Entry{"AUTOUPDATE_POSTUPDATE_NOTIFICATION_TEXT_SINGLE", "The app was updated automatically."},
    Entry{"AUTOUPDATE_POSTUPDATE_NOTIFICATION_TITLE_MULTIPLE", "%@ Apps Updated"},
    Entry{"AUTOUPDATE_POSTUPDATE_NOTIFICATION_TITLE_SINGLE", "%@ Updated"},
    Entry{"AUTOUPDATE_RESTARTREQUIRED_OPTIN_NOTIFICATION_BODY",
          "Updates that need a restart can be installed overnight while the computer is not in "
          "use."},
    Entry{"AUTOUPDATE_RESTARTREQUIRED_OPTIN_NOTIFICATION_CLOSE", "Not Now"},
    Entry{"AUTOUPDATE_RESTARTREQUIRED_OPTIN_NOTIFICATION_ENABLE", "Turn On"},
    Entry{"AUTOUPDATE_RESTARTREQUIRED_OPTIN_NOTIFICATION_TITLE",
          "Install System Updates Automatically?"},
    Entry{"CANCEL", "Cancel"},
    Entry{"CANNOT_UPDATE_BODY",
          "%@ can't be updated right now because one of its extensions is in use by %@. Quit "
          "that application and try again."},
    Entry{"CANNOT_UPDATE_BODY_MULTIPLE",
          "%@ can't be updated right now because its extensions are in use by these "
          "applications:"},
    Entry{"CANNOT_UPDATE_DEFAULT_BUTTON", "OK"},
    Entry{"CANNOT_UPDATE_TITLE", "%@ Can't Be Updated"},
    Entry{"CONFIRM_RESTART_MESSAGE",
          "Your computer will restart to finish installing the updates. Save your work before "
          "you continue."},
    Entry{"CONFIRM_RESTART_MESSAGE_DOWNLOAD",
          "The updates will be downloaded first, and your computer will then restart to install "
          "them. Save your work before you continue."},
    Entry{"CONFIRM_RESTART_NOT_NOW_BUTTON", "Not Now"},
    Entry{"CONFIRM_RESTART_NOT_NOW_BUTTON_DOWNLOAD", "Not Now"},
    Entry{"CONFIRM_RESTART_RESTART_BUTTON", "Restart"},
    Entry{"CONFIRM_RESTART_RESTART_BUTTON_DOWNLOAD", "Download & Restart"},
    Entry{"CONFIRM_RESTART_TITLE", "Restart to Install Updates?"},
    Entry{"CONFIRM_RESTART_TITLE_DOWNLOAD", "Download and Restart to Install Updates?"},
    Entry{"CRITICAL_UPDATES_INSTALL_NOW_RESTART_TEXT",
          "Important security updates will be installed now, and your computer will restart."},
    Entry{"CRITICAL_UPDATES_INSTALL_NOW_TEXT", "Important security updates will be installed now."},
    Entry{"CRITICAL_UPDATES_INSTALL_NOW_TITLE", "Installing Important Updates"},
    Entry{"CRITICAL_UPDATES_NOTIFICATION_TEXT", "Important security updates are ready to install."},
    Entry{"CRITICAL_UPDATES_NOTIFICATION_TITLE", "Important Updates Available"},
    Entry{"CRITICAL_UPDATES_POSTINSTALL_NOTIFICATION_TEXT",
          "Important security updates were installed."},
    Entry{"CRITICAL_UPDATES_POSTINSTALL_NOTIFICATION_TITLE", "Important Updates Installed"},
    Entry{"CRITICAL_UPDATES_RESTART_NOTIFICATION_TEXT",
          "Important security updates are ready to install. Your computer will need to restart."},
    Entry{"CRITICAL_UPDATE_INSTALL_NOW_RESTART_TEXT",
          "An important security update will be installed now, and your computer will restart."},
    Entry{"CRITICAL_UPDATE_INSTALL_NOW_TEXT",
          "An important security update will be installed now."},
    Entry{"CRITICAL_UPDATE_INSTALL_NOW_TITLE", "Installing an Important Update"},
    Entry{"CRITICAL_UPDATE_NOTIFICATION_TEXT", "An important security update is ready to install."},
    Entry{"CRITICAL_UPDATE_NOTIFICATION_TITLE", "Important Update Available"},
    Entry{"CRITICAL_UPDATE_POSTINSTALL_NOTIFICATION_TEXT",
          "An important security update was installed."},
    Entry{"CRITICAL_UPDATE_POSTINSTALL_NOTIFICATION_TITLE", "Important Update Installed"},
    Entry{"CRITICAL_UPDATE_RESTART_NOTIFICATION_TEXT",
          "An important security update is ready to install. Your computer will need to "
          "restart."},
    Entry{"DOITLATER_HELPER_OTHER_USERS_TEXT",
          "The updates weren't installed because other users were logged in."},
    Entry{"DOITLATER_HELPER_OTHER_USERS_TITLE", "Updates Not Installed"},
    Entry{"DOITLATER_HELPER_POWER_TEXT",
          "The updates weren't installed because the computer wasn't connected to power."},
    Entry{"DOITLATER_HELPER_POWER_TITLE", "Updates Not Installed"},
    Entry{"DOITLATER_POSTLOGOUTINSTALLED_NOTIFICATION_TEXT",
          "The updates you scheduled for later have been installed."},
    Entry{"DOITLATER_POSTLOGOUTINSTALLED_NOTIFICATION_TITLE", "Updates Installed"},
    Entry{"INSTALL_QUIT_APP_BUTTON", "Quit and Update"},
    Entry{"INSTALL_QUIT_APP_CANCEL_BUTTON", "Cancel"},
    Entry{"INSTALL_QUIT_APP_MESSAGE_FORMAT",
          "%@ must quit before it can be updated. Changes you haven't saved may be lost."},
    Entry{"INSTALL_QUIT_APP_MULTIPLE_MESSAGE_FORMAT",
          "Changes you haven't saved may be lost. These applications must quit before they can "
          "be updated:%@"},
    Entry{"INSTALL_QUIT_APP_MULTIPLE_TITLE", "Quit Applications to Update Them?"},
    Entry{"INSTALL_QUIT_APP_SKIPALL_BUTTON", "Skip These Updates"},
    Entry{"INSTALL_QUIT_APP_SKIP_BUTTON_FORMAT", "Skip %@"},
    Entry{"INSTALL_QUIT_APP_SKIP_OS_UPDATES", "Skip System Updates"},
    Entry{"INSTALL_QUIT_APP_TITLE_FORMAT", "Quit %@ to Update It?"},
    Entry{"OVP_INVITE_NOTIFICATION_BODY_FORMAT",
          "%@ invites you to receive apps it distributes. Enroll to accept the invitation."},
    Entry{"OVP_INVITE_NOTIFICATION_CLOSE_BUTTON", "Close"},
    Entry{"OVP_INVITE_NOTIFICATION_ENROLL_BUTTON", "Enroll"},
    Entry{"OVP_INVITE_NOTIFICATION_TITLE_FORMAT", "Invitation from %@"},
    Entry{"RESTART_COUNTDOWN_NOTIFICATION_LATER_BUTTON", "Later"},
    Entry{"RESTART_COUNTDOWN_NOTIFICATION_RESTART_BUTTON", "Restart Now"},
    Entry{"RESTART_COUNTDOWN_NOTIFICATION_TEXT",
          "Your computer will restart shortly to finish installing updates."},
    Entry{"RESTART_COUNTDOWN_NOTIFICATION_TITLE", "Restarting to Install Updates"},
    Entry{"SOFTWARE_LICENSE_AGREEMENT_TITLE", "Software License Agreement"},
    Entry{"UPDATEFAILED_DIALOG_AVAILABLE_UPDATES_CHANGED_BODY",
          "The available updates changed while your updates were being prepared. Review the "
          "updates and try again."},
    Entry{"UPDATEFAILED_DIALOG_AVAILABLE_UPDATES_CHANGED_TITLE", "The Updates Have Changed"},
    Entry{"UPDATEFAILED_DIALOG_AVAILABLE_UPDATES_SHOW_DETAILS_BUTTON", "Show Updates"},
    Entry{"UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TEXT_APP_RUNNING",
          "Some apps were in use and couldn't be updated. Quit them to install their updates."},
    Entry{"UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TEXT_GENERIC",
          "Some updates couldn't be installed automatically."},
    Entry{"UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TEXT_RESTART",
          "Some updates need a restart to finish installing."},
    Entry{"UPDATES_AVAILABLE_AUTOUPDATE_FAILED_NOTIFICATION_TITLE",
          "Updates Couldn't Be Installed Automatically"},
    Entry{"UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_2_UPDATES_AND_MORE_FORMAT", "%@, %@"},
    Entry{"UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_2_UPDATES_FORMAT", "%@ and %@"},
    Entry{"UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_3_UPDATES_AND_MORE_FORMAT", "%@, %@, %@"},
    Entry{"UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_3_UPDATES_FORMAT", "%@, %@ and %@"},
    Entry{"UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_TEXT_AND_ONE_OTHER_FORMAT",
          "New versions of %@ and %@ other app are ready to install."},
    Entry{"UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_TEXT_AND_OTHERS_FORMAT",
          "New versions of %@ and %@ other apps are ready to install."},
    Entry{"UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_TEXT_FORMAT",
          "New versions of %@ are ready to install."},
    Entry{"UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_TEXT_SINGLE_FORMAT",
          "A new version of %@ is ready to install."},
    Entry{"UPDATES_AVAILABLE_HEARTHANVIL_NOTIFICATION_TITLE", "New Versions of Your Apps"},
    Entry{"UPDATES_AVAILABLE_LATER_FAILED_NOTIFICATION_TEXT",
          "The updates you scheduled for later couldn't be installed."},
    Entry{"UPDATES_AVAILABLE_LATER_FAILED_NOTIFICATION_TITLE", "Updates Not Installed"},
    Entry{"UPDATES_AVAILABLE_NOTIFICATION_LATER_NOT_OFFERED_RESTART_TEXT",
          "Updates are ready to install. Your computer will need to restart."},
    Entry{"UPDATES_AVAILABLE_NOTIFICATION_LATER_NOT_OFFERED_TEXT", "Updates are ready to install."},
    Entry{"UPDATES_AVAILABLE_NOTIFICATION_TEXT",
          "Do you want to install the updates now or later?"},
    Entry{"UPDATES_AVAILABLE_NOTIFICATION_TEXT_RESTART",
          "Do you want to restart to install the updates now or try later?"},
    Entry{"UPDATES_AVAILABLE_NOTIFICATION_TITLE", "Updates Available"},
    Entry{"UPDATES_AVAILABLE_POSTLOGOUT_FAILED_NOTIFICATION_TEXT",
          "The updates couldn't be installed while you were logged out."},
    Entry{"UPDATES_AVAILABLE_POSTLOGOUT_FAILED_NOTIFICATION_TITLE", "Updates Not Installed"},
    Entry{"UPDATE_NOTIFICATION_CLOSE_BUTTON", "Close"},
    Entry{"UPDATE_NOTIFICATION_DETAILS_BUTTON", "Details"},
    Entry{"UPDATE_NOTIFICATION_INSTALL_BUTTON", "Install"},
    Entry{"UPDATE_NOTIFICATION_LATER_BUTTON", "Later"},
    Entry{"UPDATE_NOTIFICATION_LATER_OPTION_1HOUR", "Try in an Hour"},
    Entry{"UPDATE_NOTIFICATION_LATER_OPTION_1HOUR_SHORT", "In an Hour"},
    Entry{"UPDATE_NOTIFICATION_LATER_OPTION_AUTOUPDATE_OPTIN", "Turn On Automatic Updates"},
    Entry{"UPDATE_NOTIFICATION_LATER_OPTION_AUTOUPDATE_RESTART_REQUIRED_OPTIN",
          "Install System Updates Automatically"},
    Entry{"UPDATE_NOTIFICATION_LATER_OPTION_NOW", "Install Now"},
    Entry{"UPDATE_NOTIFICATION_LATER_OPTION_REMIND", "Remind Me Tomorrow"},
    Entry{"UPDATE_NOTIFICATION_LATER_OPTION_RESTART_NOW", "Restart Now"},
    Entry{"UPDATE_NOTIFICATION_LATER_OPTION_TONIGHT", "Try Tonight"},
    Entry{"UPDATE_NOTIFICATION_LATER_OPTION_TONIGHT_SHORT", "Tonight"},
    Entry{"UPDATE_NOTIFICATION_RESTART_BUTTON", "Restart"},
    Entry{"UPDATE_NOTIFICATION_UPDATE_BUTTON", "Update"},
};

// The book application speaks of books and its library, not of apps.
constexpr std::array kBookClientStrings = {
    Entry{"AUTOUPDATE_POSTUPDATE_NOTIFICATION_TEXT_SINGLE",
          "The book was updated in your library."},
    Entry{"AUTOUPDATE_POSTUPDATE_NOTIFICATION_TITLE_MULTIPLE", "%@ Books Updated"},
    Entry{"UPDATES_AVAILABLE_NOTIFICATION_LATER_NOT_OFFERED_TEXT",
          "New versions of books in your library are ready to download."},
    Entry{"UPDATES_AVAILABLE_NOTIFICATION_TITLE", "Book Updates Available"},
};

template <std::size_t Count>
constexpr bool isSortedByKey(const std::array<Entry, Count>& table) {
  return std::is_sorted(table.begin(), table.end(),
                        [](const Entry& a, const Entry& b) { return a.key < b.key; }) &&
         std::adjacent_find(table.begin(), table.end(), [](const Entry& a, const Entry& b) {
           return a.key == b.key;
         }) == table.end();
}

static_assert(isSortedByKey(kTradelineStrings), "keep the string table sorted, keys unique");
static_assert(isSortedByKey(kBookClientStrings), "keep the book overrides sorted, keys unique");

}  // namespace

std::span<const LocalizedStringEntry> tradelineStringTable() {
  return kTradelineStrings;
}

std::span<const LocalizedStringEntry> bookClientStringOverrides() {
  return kBookClientStrings;
}

std::optional<std::string_view> findLocalizedText(std::span<const LocalizedStringEntry> table,
                                                  std::string_view key) {
  auto found =
      std::lower_bound(table.begin(), table.end(), key,
                       [](const Entry& entry, std::string_view k) { return entry.key < k; });
  if (found == table.end() || found->key != key) return std::nullopt;
  return found->text;
}

}  // namespace larder
