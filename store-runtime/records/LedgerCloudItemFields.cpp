#include "store-runtime/records/LedgerCloudItemFields.h"

#include "store-runtime/records/RecordFieldReader.h"
#include "store-runtime/records/RecordFieldWriter.h"

namespace larder {

namespace {

std::string describe(const std::optional<std::uint64_t>& value) {
  return value ? std::to_string(*value) : "(null)";
}

std::string describe(const std::optional<std::string>& value) {
  return value.value_or("(null)");
}

}  // namespace

void LedgerCloudItemFields::writeTo(PlistDictionary& target) const {
  RecordFieldWriter writer(target);
  writer.put("itemIdentifier", itemIdentifier);
  writer.put("title", title);
  writer.put("uniqueIdentifier", uniqueIdentifier);
  writer.put("publicationVersion", publicationVersion);
  writer.put("publicationDisplayVersion", publicationDisplayVersion);
  writer.put("author", author);
  writer.put("category", category);
  writer.put("sortName", sortName);
  writer.put("coverImageURL", coverImageURL);
  writer.put("purchaseDate", purchaseDate);
  writer.put("daapDictionary", daapDictionary);
  writer.put("daapItemIdentifier", daapItemIdentifier);
  writer.put("daapPurchasedToken", daapPurchasedToken);
  writer.put("oaxenItemIdentifier", oaxenItemIdentifier);
  writer.put("expectedReleaseDate", expectedReleaseDate);
  writer.put("downloadAssetSize", downloadAssetSize);
  writer.put("redownloadBuyParams", redownloadBuyParams);
  writer.put("updateBuyParams", updateBuyParams);
}

LedgerCloudItemFields LedgerCloudItemFields::readFrom(RecordFieldReader& reader) {
  LedgerCloudItemFields fields;
  fields.itemIdentifier = reader.unsignedInteger("itemIdentifier");
  fields.title = reader.string("title");
  fields.uniqueIdentifier = reader.string("uniqueIdentifier");
  fields.publicationVersion = reader.unsignedInteger("publicationVersion");
  fields.publicationDisplayVersion = reader.string("publicationDisplayVersion");
  fields.author = reader.string("author");
  fields.category = reader.string("category");
  fields.sortName = reader.string("sortName");
  fields.coverImageURL = reader.string("coverImageURL");
  fields.purchaseDate = reader.date("purchaseDate");
  fields.daapDictionary = reader.dictionary("daapDictionary");
  fields.daapItemIdentifier = reader.unsignedInteger("daapItemIdentifier");
  fields.daapPurchasedToken = reader.unsignedInteger("daapPurchasedToken");
  fields.oaxenItemIdentifier = reader.unsignedInteger("oaxenItemIdentifier");
  fields.expectedReleaseDate = reader.date("expectedReleaseDate");
  fields.downloadAssetSize = reader.unsignedInteger("downloadAssetSize");
  fields.redownloadBuyParams = reader.string("redownloadBuyParams");
  fields.updateBuyParams = reader.string("updateBuyParams");
  return fields;
}

std::optional<TillPurchase> LedgerCloudItemFields::redownloadPurchase() const {
  if (!redownloadBuyParams || redownloadBuyParams->empty()) return std::nullopt;
  TillPurchase purchase = TillPurchase::purchaseWithBuyParameters(*redownloadBuyParams);
  // The record knows its item for certain; the parameters only may.
  if (itemIdentifier) purchase.setItemIdentifier(*itemIdentifier);
  purchase.setIsRedownload(true);
  return purchase;
}

std::string LedgerCloudItemFields::describeIdentity() const {
  return "itemIdentifier=" + describe(itemIdentifier) + " title=" + describe(title) +
         " oaxenItemIdentifier=" + describe(oaxenItemIdentifier);
}

}  // namespace larder
