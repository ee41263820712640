#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"

namespace larder {

// One app update that the store offers: the store's item as it came,
// unknown keys included, plus the marks this machine keeps about it. The
// item is the record: `dictionary()` is what the update queue persists and
// merges, so the local marks live in it under keys of their own.
//
// Records are shared through std::shared_ptr: the update queue hands its
// own records to clients and keeps marking them, so every access takes the
// record's lock. The store's keys never change after the record is made;
// only the local marks do.
class LedgerUpdate {
  struct Validated {
    explicit Validated() = default;
  };

 public:
  static constexpr std::string_view kClassName = "LedgerUpdate";

  // The store's keys.
  static constexpr std::string_view kWareIDKey = "ware-id";
  static constexpr std::string_view kBundleIDKey = "bundle-id";
  static constexpr std::string_view kTitleKey = "title";
  static constexpr std::string_view kVersionKey = "version";
  static constexpr std::string_view kActionParamsKey = "action-params";
  static constexpr std::string_view kReleaseDateKey = "release-date";

  // The local marks. The "local." prefix keeps them apart from the store's
  // hyphenated keys, so that a merge in which the store's keys win leaves
  // them alone.
  static constexpr std::string_view kIsStagedKey = "local.isStaged";
  static constexpr std::string_view kHasBeenSeenByUserKey = "local.hasBeenSeenByUser";
  static constexpr std::string_view kAutoUpdateAbortCodeKey = "local.autoUpdateAbortCode";
  static constexpr std::string_view kFirstAutoUpdateAttemptDateKey =
      "local.firstAutoUpdateAttemptDate";
  static constexpr std::string_view kDidFailToAutoInstallKey = "local.didFailToAutoInstall";

  // The record of one item, or nullptr when the item has no "ware-id" above
  // 0, so that a caller can keep the good items of a list and drop the
  // others. A known key of another type is converted when it can be (a
  // number as version text, date text as a date) and otherwise left out:
  // one odd field costs that field, not the item.
  static std::shared_ptr<LedgerUpdate> initWithDictionary(PlistDictionary item);
  static bool isValidItem(const PlistDictionary& item);

  LedgerUpdate(Validated, PlistDictionary item);

  // A copy of the item with the local marks.
  [[nodiscard]] PlistDictionary dictionary() const;

  // The number as the store sent it, and its value.
  [[nodiscard]] PlistValue itemIdentifier() const;
  [[nodiscard]] std::uint64_t itemIdentifierValue() const { return itemIdentifierValue_; }
  [[nodiscard]] const std::optional<std::string>& bundleID() const { return bundleID_; }
  [[nodiscard]] std::optional<std::string> title() const;
  // The version the update brings.
  [[nodiscard]] std::optional<std::string> version() const;
  // The buy parameters to purchase the update with.
  [[nodiscard]] std::optional<std::string> actionParams() const;
  [[nodiscard]] std::optional<PlistDate> releaseDate() const;

  [[nodiscard]] bool isStaged() const;
  void setIsStaged(bool staged);
  [[nodiscard]] bool hasBeenSeenByUser() const;
  void setHasBeenSeenByUser(bool seen);
  // 0 for none.
  [[nodiscard]] std::int64_t autoUpdateAbortCode() const;
  void setAutoUpdateAbortCode(std::int64_t code);
  [[nodiscard]] std::optional<PlistDate> firstAutoUpdateAttemptDate() const;
  void setFirstAutoUpdateAttemptDate(std::optional<PlistDate> date);
  [[nodiscard]] bool didFailToAutoInstall() const;
  void setDidFailToAutoInstall(bool failed);

  // Keyed-archive form: { "$class", "dictionary": the item }.
  [[nodiscard]] PlistDictionary encodeWithCoder() const;
  static std::shared_ptr<LedgerUpdate> initWithCoder(const PlistValue& encoded);

  // Wire form: the field names, with "itemIdentifier" as uint64, plus
  // "dictionary", the whole item, so that nothing of the store's is lost
  // on the way to a client and back.
  [[nodiscard]] PlistDictionary toDictionary() const;
  // Starts from "dictionary" when present; a field given by name wins over
  // the item's value for it.
  static std::shared_ptr<LedgerUpdate> fromDictionary(const PlistDictionary& dictionary);

  [[nodiscard]] std::string description() const;

 private:
  [[nodiscard]] std::optional<std::string> stringForKey(std::string_view key) const;
  [[nodiscard]] bool boolForKey(std::string_view key) const;
  [[nodiscard]] std::optional<PlistDate> dateForKey(std::string_view key) const;
  void setValueForKey(std::string_view key, PlistValue value);

  mutable Mutex mutex_;
  PlistDictionary item_ GUARDED_BY(mutex_);
  // Store keys never change, so the ones that lists are searched by are
  // read once.
  std::uint64_t itemIdentifierValue_;
  std::optional<std::string> bundleID_;
};

using LedgerUpdateRef = std::shared_ptr<LedgerUpdate>;

}  // namespace larder
