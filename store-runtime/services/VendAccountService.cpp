#include "store-runtime/services/VendAccountService.h"
#include "store-runtime/dialogs/VendCancellingDialogPresenter.h"

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "store-runtime/core/VendElasticQueue.h"
#include "store-runtime/dialogs/VendDialog.h"
#include "store-runtime/dialogs/VendDialogPresenter.h"
#include "store-runtime/http/VendStoreAnswer.h"
#include "store-runtime/services/VendPropertyListProvider.h"
#include "store-runtime/services/VendStoreURLOperation.h"

namespace larder {
namespace {

constexpr std::string_view kSpeaker = "VendAccountService";
constexpr std::string_view kAuthenticateBagKey = "authenticate";

VendError cancelledError() {
  VendError error;
  error.code = VendError::kCancelledCode;
  error.description = "The user cancelled signing in.";
  return error;
}

VendError nobodyAskedError() {
  VendError error = cancelledError();
  error.description =
      "No one was asked to sign in: no dialog agent is registered with the service. Run "
      "`larderctl agent` in a terminal of this session, or sign in first with `larderctl signin`.";
  return error;
}

std::optional<VendAccount> accountFromAnswer(const PlistValue& answer) {
  const PlistValue& identifier = answer["accountID"];
  const PlistData* key = answer["signingKey"].data();
  if (!identifier.isInteger() || identifier.uint64Value() == 0 || !key || key->empty())
    return std::nullopt;
  VendAccount account;
  account.accountID = identifier.uint64Value();
  account.signingKey = *key;
  if (const std::string* name = answer["orvaneID"].string()) account.orvaneID = *name;
  if (const std::string* front = answer["storeFrontID"].string()) account.storeFrontID = *front;
  return account;
}

VendDialog signInDialog(const VendAuthenticationContext& context) {
  PlistDictionary fields{{"message", "Sign in to the store"},
                         {"explanation", "Enter the name and password of your store account."},
                         {"okButtonString", "Sign In"},
                         {"cancelButtonString", "Cancel"}};
  if (context.accountName()) fields["accountName"] = *context.accountName();
  VendDialog dialog = VendDialog::dialogWithDictionary(fields);
  dialog.setKind(VendDialog::kSignIn);
  return dialog;
}

}  // namespace

VendAccountService::VendAccountService(VendStoreClient storeClient,
                                       std::shared_ptr<VendRuntime> runtime)
    : storeClient_(std::move(storeClient)),
      runtime_(std::move(runtime)),
      bagType_(storeClient_.requiredBagType()) {}

void VendAccountService::async(std::function<void()> work) {
  runtime_->serviceQueue()->async(std::move(work));
}

void VendAccountService::loadURLBagWithType(std::int64_t bagType, BagReply reply) {
  async([runtime = runtime_, bagType, reply = std::move(reply)] {
    auto result = runtime->urlBag().load(bagType);
    reply(result.success, result.loaded, result.error);
  });
}

void VendAccountService::valueForURLBagKey(std::string key, std::function<void(PlistValue)> reply) {
  async([runtime = runtime_, bagType = bagType_, key = std::move(key), reply = std::move(reply)] {
    reply(runtime->urlBag().valueForKey(bagType, key));
  });
}

void VendAccountService::addURLBagObserver(const std::shared_ptr<VendURLBagObserver>& observer) {
  runtime_->urlBag().addObserver(bagType_, observer);
}

void VendAccountService::removeURLBagObserver(const std::shared_ptr<VendURLBagObserver>& observer) {
  runtime_->urlBag().removeObserver(observer);
}

void VendAccountService::isValid(std::function<void(bool)> reply) {
  async([runtime = runtime_, bagType = bagType_, reply = std::move(reply)] {
    reply(runtime->urlBag().isValid(bagType));
  });
}

void VendAccountService::regexWithKey(std::string key, std::string text,
                                      std::function<void(bool)> reply) {
  async([runtime = runtime_, bagType = bagType_, key = std::move(key), text = std::move(text),
         reply = std::move(reply)] {
    reply(runtime->urlBag().regexWithKeyMatchesString(bagType, key, text));
  });
}

void VendAccountService::primaryAccount(std::function<void(std::optional<VendAccount>)> reply) {
  async([runtime = runtime_, reply = std::move(reply)] {
    reply(runtime->accountStore().primaryAccount());
  });
}

void VendAccountService::addAccountStoreObserver(
    const std::shared_ptr<VendAccountStoreObserver>& observer) {
  runtime_->accountStore().addObserver(observer);
}

void VendAccountService::accountIDByAuthenticatingWithContext(VendAuthenticationContext context,
                                                              AuthenticationReply reply) {
  async([self = *this, context = std::move(context), reply = std::move(reply)]() mutable {
    auto& accounts = self.runtime_->accountStore();
    const auto known = context.accountID() != 0 ? accounts.accountWithID(context.accountID())
                                                : accounts.primaryAccount();
    if (known) {
      reply(true, known->accountID, std::nullopt);
      return;
    }
    TILL_LOG(2, "%@: Asking the user to sign in (reason %@)", kSpeaker,
             context.authenticationReason());
    auto result = self.askUserAndAuthenticate(context);
    if (!result.account) {
      reply(false, 0, result.error);
      return;
    }
    accounts.signIn(*result.account);
    reply(true, result.account->accountID, std::nullopt);
  });
}

void VendAccountService::signIn(std::string accountName, std::string password,
                                AuthenticationReply reply) {
  async([self = *this, accountName = std::move(accountName), password = std::move(password),
         reply = std::move(reply)]() mutable {
    auto result = self.authenticateWithStore(accountName, password);
    if (!result.account) {
      reply(false, 0, result.error);
      return;
    }
    self.runtime_->accountStore().signIn(*result.account);
    reply(true, result.account->accountID, std::nullopt);
  });
}

void VendAccountService::signOut() {
  runtime_->accountStore().signOut();
}

VendAccountService::SignInResult VendAccountService::askUserAndAuthenticate(
    const VendAuthenticationContext& context) {
  DispatchSemaphore answered;
  VendDialogAnswer answer;
  VendCancellingDialogPresenter::presenterOf(*runtime_)->present(signInDialog(context),
                                                                 [&](VendDialogAnswer given) {
                                                                   answer = std::move(given);
                                                                   answered.signal();
                                                                 });
  answered.wait();
  const PlistValue values(answer.values);
  const std::string* name = values["accountName"].string();
  const std::string* password = values["password"].string();
  if (answer.nobodyAsked) return {std::nullopt, nobodyAskedError()};
  if (answer.exitCode != VendDialogButton::kOK || !name || !password)
    return {std::nullopt, cancelledError()};
  return authenticateWithStore(*name, *password);
}

VendAccountService::SignInResult VendAccountService::authenticateWithStore(
    const std::string& accountName, const std::string& password) {
  // The sign-in answer is not signed (there is no key yet), so nothing it
  // orders may install software: only purchase answers start downloads.
  auto operation = VendStoreURLOperation::propertyListPostWithURLBagKey(
      std::string(kAuthenticateBagKey), storeClient_,
      PlistDictionary{{"accountName", accountName}, {"password", password}});
  auto provider = std::static_pointer_cast<VendPropertyListProvider>(operation->dataProvider());
  OptionalError error;
  if (!operation->runSyncReturningError(&error)) {
    TILL_LOG(1, "%@: Signing in %@ failed: %@", kSpeaker, accountName,
             error ? error->descriptionText() : "no error");
    return {std::nullopt, error};
  }
  const PlistValue& answer = provider->output();
  if (const PlistArray* downloads = answer["downloads"].array(); downloads && !downloads->empty()) {
    TILL_LOG(1, "%@: The sign-in answer carries %@ download(s); they are ignored", kSpeaker,
             downloads->size());
  }
  auto account = accountFromAnswer(answer);
  if (!account) {
    return {std::nullopt,
            VendStoreAnswer::error(VendStoreAnswer::kWrongShape,
                                   "The store's sign-in answer has no account or key")};
  }
  return {account, std::nullopt};
}

}  // namespace larder
