#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/system/Mutex.h"
#include "store-runtime/records/VendPurchaseRecord.h"
#include "store-runtime/services/VendOperation.h"

namespace larder {

// Asks the store for the name of the account that owns a purchase record:
// a GET of the URL under the bag key "orvane-id-lookup" with the record's
// ware id and opaque account id in the query, answered with
// { orvaneID, accountID }. Meant to run as a sub-operation; afterwards
// `orvaneID` holds the name when the lookup succeeded.
class VendOrvaneIDLookupOperation : public VendOperation {
 public:
  static constexpr std::string_view kURLBagKey = "orvane-id-lookup";
  // Failures of the lookup itself; those of the request keep the store's
  // domain and codes.
  static constexpr std::string_view kErrorDomain = "VendOrvaneIDLookupErrorDomain";
  static constexpr std::int64_t kRecordNamesNoAccountCode = 1;

  VendOrvaneIDLookupOperation(VendPurchaseRecord purchaseRecord, VendStoreClient storeClient);

  static std::shared_ptr<VendOrvaneIDLookupOperation> orvaneIDLookupOperationForPurchaseRecord(
      const VendPurchaseRecord& purchaseRecord, VendStoreClient storeClient);

  [[nodiscard]] const VendPurchaseRecord& purchaseRecord() const { return purchaseRecord_; }
  // The account's name; empty until a lookup has succeeded.
  [[nodiscard]] std::optional<std::string> orvaneID() const;

  // "ware-id=<id>&account=<opaque id>" for the record, the ware id left out
  // when the record has none; nullopt when it names no account.
  static std::optional<std::string> queryForPurchaseRecord(const VendPurchaseRecord& record);

 protected:
  void run() override;

 private:
  std::optional<std::string> lookupURL(OptionalError* error);
  void setOrvaneID(std::string orvaneID);

  VendPurchaseRecord purchaseRecord_;
  mutable Mutex mutex_;
  std::optional<std::string> orvaneID_ GUARDED_BY(mutex_);
};

}  // namespace larder
