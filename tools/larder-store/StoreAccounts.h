#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "larder-store/StoreAccount.h"
#include "platform/value/PlistValue.h"

namespace larder {

// The accounts of "accounts.plist": an array of { accountID, orvaneID,
// password, storeFrontID?, signingKey?, opaqueID? }. An entry that is not one is
// skipped with a line on standard error.
class StoreAccounts {
 public:
  StoreAccounts() = default;
  explicit StoreAccounts(const PlistValue& root);
  // A missing file gives no accounts; an unreadable one is reported.
  static StoreAccounts load(const std::string& path);

  [[nodiscard]] const StoreAccount* authenticate(std::string_view name,
                                                 std::string_view password) const;
  [[nodiscard]] const StoreAccount* accountWithID(std::uint64_t accountID) const;
  [[nodiscard]] const StoreAccount* accountWithOpaqueID(std::string_view opaqueID) const;
  [[nodiscard]] std::size_t size() const { return accounts_.size(); }

  // The key of an account that names none: the same for the same account
  // after every restart, and different for every account and password.
  static PlistData derivedSigningKey(std::uint64_t accountID, std::string_view name,
                                     std::string_view password);

 private:
  std::optional<StoreAccount> accountFromEntry(const PlistValue& entry, std::size_t index) const;

  std::vector<StoreAccount> accounts_;
};

}  // namespace larder
