#include "store-runtime/records/VendPurchaseRecord.h"

#include "platform/system/Bundle.h"

namespace larder {

namespace {

std::optional<std::string> optionalString(const PlistValue& value) {
  const std::string* text = value.string();
  return text ? std::optional<std::string>(*text) : std::nullopt;
}

PlistValue numberOrString(const PlistValue& value) {
  return value.isNumber() || value.isString() ? value : PlistValue();
}

}  // namespace

VendPurchaseRecord VendPurchaseRecord::fromDictionary(const PlistDictionary& dictionary) {
  PlistValue wrapped(dictionary);
  VendPurchaseRecord record;
  record.bundleIdentifier = optionalString(wrapped["bundleIdentifier"]);
  record.bundleVersion = optionalString(wrapped["bundleVersion"]);
  record.wareID = numberOrString(wrapped["wareID"]);
  record.installerVersionID = numberOrString(wrapped["installerVersionID"]);
  record.opaqueAccountIDString = optionalString(wrapped["opaqueAccountIDString"]);
  if (const PlistDate* date = wrapped["purchaseDate"].date()) record.purchaseDate = *date;
  return record;
}

std::optional<VendPurchaseRecord> VendPurchaseRecord::purchaseRecordFromBundleAtPath(
    const std::string& path) {
  std::optional<Bundle> bundle = Bundle::open(path);
  if (!bundle) return std::nullopt;
  std::optional<PlistValue> plist = bundle->readPropertyList(Bundle::kPurchaseFileName);
  if (!plist || !plist->isDictionary()) return std::nullopt;
  return fromDictionary(*plist->dictionary());
}

}  // namespace larder
