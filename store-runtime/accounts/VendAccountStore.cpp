#include "store-runtime/accounts/VendAccountStore.h"

#include <algorithm>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"

namespace larder {
namespace {

constexpr std::string_view kSpeaker = "VendAccountStore";

std::optional<VendAccount> accountFromDictionary(const PlistValue& entry) {
  const PlistValue& identifier = entry["accountID"];
  if (!identifier.isInteger() || identifier.uint64Value() == 0) return std::nullopt;
  VendAccount account;
  account.accountID = identifier.uint64Value();
  if (const std::string* name = entry["orvaneID"].string()) account.orvaneID = *name;
  if (const PlistData* key = entry["signingKey"].data()) account.signingKey = *key;
  if (const std::string* front = entry["storeFrontID"].string()) account.storeFrontID = *front;
  return account;
}

}  // namespace

PlistDictionary VendAccount::toDictionary() const {
  PlistDictionary dictionary{{"accountID", accountID}, {"orvaneID", orvaneID}};
  if (!storeFrontID.empty()) dictionary["storeFrontID"] = storeFrontID;
  return dictionary;
}

VendAccountStore::VendAccountStore(const VendRuntimeConfiguration& configuration)
    : path_(configuration.stateDirectory + "/accounts.plist") {
  load();
}

void VendAccountStore::load() {
  // Only the constructor calls it, but the analysis wants the lock all the same.
  MutexLock lock(mutex_);
  FileIO::removeStaleTemporaries(path_);
  auto bytes = FileIO::read(path_, 1U << 20U);
  if (!bytes) return;
  auto parsed = PropertyListSerialization::read(*bytes);
  if (!parsed || !parsed->isDictionary()) {
    TILL_LOG(1, "%@: %@ is not an account store; starting without accounts", kSpeaker, path_);
    return;
  }
  if (const PlistArray* entries = (*parsed)["accounts"].array()) {
    for (const PlistValue& entry : *entries) {
      if (auto account = accountFromDictionary(entry)) accounts_.push_back(std::move(*account));
    }
  }
  const PlistValue& primary = (*parsed)["primaryAccountID"];
  if (primary.isInteger() && findAccountLocked(primary.uint64Value()))
    primaryAccountID_ = primary.uint64Value();
}

void VendAccountStore::saveLocked() const {
  PlistArray entries;
  for (const VendAccount& account : accounts_) {
    PlistDictionary entry = account.toDictionary();
    entry["signingKey"] = account.signingKey;
    entries.emplace_back(std::move(entry));
  }
  PlistDictionary root{{"accounts", std::move(entries)}};
  if (primaryAccountID_) root["primaryAccountID"] = *primaryAccountID_;
  // Signing keys are secrets: FileIO creates the file for its owner alone.
  if (auto written = FileIO::writeAtomically(path_, PropertyListSerialization::writeBinary(root));
      !written) {
    TILL_LOG(1, "%@: Could not save the accounts to %@: %@", kSpeaker, path_,
             written.error().description);
  }
}

std::optional<VendAccount> VendAccountStore::primaryAccount() const {
  MutexLock lock(mutex_);
  if (!primaryAccountID_) return std::nullopt;
  return findAccountLocked(*primaryAccountID_);
}

std::optional<VendAccount> VendAccountStore::accountWithID(std::uint64_t accountID) const {
  MutexLock lock(mutex_);
  return findAccountLocked(accountID);
}

std::optional<VendAccount> VendAccountStore::findAccountLocked(std::uint64_t accountID) const {
  auto found = std::find_if(accounts_.begin(), accounts_.end(), [&](const VendAccount& account) {
    return account.accountID == accountID;
  });
  if (found == accounts_.end()) return std::nullopt;
  return *found;
}

std::optional<VendAccount> VendAccountStore::accountWithName(std::string_view orvaneID) const {
  MutexLock lock(mutex_);
  auto found = std::find_if(accounts_.begin(), accounts_.end(), [&](const VendAccount& account) {
    return account.orvaneID == orvaneID;
  });
  if (found == accounts_.end()) return std::nullopt;
  return *found;
}

void VendAccountStore::signIn(VendAccount account) {
  {
    MutexLock lock(mutex_);
    std::erase_if(accounts_,
                  [&](const VendAccount& known) { return known.accountID == account.accountID; });
    primaryAccountID_ = account.accountID;
    accounts_.push_back(account);
    saveLocked();
  }
  TILL_LOG(2, "%@: Account %@ is now the primary account", kSpeaker, account.orvaneID);
  notify(account);
}

void VendAccountStore::signOut() {
  {
    MutexLock lock(mutex_);
    if (!primaryAccountID_) return;
    const std::uint64_t signedOut = *primaryAccountID_;
    std::erase_if(accounts_,
                  [&](const VendAccount& known) { return known.accountID == signedOut; });
    primaryAccountID_.reset();
    saveLocked();
  }
  notify(std::nullopt);
}

void VendAccountStore::addObserver(const std::shared_ptr<VendAccountStoreObserver>& observer) {
  if (!observer) return;
  MutexLock lock(observersMutex_);
  observers_.push_back(observer);
}

void VendAccountStore::notify(const std::optional<VendAccount>& primary) {
  std::vector<std::shared_ptr<VendAccountStoreObserver>> observers;
  {
    MutexLock lock(observersMutex_);
    observers = observers_;
  }
  for (const auto& observer : observers) observer->primaryAccountDidChange(primary);
}

}  // namespace larder
