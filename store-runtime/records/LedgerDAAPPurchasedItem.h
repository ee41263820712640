#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"
#include "store-runtime/records/LedgerCloudItemFields.h"
#include "store-runtime/records/TillPurchase.h"

namespace larder {

// One purchased item of a store client that is not the book application:
// the cloud library's fields and nothing else. It answers the operations a
// library asks of a book, so that a library can treat both alike. Shared
// and guarded like `LedgerBook`.
class LedgerDAAPPurchasedItem {
 public:
  static constexpr std::string_view kClassName = "LedgerDAAPPurchasedItem";
  static constexpr std::string_view kPathPrefix = "daap:";

  LedgerDAAPPurchasedItem() = default;
  explicit LedgerDAAPPurchasedItem(LedgerCloudItemFields fields) : fields_(std::move(fields)) {}

  [[nodiscard]] const LedgerCloudItemFields& fields() const { return fields_; }
  LedgerCloudItemFields& fields() { return fields_; }

  // A purchased item is never a file on this machine.
  [[nodiscard]] bool isLocal() const { return false; }
  // "daap:<cloud library identifier>", the stand-in path of a purchase;
  // nullopt until that identifier is known.
  [[nodiscard]] std::optional<std::string> path() const;
  [[nodiscard]] const std::optional<std::uint64_t>& itemIdentifier() const {
    return fields_.itemIdentifier;
  }
  [[nodiscard]] const std::optional<std::string>& title() const { return fields_.title; }

  [[nodiscard]] bool isEqualToBook(const LedgerDAAPPurchasedItem& other) const {
    return fields_ == other.fields_;
  }
  // As for books, every field is library state.
  void copyLibraryPropertiesFromBook(const LedgerDAAPPurchasedItem& other) {
    fields_ = other.fields_;
  }
  [[nodiscard]] std::shared_ptr<LedgerDAAPPurchasedItem> copy() const;

  [[nodiscard]] PlistDictionary dictionaryRepresentation() const { return toDictionary(); }
  [[nodiscard]] std::optional<TillPurchase> redownloadPurchase() const {
    return fields_.redownloadPurchase();
  }

  [[nodiscard]] PlistDictionary encodeWithCoder() const;
  static std::shared_ptr<LedgerDAAPPurchasedItem> initWithCoder(const PlistValue& encoded);

  [[nodiscard]] PlistDictionary toDictionary() const;
  static std::shared_ptr<LedgerDAAPPurchasedItem> fromDictionary(const PlistDictionary& dictionary);

  [[nodiscard]] std::string description() const;

 private:
  LedgerCloudItemFields fields_;
};

using LedgerDAAPPurchasedItemRef = std::shared_ptr<LedgerDAAPPurchasedItem>;

}  // namespace larder
