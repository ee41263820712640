#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

// Keys of `accountLessOptions`. Clients send them in the options of an
// account-less download, so their text is part of the bus contract.
inline constexpr std::string_view TillPurchaseAccountLessOptionAllowRedownload = "allowRedownload";
inline constexpr std::string_view TillPurchaseAccountLessOptionPerformPreflightCheck =
    "performPreflightCheck";

// One purchase request, as the transaction service carries it out and as
// the store's "buy-product" request receives it. A plain value: whoever
// builds a purchase owns it until it is handed over.
class TillPurchase {
 public:
  static constexpr std::string_view kClassName = "TillPurchase";

  enum PurchaseType : std::int64_t {
    kPurchaseTypeUnspecified = 0,
    kPurchaseTypeUserInitiated = 2,
    kPurchaseTypeBackground = 3,
  };

  TillPurchase() = default;
  // The item identifier is taken from the buy parameters when they name
  // one; callers that know better set it afterwards.
  static TillPurchase purchaseWithBuyParameters(std::string buyParameters);

  // The store item that buy parameters (URL query text) name: the value of
  // "itemId", or failing that of "salableWareId", which account-less
  // purchases use. nullopt when neither is a plain decimal number.
  static std::optional<std::uint64_t> itemIdentifierFromBuyParameters(std::string_view parameters);

  [[nodiscard]] const std::string& buyParameters() const { return buyParameters_; }
  void setBuyParameters(std::string parameters) { buyParameters_ = std::move(parameters); }
  // 0 when not known.
  [[nodiscard]] std::uint64_t itemIdentifier() const { return itemIdentifier_; }
  void setItemIdentifier(std::uint64_t identifier) { itemIdentifier_ = identifier; }
  [[nodiscard]] std::int64_t purchaseType() const { return purchaseType_; }
  void setPurchaseType(std::int64_t type) { purchaseType_ = type; }
  // The installed software's setting, passed through as the purchase
  // record holds it; null when there is none.
  [[nodiscard]] const PlistValue& parentalControls() const { return parentalControls_; }
  void setParentalControls(PlistValue value) { parentalControls_ = std::move(value); }
  [[nodiscard]] bool isUpdate() const { return isUpdate_; }
  void setIsUpdate(bool value) { isUpdate_ = value; }
  [[nodiscard]] bool isRedownload() const { return isRedownload_; }
  void setIsRedownload(bool value) { isRedownload_ = value; }
  [[nodiscard]] bool isOVP() const { return isOVP_; }
  void setIsOVP(bool value) { isOVP_ = value; }
  [[nodiscard]] bool isAccountLessPurchase() const { return isAccountLessPurchase_; }
  void setIsAccountLessPurchase(bool value) { isAccountLessPurchase_ = value; }

  [[nodiscard]] const std::optional<PlistDictionary>& accountLessOptions() const {
    return accountLessOptions_;
  }
  // Also sets `checkPreflightAterPurchase` from the options, so that the
  // two cannot disagree unless a caller overrides the flag afterwards.
  void setAccountLessOptions(std::optional<PlistDictionary> options);
  [[nodiscard]] bool checkPreflightAterPurchase() const { return checkPreflightAterPurchase_; }
  void setCheckPreflightAterPurchase(bool value) { checkPreflightAterPurchase_ = value; }
  // True when the option is a boolean or integer that is set; any other
  // value, or none, is false.
  static bool accountLessOption(const std::optional<PlistDictionary>& options,
                                std::string_view key);

  [[nodiscard]] const std::optional<std::string>& orvaneID() const { return orvaneID_; }
  void setOrvaneID(std::optional<std::string> name) { orvaneID_ = std::move(name); }
  // 0 when none is known.
  [[nodiscard]] std::uint64_t accountIdentifier() const { return accountIdentifier_; }
  void setAccountIdentifier(std::uint64_t identifier) { accountIdentifier_ = identifier; }

  // Keyed-archive form: the wire keys plus "$class".
  [[nodiscard]] PlistDictionary encodeWithCoder() const;
  // nullopt when the class is not ours or a field has the wrong type.
  static std::optional<TillPurchase> initWithCoder(const PlistValue& encoded);

  // Wire form, also the body of the store's "buy-product" request.
  [[nodiscard]] PlistDictionary toDictionary() const;
  static std::optional<TillPurchase> fromDictionary(const PlistDictionary& dictionary);

  [[nodiscard]] std::string description() const;

  friend bool operator==(const TillPurchase&, const TillPurchase&) = default;

 private:
  std::string buyParameters_;
  std::uint64_t itemIdentifier_ = 0;
  std::int64_t purchaseType_ = kPurchaseTypeUnspecified;
  PlistValue parentalControls_;
  bool isUpdate_ = false;
  bool isRedownload_ = false;
  bool isOVP_ = false;
  bool isAccountLessPurchase_ = false;
  std::optional<PlistDictionary> accountLessOptions_;
  bool checkPreflightAterPurchase_ = false;
  std::optional<std::string> orvaneID_;
  std::uint64_t accountIdentifier_ = 0;
};

}  // namespace larder
