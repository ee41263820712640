#include "store-runtime/services/VendTransactionService.h"

#include "platform/log/TillLogManager.h"
#include "store-runtime/accounts/VendAccountStore.h"
#include "store-runtime/core/VendElasticQueue.h"
#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/http/VendRequestSigner.h"
#include "store-runtime/http/VendStoreAnswer.h"
#include "store-runtime/http/VendURLBag.h"
#include "store-runtime/records/TillDownload.h"
#include "store-runtime/services/VendDownloadService.h"
#include "store-runtime/services/VendPropertyListProvider.h"
#include "store-runtime/services/VendStoreURLOperation.h"

namespace larder {
namespace {

constexpr std::string_view kSpeaker = "VendTransactionService";
constexpr std::string_view kBuyBagKey = "buy-product";
constexpr std::string_view kLookupBagKey = "item-lookup";

// "a=1&b=x" from the string and number entries of the request.
std::string queryText(const PlistDictionary& request) {
  std::string query;
  for (const auto& [key, value] : request) {
    std::string text;
    if (const std::string* string = value.string()) {
      text = *string;
    } else if (value.isInteger()) {
      text = std::to_string(value.int64Value());
    } else {
      continue;
    }
    if (!query.empty()) query += '&';
    query += percentEncodedQueryComponent(key) + "=" + percentEncodedQueryComponent(text);
  }
  return query;
}

// The item a purchase buys: its identifier, else the one its buy
// parameters name; 0 when neither says.
std::uint64_t itemBought(const TillPurchase& purchase) {
  if (purchase.itemIdentifier() != 0) return purchase.itemIdentifier();
  return TillPurchase::itemIdentifierFromBuyParameters(purchase.buyParameters()).value_or(0);
}

// An answer is bound to what was bought: a download of any other item (a
// store, or anyone between it and us, swapping the package) is refused
// before anything is fetched.
OptionalError wrongItemIn(const TillPurchase& purchase, const TillPurchaseResponse& response) {
  const std::uint64_t bought = itemBought(purchase);
  if (bought == 0) return std::nullopt;
  for (const auto& download : response.downloads()) {
    const std::uint64_t delivered = download->metadata().itemIdentifier();
    if (delivered == bought) continue;
    return VendStoreAnswer::error(VendStoreAnswer::kWrongItem,
                                  "The store's purchase answer delivers item " +
                                      std::to_string(delivered) + ", not the item bought (" +
                                      std::to_string(bought) + ")");
  }
  return std::nullopt;
}

VendError notSignedIn() {
  return VendStoreAnswer::error(VendStoreAnswer::kNotSignedIn, "No account is signed in");
}

}  // namespace

VendTransactionService::VendTransactionService(VendStoreClient storeClient,
                                               std::shared_ptr<VendRuntime> runtime)
    : storeClient_(std::move(storeClient)), runtime_(std::move(runtime)) {}

void VendTransactionService::async(std::function<void()> work) const {
  runtime_->serviceQueue()->async(std::move(work));
}

void VendTransactionService::performPurchase(TillPurchase purchase,
                                             const LegacyApps& /*legacyAppsToGrant*/,
                                             std::int64_t options, PurchaseReply reply) {
  async([self = *this, purchase = std::move(purchase), options, reply = std::move(reply)] {
    auto outcome = self.purchase(purchase, options);
    reply(outcome.response, outcome.response.has_value(), outcome.error);
  });
}

void VendTransactionService::performPurchases(std::vector<TillPurchase> purchases,
                                              const LegacyApps& /*legacyAppsToGrant*/,
                                              std::int64_t options, BulkPurchaseReply reply) {
  async([self = *this, purchases = std::move(purchases), options, reply = std::move(reply)] {
    PurchaseResponses responses;
    OptionalError firstFailure;
    for (const TillPurchase& purchase : purchases) {
      auto outcome = self.purchase(purchase, options);
      if (outcome.response) {
        responses.emplace_back(purchase, std::move(*outcome.response));
      } else if (!firstFailure) {
        firstFailure = outcome.error;
      }
    }
    const bool success = !firstFailure;
    reply(responses, success, firstFailure);
  });
}

VendTransactionService::PurchaseOutcome VendTransactionService::purchase(
    const TillPurchase& purchase, std::int64_t options) const {
  // The downloads are read below, where the options decide who starts them.
  auto operation = VendStoreURLOperation::propertyListPostWithURLBagKey(
      std::string(kBuyBagKey), storeClient_, purchase.toDictionary());
  auto provider = std::static_pointer_cast<VendPropertyListProvider>(operation->dataProvider());
  if (!purchase.isAccountLessPurchase()) {
    operation->setNeedsAuthentication(true);
    std::optional<VendAccount> account;
    auto& accounts = runtime_->accountStore();
    if (purchase.accountIdentifier() != 0)
      account = accounts.accountWithID(purchase.accountIdentifier());
    if (!account && purchase.orvaneID()) account = accounts.accountWithName(*purchase.orvaneID());
    VendAuthenticationContext context(account ? account->accountID : purchase.accountIdentifier());
    if (purchase.orvaneID()) context.setAccountName(*purchase.orvaneID());
    operation->setAuthenticationContext(std::move(context));
  }
  OptionalError error;
  if (!operation->runSyncReturningError(&error)) {
    TILL_LOG(1, "%@: Purchase of %@ failed: %@", kSpeaker, purchase.itemIdentifier(),
             error ? error->descriptionText() : "no error");
    return {std::nullopt, error};
  }
  const PlistDictionary* answer = provider->output().dictionary();
  auto response = answer ? TillPurchaseResponse::fromDictionary(*answer) : std::nullopt;
  if (!response) {
    return {std::nullopt,
            VendStoreAnswer::error(VendStoreAnswer::kWrongShape,
                                   "The store's purchase answer has the wrong shape")};
  }
  if (auto refusal = wrongItemIn(purchase, *response)) {
    TILL_LOG(1, "%@: Purchase of %@ refused: %@", kSpeaker, purchase.itemIdentifier(),
             refusal->descriptionText());
    return {std::nullopt, refusal};
  }
  TILL_LOG(2, "%@: Purchased %@ with %@ downloads", kSpeaker, purchase.itemIdentifier(),
           response->downloads().size());
  if ((options & kLeaveDownloadsToCaller) == 0) startDownloads(*response);
  return {std::move(response), std::nullopt};
}

void VendTransactionService::startDownloads(const TillPurchaseResponse& response) const {
  VendDownloadService downloads(storeClient_, runtime_);
  for (const auto& download : response.downloads()) {
    download->setDownloadType(TillDownload::kInstall);
    downloads.performDownload(download, 0,
                              [download](std::int64_t result, const OptionalError& error) {
                                TILL_LOG(2, "%@: Download of %@ ended with result %@ (%@)",
                                         kSpeaker, download->metadata().title(), result,
                                         error ? error->descriptionText() : "no error");
                              });
  }
}

void VendTransactionService::itemLookup(
    PlistDictionary lookupRequest,
    std::function<void(bool, const PlistDictionary&, const OptionalError&)> reply) {
  async([self = *this, lookupRequest = std::move(lookupRequest), reply = std::move(reply)] {
    OptionalError error;
    auto url = self.runtime_->urlBag().urlForKey(0, kLookupBagKey, &error);
    if (!url) {
      reply(false, {}, error);
      return;
    }
    auto operation = std::make_shared<VendStoreURLOperation>(self.storeClient_);
    auto provider = VendPropertyListProvider::providerWithStoreClient(self.storeClient_);
    provider->setShouldTriggerDownloads(false);
    operation->setDataProvider(provider);
    const std::string query = queryText(lookupRequest);
    operation->setRequest(
        VendURLRequest(query.empty() ? *url : urlByAddingStringToQueryString(*url, query)));
    if (!operation->runSyncReturningError(&error)) {
      reply(false, {}, error);
      return;
    }
    if (const PlistDictionary* answer = provider->output().dictionary()) {
      reply(true, *answer, std::nullopt);
    } else {
      reply(false, {},
            VendStoreAnswer::error(VendStoreAnswer::kWrongShape,
                                   "The lookup answer is not a dictionary"));
    }
  });
}

void VendTransactionService::signURLRequest(
    VendURLRequest request, const std::string& /*service*/,
    const std::optional<std::string>& /*signingSessionID*/,
    std::function<void(const std::optional<VendURLRequest>&, const OptionalError&)> reply) {
  async([runtime = runtime_, request = std::move(request), reply = std::move(reply)]() mutable {
    auto account = runtime->accountStore().primaryAccount();
    if (!account) {
      reply(std::nullopt, notSignedIn());
      return;
    }
    VendRequestSigner(account->signingKey).sign(request, account->accountID);
    reply(request, std::nullopt);
  });
}

void VendTransactionService::signedBodyWithURLResponse(
    VendURLResponse response, const std::string& /*service*/, PlistData data,
    const std::optional<std::string>& /*sessionID*/,
    std::function<void(const std::optional<PlistData>&, const OptionalError&)> reply) {
  async([runtime = runtime_, response = std::move(response), data = std::move(data),
         reply = std::move(reply)] {
    auto account = runtime->accountStore().primaryAccount();
    if (!account) {
      reply(std::nullopt, notSignedIn());
      return;
    }
    auto body = VendRequestSigner(account->signingKey).verifiedBody(response, data);
    if (!body) {
      reply(std::nullopt,
            VendStoreAnswer::error(VendStoreAnswer::kBadSignature,
                                   "The answer does not carry the account's signature"));
      return;
    }
    reply(body, std::nullopt);
  });
}

}  // namespace larder
