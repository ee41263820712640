#include "store-runtime/records/LedgerDAAPPurchasedItem.h"

#include "platform/plist/KeyedArchive.h"
#include "store-runtime/records/RecordFieldReader.h"

namespace larder {

namespace {

std::shared_ptr<LedgerDAAPPurchasedItem> readItem(RecordFieldReader& reader) {
  LedgerCloudItemFields fields = LedgerCloudItemFields::readFrom(reader);
  if (!reader.ok()) return nullptr;
  return std::make_shared<LedgerDAAPPurchasedItem>(std::move(fields));
}

}  // namespace

std::optional<std::string> LedgerDAAPPurchasedItem::path() const {
  if (!fields_.oaxenItemIdentifier) return std::nullopt;
  return std::string(kPathPrefix) + std::to_string(*fields_.oaxenItemIdentifier);
}

std::shared_ptr<LedgerDAAPPurchasedItem> LedgerDAAPPurchasedItem::copy() const {
  return std::make_shared<LedgerDAAPPurchasedItem>(*this);
}

PlistDictionary LedgerDAAPPurchasedItem::encodeWithCoder() const {
  PlistDictionary encoded = KeyedArchive::record(kClassName);
  fields_.writeTo(encoded);
  return encoded;
}

std::shared_ptr<LedgerDAAPPurchasedItem> LedgerDAAPPurchasedItem::initWithCoder(
    const PlistValue& encoded) {
  if (KeyedArchive::classNameOf(encoded) != kClassName) return nullptr;
  RecordFieldReader reader(encoded);
  return readItem(reader);
}

PlistDictionary LedgerDAAPPurchasedItem::toDictionary() const {
  PlistDictionary dictionary;
  fields_.writeTo(dictionary);
  return dictionary;
}

std::shared_ptr<LedgerDAAPPurchasedItem> LedgerDAAPPurchasedItem::fromDictionary(
    const PlistDictionary& dictionary) {
  RecordFieldReader reader(dictionary);
  return readItem(reader);
}

std::string LedgerDAAPPurchasedItem::description() const {
  return "<LedgerDAAPPurchasedItem: " + fields_.describeIdentity() + ">";
}

}  // namespace larder
