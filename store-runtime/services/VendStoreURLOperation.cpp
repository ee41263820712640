#include "store-runtime/services/VendStoreURLOperation.h"

#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/accounts/VendAccountStore.h"
#include "store-runtime/http/VendStoreAnswer.h"
#include "store-runtime/http/VendURLBag.h"
#include "store-runtime/services/VendAccountService.h"
#include "store-runtime/services/VendPropertyListProvider.h"
#include "store-runtime/services/VendServiceProxy.h"

namespace larder {

std::shared_ptr<VendStoreURLOperation> VendStoreURLOperation::propertyListOperationWithURLBagKey(
    std::string key, VendStoreClient storeClient) {
  auto operation = std::make_shared<VendStoreURLOperation>(storeClient);
  operation->setUrlBagKey(std::move(key));
  operation->setDataProvider(
      VendPropertyListProvider::providerWithStoreClient(std::move(storeClient)));
  return operation;
}

std::shared_ptr<VendStoreURLOperation> VendStoreURLOperation::propertyListPostWithURLBagKey(
    std::string key, VendStoreClient storeClient, const PlistDictionary& body) {
  auto operation = propertyListOperationWithURLBagKey(std::move(key), std::move(storeClient));
  auto provider = std::static_pointer_cast<VendPropertyListProvider>(operation->dataProvider());
  provider->setShouldProcessDownloads(false);
  provider->setShouldTriggerDownloads(false);
  VendURLRequest request;
  request.setMethod("POST");
  request.setValue("application/x-plist", "Content-Type");
  const std::string xml = PropertyListSerialization::writeXml(body);
  request.setBody(PlistData(xml.begin(), xml.end()));
  operation->setRequest(std::move(request));
  return operation;
}

bool VendStoreURLOperation::prepareRequest(VendURLRequest& request, OptionalError* error) {
  if (request.url().empty() && !urlBagKey_.empty()) {
    auto url = serviceProxy()->runtime()->urlBag().urlForKey(requiredBagType(), urlBagKey_, error);
    if (!url) return false;
    request.setURL(*url);
  }
  if (!VendURLOperation::prepareRequest(request, error)) return false;
  if (!needsAuthentication_) return true;
  account_ = authenticate(error);
  if (!account_) return false;
  if (auto observer = std::dynamic_pointer_cast<VendStoreURLOperationDelegate>(delegate())) {
    observer->operationDidAuthenticateWithAccountID(*this, account_->accountID);
  }
  VendRequestSigner(account_->signingKey).sign(request, account_->accountID);
  return true;
}

std::optional<VendAccount> VendStoreURLOperation::authenticate(OptionalError* error) {
  auto& accounts = serviceProxy()->runtime()->accountStore();
  const std::uint64_t wanted = context_ ? context_->accountID() : 0;
  if (auto known = wanted != 0 ? accounts.accountWithID(wanted) : accounts.primaryAccount())
    return known;
  // Nobody usable is signed in: ask the account service, which may ask the user.
  std::optional<std::uint64_t> signedIn;
  serviceProxy()->accountServiceSynchronousBlock(
      [&](VendAccountService& service, DispatchSemaphore& done) {
        service.accountIDByAuthenticatingWithContext(
            context_.value_or(VendAuthenticationContext(wanted)),
            [&](bool success, std::uint64_t accountID, const OptionalError& failure) {
              if (success) signedIn = accountID;
              if (error) *error = failure;
              done.signal();
            });
      });
  if (!signedIn) return std::nullopt;
  return accounts.accountWithID(*signedIn);
}

bool VendStoreURLOperation::acceptAnswer(const VendURLResponse& response, const PlistData& body,
                                         OptionalError* error) {
  if (!account_) return true;
  if (VendRequestSigner(account_->signingKey).verifiedBody(response, body)) return true;
  if (error) {
    *error = VendStoreAnswer::error(VendStoreAnswer::kBadSignature,
                                    "The store's answer does not carry a valid signature");
  }
  return false;
}

}  // namespace larder
