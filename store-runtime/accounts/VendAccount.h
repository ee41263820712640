#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/value/PlistValue.h"

namespace larder {

// A signed-in store account. `accountID` is what the service reads;
// `orvaneID` is the account's name, and the signing key is what the store
// gave at sign-in to sign this account's requests.
struct VendAccount {
  std::uint64_t accountID = 0;
  std::string orvaneID;
  PlistData signingKey;
  std::string storeFrontID;

  // Wire form for clients: "accountID", "orvaneID", "storeFrontID"; the
  // key never leaves the process.
  [[nodiscard]] PlistDictionary toDictionary() const;

  friend bool operator==(const VendAccount&, const VendAccount&) = default;
};

// How to authenticate one account. The reason is kept for the log and for
// the dialog that may ask the user.
class VendAuthenticationContext {
 public:
  VendAuthenticationContext() = default;
  explicit VendAuthenticationContext(std::uint64_t accountID) : accountID_(accountID) {}

  [[nodiscard]] std::uint64_t accountID() const { return accountID_; }
  [[nodiscard]] std::int64_t authenticationReason() const { return reason_; }
  void setAuthenticationReason(std::int64_t reason) { reason_ = reason; }
  // An account name to offer in the sign-in dialog.
  [[nodiscard]] const std::optional<std::string>& accountName() const { return accountName_; }
  void setAccountName(std::string name) { accountName_ = std::move(name); }

 private:
  std::uint64_t accountID_ = 0;
  std::int64_t reason_ = 0;
  std::optional<std::string> accountName_;
};

}  // namespace larder
