#include "store-runtime/records/TillDownloadMetadata.h"

#include "store-runtime/records/RecordFieldReader.h"
#include "store-runtime/records/RecordFieldWriter.h"

namespace larder {

namespace {

void putFields(RecordFieldWriter& writer, const TillDownloadMetadata& metadata) {
  writer.put("itemIdentifier", metadata.itemIdentifier());
  writer.put("bundleIdentifier", metadata.bundleIdentifier());
  writer.put("bundleVersion", metadata.bundleVersion());
  writer.put("title", metadata.title());
  writer.put("thumbnailImageURL", metadata.thumbnailImageURL());
  writer.put("preflightPackageURL", metadata.preflightPackageURL());
  writer.put("auxInfo", metadata.auxInfo());
  writer.put("isMDMProvided", metadata.isMDMProvided());
}

TillDownloadMetadata readFields(RecordFieldReader& reader) {
  TillDownloadMetadata metadata;
  metadata.setItemIdentifier(reader.unsignedInteger("itemIdentifier").value_or(0));
  metadata.setBundleIdentifier(reader.string("bundleIdentifier").value_or(""));
  metadata.setBundleVersion(reader.string("bundleVersion").value_or(""));
  metadata.setTitle(reader.string("title").value_or(""));
  metadata.setThumbnailImageURL(reader.string("thumbnailImageURL"));
  metadata.setPreflightPackageURL(reader.string("preflightPackageURL"));
  if (std::optional<PlistDictionary> info = reader.dictionary("auxInfo")) {
    metadata.setAuxInfo(std::move(*info));
  }
  metadata.setIsMDMProvided(reader.boolean("isMDMProvided").value_or(false));
  return metadata;
}

}  // namespace

PlistDictionary TillDownloadMetadata::encodeWithCoder() const {
  return RecordFieldWriter::archive(kClassName, *this, putFields);
}

std::optional<TillDownloadMetadata> TillDownloadMetadata::initWithCoder(const PlistValue& encoded) {
  return RecordFieldReader::unarchive(encoded, kClassName, readFields);
}

PlistDictionary TillDownloadMetadata::toDictionary() const {
  return RecordFieldWriter::dictionary(*this, putFields);
}

std::optional<TillDownloadMetadata> TillDownloadMetadata::fromDictionary(
    const PlistDictionary& dictionary) {
  return RecordFieldReader::read(dictionary, readFields);
}

std::string TillDownloadMetadata::description() const {
  return "<TillDownloadMetadata: itemIdentifier=" + std::to_string(itemIdentifier_) +
         " bundleIdentifier=" + bundleIdentifier_ + " bundleVersion=" + bundleVersion_ +
         " title=" + title_ + (isMDMProvided_ ? " managed" : "") + ">";
}

}  // namespace larder
