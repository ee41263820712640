#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/error/VendError.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/http/VendURLRequest.h"
#include "store-runtime/http/VendURLResponse.h"
#include "store-runtime/records/LedgerSoftwareProduct.h"
#include "store-runtime/records/TillPurchase.h"
#include "store-runtime/records/TillPurchaseResponse.h"
#include "store-runtime/runtime/VendRuntime.h"

namespace larder {

// Purchases, item lookup and the store's signatures for one store client.
// Every call replies exactly once, on a thread of the runtime's service
// queue.
class VendTransactionService {
 public:
  // Bit of the purchase options: hand the downloads back and leave them
  // to the caller. Without it the downloads are started and installed.
  static constexpr std::int64_t kLeaveDownloadsToCaller = 1;

  using LegacyApps = std::vector<std::shared_ptr<LedgerSoftwareProduct>>;
  using PurchaseReply = std::function<void(const std::optional<TillPurchaseResponse>& response,
                                           bool success, const OptionalError& error)>;
  using PurchaseResponses = std::vector<std::pair<TillPurchase, TillPurchaseResponse>>;
  using BulkPurchaseReply = std::function<void(const PurchaseResponses& responses, bool success,
                                               const OptionalError& error)>;

  VendTransactionService(VendStoreClient storeClient, std::shared_ptr<VendRuntime> runtime);

  void performPurchase(TillPurchase purchase, const LegacyApps& legacyAppsToGrant,
                       std::int64_t options, PurchaseReply reply);
  // Purchases one after the other. Success only when every one succeeded;
  // the responses hold those that did, and the error is the first failure.
  void performPurchases(std::vector<TillPurchase> purchases, const LegacyApps& legacyAppsToGrant,
                        std::int64_t options, BulkPurchaseReply reply);
  // Looks items up by the request's "id" or "bundleId" (and passes its other
  // entries along). The reply has the store's answer dictionary.
  void itemLookup(
      PlistDictionary lookupRequest,
      std::function<void(bool success, const PlistDictionary& answer, const OptionalError& error)>
          reply);

  // Signs the request for the primary account.
  void signURLRequest(
      VendURLRequest request, const std::string& service,
      const std::optional<std::string>& signingSessionID,
      std::function<void(const std::optional<VendURLRequest>&, const OptionalError&)> reply);
  // The body, when the answer carries the primary account's signature.
  void signedBodyWithURLResponse(
      VendURLResponse response, const std::string& service, PlistData data,
      const std::optional<std::string>& signingSessionID,
      std::function<void(const std::optional<PlistData>&, const OptionalError&)> reply);

 private:
  struct PurchaseOutcome {
    std::optional<TillPurchaseResponse> response;
    OptionalError error;
  };
  PurchaseOutcome purchase(const TillPurchase& purchase, std::int64_t options) const;
  void startDownloads(const TillPurchaseResponse& response) const;
  void async(std::function<void()> work) const;

  VendStoreClient storeClient_;
  std::shared_ptr<VendRuntime> runtime_;
};

}  // namespace larder
