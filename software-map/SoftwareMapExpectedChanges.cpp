// The update machinery's notices of a bundle replacement.
#include "platform/log/TillLogManager.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/records/VendPurchaseRecord.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "SoftwareMap";

void clearExpectation(LedgerSoftwareProductFields& fields) {
  fields.metadataChangeIsExpected = false;
  fields.expectedBundleVersion.reset();
  fields.expectedStoreVersion.reset();
}

}  // namespace

LedgerSoftwareProductRef SoftwareMap::productAtPath(const std::string& path) const {
  if (!records_->appsByPath) return nullptr;
  auto found = records_->appsByPath->find(path);
  return found == records_->appsByPath->end() ? nullptr : found->second;
}

void SoftwareMap::productAtPathWillBeUpdatedToBundleVersionStoreVersion(
    const std::string& path, const std::string& bundleVersion, std::int64_t storeVersion) {
  dispatchQueue_->barrierSync([&] {
    LedgerSoftwareProductRef product = productAtPath(path);
    if (!product) {
      TILL_LOG(3, "%@: ERROR: No software product was found for update reported at path: %@",
               kSpeaker, path);
      return;
    }
    TILL_LOG(3,
             "%@: Version change will occur for software at %@ (%@:%@), expecting metadata update",
             kSpeaker, path, bundleVersion, storeVersion);
    product->update([&](LedgerSoftwareProductFields& fields) {
      fields.metadataChangeIsExpected = true;
      fields.expectedBundleVersion = bundleVersion;
      fields.expectedStoreVersion = storeVersion;
    });
  });
}

void SoftwareMap::productAtPathWasUpdatedToBundleVersionStoreVersion(
    const std::string& path, bool wasUpdated, const std::string& bundleVersion,
    std::int64_t storeVersion) {
  dispatchQueue_->barrierSync([&] {
    LedgerSoftwareProductRef product = productAtPath(path);
    if (!product) {
      TILL_LOG(3,
               "%@: ERROR: No software product was found for completed update reported at path: %@",
               kSpeaker, path);
      return;
    }
    TILL_LOG(
        3,
        "%@: Version change has occurred for software at %@ (%@:%@), waiting for metadata update",
        kSpeaker, path, bundleVersion, storeVersion);
    if (!product->snapshot().metadataChangeIsExpected) {
      TILL_LOG(3, "%@: Expected metadata change was already seen for product %@", kSpeaker,
               product);
      return;
    }
    if (!wasUpdated) {
      product->update(clearExpectation);
      TILL_LOG(3, "%@: Update did not happen, removed expectations of a product change at path: %@",
               kSpeaker, path);
      return;
    }
    std::optional<VendPurchaseRecord> record =
        VendPurchaseRecord::purchaseRecordFromBundleAtPath(path);
    if (!record) {
      TILL_LOG(1, "%@: Error: There is no QMT app at the reported path: %@", kSpeaker, path);
      return;
    }
    bool didChange = false;
    updateAppWithApp(*product, *productFromPurchaseRecord(path, *record), &didChange);
    if (didChange) {
      enqueueNotifications(Changes{{}, {product}, {}});
    } else {
      TILL_LOG(1, "%@: Warning: No change identified in reported product: %@", kSpeaker, product);
    }
  });
}

}  // namespace larder
