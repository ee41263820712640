#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/error/VendError.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/accounts/VendAccount.h"
#include "store-runtime/accounts/VendAccountStore.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/http/VendURLBag.h"
#include "store-runtime/runtime/VendRuntime.h"

namespace larder {

// URL bag and accounts for one store client. Every call replies exactly
// once, on a thread of the runtime's service queue.
class VendAccountService {
 public:
  using BagReply = std::function<void(bool success, bool loaded, const OptionalError& error)>;
  using AuthenticationReply =
      std::function<void(bool success, std::uint64_t accountID, const OptionalError& error)>;

  VendAccountService(VendStoreClient storeClient, std::shared_ptr<VendRuntime> runtime);

  void loadURLBagWithType(std::int64_t bagType, BagReply reply);
  // The bag of the store client's required type.
  void valueForURLBagKey(std::string key, std::function<void(PlistValue)> reply);
  // Told of the fetches of the store client's required bag type only.
  void addURLBagObserver(const std::shared_ptr<VendURLBagObserver>& observer);
  void removeURLBagObserver(const std::shared_ptr<VendURLBagObserver>& observer);
  void isValid(std::function<void(bool)> reply);
  void regexWithKey(std::string key, std::string text, std::function<void(bool)> reply);

  void primaryAccount(std::function<void(std::optional<VendAccount>)> reply);
  void addAccountStoreObserver(const std::shared_ptr<VendAccountStoreObserver>& observer);
  // Signs the context's account in. An account that is already signed in
  // (or, without an account in the context, the primary one) answers at
  // once; otherwise a sign-in dialog asks the user, and the store checks
  // what they typed. Cancelling the dialog fails with code -128.
  void accountIDByAuthenticatingWithContext(VendAuthenticationContext context,
                                            AuthenticationReply reply);
  // Signs in without asking anybody, for tools and scripts.
  void signIn(std::string accountName, std::string password, AuthenticationReply reply);
  void signOut();

 private:
  struct SignInResult {
    std::optional<VendAccount> account;
    OptionalError error;
  };
  SignInResult authenticateWithStore(const std::string& accountName, const std::string& password);
  SignInResult askUserAndAuthenticate(const VendAuthenticationContext& context);
  void async(std::function<void()> work);

  VendStoreClient storeClient_;
  std::shared_ptr<VendRuntime> runtime_;
  std::int64_t bagType_;
};

}  // namespace larder
