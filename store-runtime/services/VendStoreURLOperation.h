#pragma once

#include <memory>
#include <optional>
#include <string>

#include "store-runtime/accounts/VendAccount.h"
#include "store-runtime/http/VendRequestSigner.h"
#include "store-runtime/services/VendURLOperation.h"

namespace larder {

// A URL operation that knows the store: its URL comes from a URL bag key
// when the request has none, and when it needs authentication the request
// is signed for the account (signing the account in first if it must) and
// the answer must carry the store's signature.
class VendStoreURLOperation : public VendURLOperation {
 public:
  using VendURLOperation::VendURLOperation;

  // A ready operation whose URL comes from the bag key and whose data
  // provider is a property-list provider.
  static std::shared_ptr<VendStoreURLOperation> propertyListOperationWithURLBagKey(
      std::string key, VendStoreClient storeClient);
  // The same, posting `body` as an XML property list. Downloads its answer
  // names are neither read nor started: the caller decides about them.
  static std::shared_ptr<VendStoreURLOperation> propertyListPostWithURLBagKey(
      std::string key, VendStoreClient storeClient, const PlistDictionary& body);

  void setUrlBagKey(std::string key) { urlBagKey_ = std::move(key); }
  [[nodiscard]] const std::string& urlBagKey() const { return urlBagKey_; }
  void setNeedsAuthentication(bool needs) { needsAuthentication_ = needs; }
  [[nodiscard]] bool needsAuthentication() const { return needsAuthentication_; }
  void setAuthenticationContext(VendAuthenticationContext context) {
    context_ = std::move(context);
  }

  // The account the request was signed for.
  [[nodiscard]] const std::optional<VendAccount>& authenticatedAccount() const { return account_; }

 protected:
  bool prepareRequest(VendURLRequest& request, OptionalError* error) override;
  bool acceptAnswer(const VendURLResponse& response, const PlistData& body,
                    OptionalError* error) override;

 private:
  std::optional<VendAccount> authenticate(OptionalError* error);

  std::string urlBagKey_;
  bool needsAuthentication_ = false;
  std::optional<VendAuthenticationContext> context_;
  std::optional<VendAccount> account_;
};

}  // namespace larder
