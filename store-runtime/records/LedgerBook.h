#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"
#include "store-runtime/records/LedgerCloudItemFields.h"
#include "store-runtime/records/TillPurchase.h"

namespace larder {

// A book's fields: what the cloud library knows of it, plus what only a
// file on this machine gives. Keys in every form are the member names.
struct LedgerBookFields : LedgerCloudItemFields {
  bool isLocal = false;
  // A file path, or "daap:<id>" for a purchase that has no file.
  std::optional<std::string> path;
  // "book-info" of the local metadata.
  std::optional<PlistDictionary> bookInfo;
  // The whole local metadata.
  std::optional<PlistDictionary> sonorelMetaData;

  friend bool operator==(const LedgerBookFields&, const LedgerBookFields&) = default;
};

// One book of a library. Libraries share a record through
// std::shared_ptr and change it in place, so that an observer that holds it
// sees the update; the library guards those writes, so the record has no
// lock of its own.
class LedgerBook {
 public:
  static constexpr std::string_view kClassName = "LedgerBook";

  LedgerBook() = default;
  explicit LedgerBook(LedgerBookFields fields) : fields_(std::move(fields)) {}

  [[nodiscard]] const LedgerBookFields& fields() const { return fields_; }
  LedgerBookFields& fields() { return fields_; }

  // What the library keys and sorts by.
  [[nodiscard]] bool isLocal() const { return fields_.isLocal; }
  [[nodiscard]] const std::optional<std::string>& path() const { return fields_.path; }
  [[nodiscard]] const std::optional<std::uint64_t>& itemIdentifier() const {
    return fields_.itemIdentifier;
  }
  [[nodiscard]] const std::optional<std::string>& title() const { return fields_.title; }

  // Every field counts.
  [[nodiscard]] bool isEqualToBook(const LedgerBook& other) const {
    return fields_ == other.fields_;
  }
  // Every field is library state: sources set all of them, and a record that
  // took fewer would differ from its source again at the next rebuild and be
  // reported as changed for ever. What survives is the object itself.
  void copyLibraryPropertiesFromBook(const LedgerBook& other) { fields_ = other.fields_; }
  [[nodiscard]] std::shared_ptr<LedgerBook> copy() const;

  // The fields by name: the wire form.
  [[nodiscard]] PlistDictionary dictionaryRepresentation() const { return toDictionary(); }
  [[nodiscard]] std::optional<TillPurchase> redownloadPurchase() const {
    return fields_.redownloadPurchase();
  }

  // Keyed-archive form: the wire keys plus "$class".
  [[nodiscard]] PlistDictionary encodeWithCoder() const;
  // nullptr when the class is not ours or a field has the wrong type.
  static std::shared_ptr<LedgerBook> initWithCoder(const PlistValue& encoded);

  [[nodiscard]] PlistDictionary toDictionary() const;
  static std::shared_ptr<LedgerBook> fromDictionary(const PlistDictionary& dictionary);

  [[nodiscard]] std::string description() const;

 private:
  LedgerBookFields fields_;
};

using LedgerBookRef = std::shared_ptr<LedgerBook>;

}  // namespace larder
