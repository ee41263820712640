#pragma once

#include <string_view>

namespace larder {

// The preference keys of the update machinery and the book library. A key's
// text is its constant's name without "kDefaults" and "Key", so that a key
// met in a preference file, in `larderctl prefs` or in a log line leads
// straight to its constant. The domain and scope of each are given where it
// is read.
inline constexpr std::string_view kDefaultsAlwaysAbortUpdatesCodeKey = "AlwaysAbortUpdatesCode";
inline constexpr std::string_view kDefaultsAlwaysForceTerminateAppsKey = "AlwaysForceTerminateApps";
inline constexpr std::string_view kDefaultsAppUpdatesToInstallLaterKey = "AppUpdatesToInstallLater";
inline constexpr std::string_view kDefaultsAutoUpdateEnabledKey = "AutoUpdateEnabled";
inline constexpr std::string_view kDefaultsAutoUpdateEnabledMajorOSVersionKey =
    "AutoUpdateEnabledMajorOSVersion";
inline constexpr std::string_view kDefaultsAutoUpdateForegroundAppsKey = "AutoUpdateForegroundApps";
inline constexpr std::string_view kDefaultsAutoUpdateImmortalAppsKey = "AutoUpdateImmortalApps";
inline constexpr std::string_view kDefaultsAutoUpdateIntervalKey = "AutoUpdateInterval";
inline constexpr std::string_view kDefaultsAutoUpdateMinimumAgeKey = "AutoUpdateMinimumAge";
inline constexpr std::string_view kDefaultsAutoUpdateRestartRequiredEnabledKey =
    "AutoUpdateRestartRequiredEnabled";
inline constexpr std::string_view kDefaultsAutoUpdateRestartRequiredMajorOSVersionKey =
    "AutoUpdateRestartRequiredMajorOSVersion";
inline constexpr std::string_view kDefaultsAutomaticDownloadKey = "AutomaticDownload";
inline constexpr std::string_view kDefaultsAvailableUpdatesAtLastNotificationKey =
    "AvailableUpdatesAtLastNotification";
inline constexpr std::string_view kDefaultsAvailableUpdatesNotificationIntervalKey =
    "AvailableUpdatesNotificationInterval";
inline constexpr std::string_view kDefaultsCriticalUpdateNotificationIntervalKey =
    "CriticalUpdateNotificationInterval";
inline constexpr std::string_view kDefaultsDidPostUpdatesAvailableNotificationDateKey =
    "DidPostUpdatesAvailableNotificationDate";
inline constexpr std::string_view kDefaultsDidStageAppUpdatesDateKey = "DidStageAppUpdatesDate";
inline constexpr std::string_view kDefaultsDidStartAutoUpdateDateKey = "DidStartAutoUpdateDate";
inline constexpr std::string_view kDefaultsDisableQuaymartBadgeKey = "DisableQuaymartBadge";
inline constexpr std::string_view kDefaultsDoNotCheckDiskSpaceKey = "DoNotCheckDiskSpace";
inline constexpr std::string_view kDefaultsFakePostLogoutUpdateFailureKey =
    "FakePostLogoutUpdateFailure";
inline constexpr std::string_view kDefaultsFileSystemBookLibraryKey = "FileSystemBookLibrary";
inline constexpr std::string_view kDefaultsHidePreReleaseOSUpdatesKey = "HidePreReleaseOSUpdates";
inline constexpr std::string_view kDefaultsLastAutoUpdateInvocationKey = "LastAutoUpdateInvocation";
inline constexpr std::string_view kDefaultsLastDoItLaterLogoutFailedKey =
    "LastDoItLaterLogoutFailed";
inline constexpr std::string_view kDefaultsLastUpdateNotificationOSMajorVersionKey =
    "LastUpdateNotificationOSMajorVersion";
inline constexpr std::string_view kDefaultsMajorOSUpdateKey = "MajorOSUpdate";
inline constexpr std::string_view kDefaultsMajorOSUpdateNotificationDelayKey =
    "MajorOSUpdateNotificationDelay";
inline constexpr std::string_view kDefaultsNotifyUserOfNewUpdatesOnlyKey =
    "NotifyUserOfNewUpdatesOnly";
inline constexpr std::string_view kDefaultsOSUpdatesSeenByUserKey = "OSUpdatesSeenByUser";
inline constexpr std::string_view kDefaultsQuaymartBadgeCountKey = "QuaymartBadgeCount";
inline constexpr std::string_view kDefaultsStageAppUpdatesIntervalKey = "StageAppUpdatesInterval";
inline constexpr std::string_view kDefaultsSysupScanAutomaticCheckEnabledKey =
    "SysupScanAutomaticCheckEnabled";

}  // namespace larder
