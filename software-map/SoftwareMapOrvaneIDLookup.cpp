// Which account owns an installed product: its bundle's purchase record
// names the account only by an opaque id, which the store turns into a name.
#include "platform/log/TillLogManager.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/records/VendPurchaseRecord.h"
#include "store-runtime/services/VendOrvaneIDLookupOperation.h"

namespace larder {

namespace {
constexpr std::string_view kSpeaker = "SoftwareMap";
}

std::optional<std::string> SoftwareMap::lookupOrvaneIDForApp(const LedgerSoftwareProduct* product,
                                                             const VendStoreClient& storeClient) {
  if (!product) return std::nullopt;
  const std::string path = product->bundlePath();
  const std::optional<VendPurchaseRecord> record =
      VendPurchaseRecord::purchaseRecordFromBundleAtPath(path);
  if (!record) {
    TILL_LOG(1, "%@: No purchase record in the bundle at %@, so its owner is unknown", kSpeaker,
             path);
    return std::nullopt;
  }
  auto lookup =
      VendOrvaneIDLookupOperation::orvaneIDLookupOperationForPurchaseRecord(*record, storeClient);
  // The lookup runs on this thread, as the sub-operation of a plain host
  // operation of the same client, and the caller waits for the store.
  VendOperation host(storeClient);
  OptionalError error;
  const bool succeeded = host.runSubOperation(*lookup, &error);
  lookup->setDelegate(nullptr);
  if (!succeeded || error) {
    TILL_LOG(1, "%@: App may be from wrong environment! Lookup failed with error - %@", kSpeaker,
             error ? error->descriptionText() : std::string("(null)"));
    return std::nullopt;
  }
  TILL_LOG(3, "%@: We know Orvane ID (case 3)", kSpeaker);
  return lookup->orvaneID();
}

}  // namespace larder
