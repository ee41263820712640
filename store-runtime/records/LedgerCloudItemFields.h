#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/value/PlistValue.h"
#include "store-runtime/records/TillPurchase.h"

namespace larder {

class RecordFieldReader;

// The fields that the cloud library fills in: everything a purchased item
// is. `LedgerBook` has them next to its local fields, and
// `LedgerDAAPPurchasedItem` is nothing else, so both records share this one
// list and its one encoding. Keys in every form are the member names.
struct LedgerCloudItemFields {
  std::optional<std::uint64_t> itemIdentifier;
  std::optional<std::string> title;
  // Stable across sources: the text of the item identifier, or a file path.
  std::optional<std::string> uniqueIdentifier;
  std::optional<std::uint64_t> publicationVersion;
  std::optional<std::string> publicationDisplayVersion;
  std::optional<std::string> author;
  std::optional<std::string> category;
  std::optional<std::string> sortName;
  std::optional<std::string> coverImageURL;
  std::optional<PlistDate> purchaseDate;
  // The whole DMAP item, as a property list.
  std::optional<PlistDictionary> daapDictionary;
  std::optional<std::uint64_t> daapItemIdentifier;
  std::optional<std::uint64_t> daapPurchasedToken;
  // The cloud library's own identifier: the key of its listings.
  std::optional<std::uint64_t> oaxenItemIdentifier;
  std::optional<PlistDate> expectedReleaseDate;
  std::optional<std::uint64_t> downloadAssetSize;
  std::optional<std::string> redownloadBuyParams;
  std::optional<std::string> updateBuyParams;

  void writeTo(PlistDictionary& target) const;
  // Wrong types clear the reader's `ok()`.
  static LedgerCloudItemFields readFrom(RecordFieldReader& reader);

  // The purchase that fetches the item again: its redownload parameters,
  // flagged as a redownload, for its item identifier. nullopt without
  // parameters.
  [[nodiscard]] std::optional<TillPurchase> redownloadPurchase() const;

  // "key=value" pairs of the identifying fields, for log lines.
  [[nodiscard]] std::string describeIdentity() const;

  friend bool operator==(const LedgerCloudItemFields&, const LedgerCloudItemFields&) = default;
};

}  // namespace larder
