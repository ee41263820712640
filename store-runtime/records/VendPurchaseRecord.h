#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/value/PlistValue.h"

namespace larder {

// The purchase record of an installed bundle, from its "purchase.plist".
// `wareID` and `installerVersionID` may be stored as strings or numbers.
struct VendPurchaseRecord {
  std::optional<std::string> bundleIdentifier;
  std::optional<std::string> bundleVersion;
  PlistValue wareID;
  PlistValue installerVersionID;
  std::optional<std::string> opaqueAccountIDString;
  std::optional<PlistDate> purchaseDate;

  // nullopt when the bundle has no readable record.
  static std::optional<VendPurchaseRecord> purchaseRecordFromBundleAtPath(const std::string& path);
  static VendPurchaseRecord fromDictionary(const PlistDictionary& dictionary);
};

}  // namespace larder
