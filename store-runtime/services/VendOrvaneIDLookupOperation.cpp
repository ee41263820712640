#include "store-runtime/services/VendOrvaneIDLookupOperation.h"

#include "platform/log/TillLogManager.h"
#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/http/VendStoreAnswer.h"
#include "store-runtime/http/VendURLBag.h"
#include "store-runtime/runtime/VendRuntime.h"
#include "store-runtime/services/VendPropertyListProvider.h"
#include "store-runtime/services/VendServiceProxy.h"
#include "store-runtime/services/VendStoreURLOperation.h"

namespace larder {
namespace {

constexpr std::string_view kSpeaker = "VendOrvaneIDLookupOperation";

// The record's ware id as decimal text; it may be stored as either.
std::optional<std::string> wareIDText(const PlistValue& wareID) {
  if (const std::string* text = wareID.string()) {
    return text->empty() ? std::nullopt : std::optional<std::string>(*text);
  }
  if (wareID.isInteger()) return std::to_string(wareID.uint64Value());
  return std::nullopt;
}

std::string queryPair(std::string_view name, std::string_view value) {
  return std::string(name) + "=" + percentEncodedQueryComponent(value);
}

}  // namespace

VendOrvaneIDLookupOperation::VendOrvaneIDLookupOperation(VendPurchaseRecord purchaseRecord,
                                                         VendStoreClient storeClient)
    : VendOperation(std::move(storeClient)), purchaseRecord_(std::move(purchaseRecord)) {}

std::shared_ptr<VendOrvaneIDLookupOperation>
VendOrvaneIDLookupOperation::orvaneIDLookupOperationForPurchaseRecord(
    const VendPurchaseRecord& purchaseRecord, VendStoreClient storeClient) {
  return std::make_shared<VendOrvaneIDLookupOperation>(purchaseRecord, std::move(storeClient));
}

std::optional<std::string> VendOrvaneIDLookupOperation::orvaneID() const {
  MutexLock lock(mutex_);
  return orvaneID_;
}

void VendOrvaneIDLookupOperation::setOrvaneID(std::string orvaneID) {
  MutexLock lock(mutex_);
  orvaneID_ = std::move(orvaneID);
}

std::optional<std::string> VendOrvaneIDLookupOperation::queryForPurchaseRecord(
    const VendPurchaseRecord& record) {
  const auto& account = record.opaqueAccountIDString;
  if (!account || account->empty()) return std::nullopt;
  const auto wareID = wareIDText(record.wareID);
  std::string query = wareID ? queryPair("ware-id", *wareID) + "&" : std::string();
  return query + queryPair("account", *account);
}

std::optional<std::string> VendOrvaneIDLookupOperation::lookupURL(OptionalError* error) {
  const auto query = queryForPurchaseRecord(purchaseRecord_);
  if (!query) {
    *error = VendError::withDomain(std::string(kErrorDomain), kRecordNamesNoAccountCode,
                                   "The purchase record names no account");
    return std::nullopt;
  }
  const auto base =
      serviceProxy()->runtime()->urlBag().urlForKey(requiredBagType(), kURLBagKey, error);
  if (!base) return std::nullopt;
  return urlByAddingStringToQueryString(*base, *query);
}

void VendOrvaneIDLookupOperation::run() {
  OptionalError error;
  const auto url = lookupURL(&error);
  if (!url) {
    TILL_LOG(2, "%@: no lookup for %@: %@", kSpeaker, purchaseRecord_.bundleIdentifier,
             error ? error->descriptionText() : "no error");
    setError(std::move(error));
    return;
  }
  auto request = std::make_shared<VendStoreURLOperation>(storeClient());
  auto provider = VendPropertyListProvider::providerWithStoreClient(storeClient());
  // A background question: nothing in the answer is shown or started.
  provider->setShouldProcessDialogs(false);
  provider->setShouldProcessDownloads(false);
  provider->setShouldTriggerDownloads(false);
  request->setDataProvider(provider);
  request->setRequest(VendURLRequest(*url));
  if (!runSubOperation(*request, &error)) {
    setError(error ? std::move(error)
                   : VendStoreAnswer::error(VendStoreAnswer::kNoStore,
                                            "The account lookup failed without an error"));
    return;
  }
  const std::string* name = provider->output()["orvaneID"].string();
  if (!name || name->empty()) {
    setError(VendStoreAnswer::error(VendStoreAnswer::kWrongShape,
                                    "The account lookup answer names no account"));
    return;
  }
  TILL_LOG(3, "%@: %@ belongs to %@", kSpeaker, purchaseRecord_.bundleIdentifier, *name);
  setOrvaneID(*name);
  setSuccess(true);
}

}  // namespace larder
