#pragma once

#include <optional>
#include <string>

#include "larder-store/StoreCatalogue.h"
#include "larder-store/StoreItem.h"
#include "larder-store/StoreReply.h"
#include "platform/value/PlistValue.h"

namespace larder {

// The update check route. The client reports the store software it has,
// a dictionary with "local-software" and "bundled-software" arrays of
// { ware-id, installed-version-identifier, HostBundleIdentifier,
// HostBundleShortVersionString }; the answer holds one entry for every
// reported application that the catalogue has in a greater version:
// { items: [...], incompatible-items: [...] }, the items marked
// incompatible in the second list. Entries keep the order of the report,
// local software first, and an item is listed once however often it is
// reported.
class StoreUpdateCheck {
 public:
  explicit StoreUpdateCheck(const StoreCatalogue& catalogue) : catalogue_(catalogue) {}

  // `body` as the HTTP layer decoded it (gzip taken off); nullopt when it
  // could not be decoded.
  [[nodiscard]] StoreReply answer(const std::optional<std::string>& body) const;

  // The catalogue item a reported entry means: by its "ware-id" (decimal
  // text or integer), else by its "HostBundleIdentifier".
  [[nodiscard]] const StoreItem* itemForEntry(const PlistValue& entry) const;
  // Whether the catalogue's version is greater than the one the entry
  // reports; an entry that reports none has an older one.
  static bool isNewerThanReported(const StoreItem& item, const PlistValue& entry);
  // One element of "items" or "incompatible-items".
  static PlistDictionary updateItem(const StoreItem& item, const PlistValue& entry);

 private:
  const StoreCatalogue& catalogue_;
};

}  // namespace larder
