#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/system/Mutex.h"
#include "store-runtime/accounts/VendAccount.h"
#include "store-runtime/core/VendRuntimeConfiguration.h"

namespace larder {

class VendAccountStoreObserver {
 public:
  virtual ~VendAccountStoreObserver() = default;
  // Called after the primary account changed; nullopt after a sign-out.
  virtual void primaryAccountDidChange(const std::optional<VendAccount>& account) = 0;
};

// The accounts signed in on this machine for this user, with their signing
// keys, and which one is primary. Kept in "accounts.plist" of the state
// folder, readable by the user only, written atomically on every change.
class VendAccountStore {
 public:
  explicit VendAccountStore(const VendRuntimeConfiguration& configuration);

  [[nodiscard]] std::optional<VendAccount> primaryAccount() const;
  [[nodiscard]] std::optional<VendAccount> accountWithID(std::uint64_t accountID) const;
  [[nodiscard]] std::optional<VendAccount> accountWithName(std::string_view orvaneID) const;

  // Adds or replaces the account and makes it primary.
  void signIn(VendAccount account);
  // Forgets the primary account.
  void signOut();

  void addObserver(const std::shared_ptr<VendAccountStoreObserver>& observer);

  [[nodiscard]] const std::string& path() const { return path_; }

 private:
  void load();
  void saveLocked() const REQUIRES(mutex_);
  [[nodiscard]] std::optional<VendAccount> findAccountLocked(std::uint64_t accountID) const
      REQUIRES(mutex_);
  void notify(const std::optional<VendAccount>& primary);

  std::string path_;
  mutable Mutex mutex_;
  std::vector<VendAccount> accounts_ GUARDED_BY(mutex_);
  std::optional<std::uint64_t> primaryAccountID_ GUARDED_BY(mutex_);
  Mutex observersMutex_;
  std::vector<std::shared_ptr<VendAccountStoreObserver>> observers_ GUARDED_BY(observersMutex_);
};

}  // namespace larder
