// What the controller tells the user: its notification catalogue, and the
// audits that a notification carries the key of.
#include <filesystem>

#include "notifications/catalogue/UpdateNotificationCatalogue.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "platform/system/Uuid.h"
#include "store-runtime/host/LedgerQuaymartLauncher.h"
#include "update-controller/UpdateController.h"
#include "update-operation/UpdateOperation.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateController";
constexpr std::string_view kUpdateFailureURLPrefix = "quaymart://showUpdateFailure?auditInfoToken=";

}  // namespace

UpdateNotificationCatalogue& UpdateController::notificationCatalogue() const {
  return *notificationCatalogue_;
}

bool UpdateController::updateFailureNotificationIsDisplayed() const {
  return notificationCatalogue_->updateFailureNotificationIsDisplayed();
}

bool UpdateController::shouldOfferDoItLaterForAvailableUpdates() const {
  return shouldOfferDoItLaterForAppUpdates(
      *updateQueue_->availableUpdates(),
      SysupQuaymartUpdateController::sharedUpdateController().availableUpdates());
}

// Beside the audit of the last run; the files have no end of life, so that
// a notification's key stays good however late the user acts on it.
std::string UpdateController::auditInfoCachePath(std::string_view key) {
  const std::filesystem::path folder =
      std::filesystem::path(UpdateOperation::auditFilePath()).parent_path();
  return (folder / ("UpdateOperationAuditInfoCache-" + std::string(key) + ".plist")).string();
}

std::optional<std::string> UpdateController::cacheUpdateAuditInfo(
    const PlistDictionary& auditInfo) const {
  const std::string key = Uuid::generateString();
  const std::string path = auditInfoCachePath(key);
  const PlistValue audit(auditInfo);
  TILL_LOG(2, "%@: Writing audit info cache to disk at %@ - %@", kSpeaker, path, audit);
  if (Result<void> written =
          FileIO::writeAtomically(path, PropertyListSerialization::writeXml(audit));
      !written) {
    TILL_LOG(1, "%@: Failed to write update operation audit cache to disk at %@", kSpeaker, path);
    return std::nullopt;
  }
  return key;
}

std::optional<PlistDictionary> UpdateController::cachedUpdateAuditInfoWithKey(
    std::string_view key) const {
  const std::string path = auditInfoCachePath(key);
  Result<std::vector<std::uint8_t>> bytes = FileIO::read(path);
  if (!bytes) {
    TILL_LOG(1, "%@: Failed to read audit info cache from %@ - %@", kSpeaker, path,
             bytes.error().descriptionText());
    return std::nullopt;
  }
  Result<PlistValue> audit = PropertyListSerialization::read(*bytes);
  if (!audit || !audit->dictionary()) {
    TILL_LOG(1, "%@: Failed to deserialize plist for audit info cache from %@ (size %lu) - %@",
             kSpeaker, path, bytes->size(),
             audit ? std::string("not a dictionary") : audit.error().descriptionText());
    return std::nullopt;
  }
  return *audit->dictionary();
}

void UpdateController::launchQuaymartAndShowUpdateFailureWithAuditInfoCacheKey(
    std::string_view key) const {
  const std::string url = std::string(kUpdateFailureURLPrefix) + std::string(key);
  TILL_LOG(2, "%@: Showing the update failure details with %@", kSpeaker, url);
  LedgerQuaymartLauncher::sharedInstance().launchQuaymartWithURL(url);
}

}  // namespace larder
