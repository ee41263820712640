#include "store-runtime/records/SysupQuaymartUpdate.h"

#include "platform/plist/KeyedArchive.h"
#include "store-runtime/records/RecordFieldReader.h"
#include "store-runtime/records/RecordFieldWriter.h"

namespace larder {

namespace {

void putFields(PlistDictionary& target, const SysupQuaymartUpdateFields& fields) {
  RecordFieldWriter writer(target);
  writer.put("productKey", fields.productKey);
  writer.put("tags", fields.tags);
  writer.put("title", fields.title);
  writer.put("versionString", fields.versionString);
  writer.put("longDescription", fields.longDescription);
  writer.put("action", fields.action);
  writer.put("isCritical", fields.isCritical);
  writer.put("isRecommended", fields.isRecommended);
  writer.put("firmwareWarning", fields.firmwareWarning);
  writer.put("licenseAgreement", fields.licenseAgreement);
  writer.put("applicationIdentifiersToClose", fields.applicationIdentifiersToClose);
  writer.put("allowedToUseInstallLater", fields.allowedToUseInstallLater);
  if (!fields.downloadMetadata.empty()) writer.put("downloadMetadata", fields.downloadMetadata);
}

std::optional<SysupQuaymartUpdate> readUpdate(RecordFieldReader& reader) {
  SysupQuaymartUpdateFields fields;
  fields.productKey = reader.string("productKey").value_or("");
  fields.tags = reader.strings("tags").value_or(std::vector<std::string>{});
  fields.title = reader.string("title");
  fields.versionString = reader.string("versionString");
  fields.longDescription = reader.string("longDescription");
  fields.action = reader.integer("action").value_or(0);
  fields.isCritical = reader.boolean("isCritical").value_or(false);
  fields.isRecommended = reader.boolean("isRecommended").value_or(false);
  fields.firmwareWarning = reader.string("firmwareWarning");
  fields.licenseAgreement = reader.string("licenseAgreement");
  fields.applicationIdentifiersToClose =
      reader.strings("applicationIdentifiersToClose").value_or(std::vector<std::string>{});
  fields.allowedToUseInstallLater = reader.boolean("allowedToUseInstallLater").value_or(false);
  fields.downloadMetadata = reader.dictionary("downloadMetadata").value_or(PlistDictionary{});
  if (!reader.ok() || fields.productKey.empty()) return std::nullopt;
  return SysupQuaymartUpdate(std::move(fields));
}

}  // namespace

std::optional<std::string> SysupQuaymartUpdate::thumbnailImageURL() const {
  RecordFieldReader reader(fields_.downloadMetadata);
  return reader.string(kThumbnailImageURLKey);
}

PlistDictionary SysupQuaymartUpdate::encodeWithCoder() const {
  PlistDictionary encoded = KeyedArchive::record(kClassName);
  putFields(encoded, fields_);
  return encoded;
}

std::optional<SysupQuaymartUpdate> SysupQuaymartUpdate::initWithCoder(const PlistValue& encoded) {
  if (KeyedArchive::classNameOf(encoded) != kClassName) return std::nullopt;
  RecordFieldReader reader(encoded);
  return readUpdate(reader);
}

PlistDictionary SysupQuaymartUpdate::toDictionary() const {
  PlistDictionary dictionary;
  putFields(dictionary, fields_);
  return dictionary;
}

std::optional<SysupQuaymartUpdate> SysupQuaymartUpdate::fromDictionary(
    const PlistDictionary& dictionary) {
  RecordFieldReader reader(dictionary);
  return readUpdate(reader);
}

std::string SysupQuaymartUpdate::description() const {
  return "<SysupQuaymartUpdate: productKey=" + fields_.productKey +
         " title=" + fields_.title.value_or("(null)") +
         " version=" + fields_.versionString.value_or("(null)") +
         " action=" + std::to_string(fields_.action) + ">";
}

}  // namespace larder
