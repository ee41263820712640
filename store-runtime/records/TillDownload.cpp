#include "store-runtime/records/TillDownload.h"

#include "platform/plist/KeyedArchive.h"
#include "store-runtime/records/RecordFieldReader.h"
#include "store-runtime/records/RecordFieldWriter.h"

namespace larder {

namespace {

// The two forms differ only in how the metadata and the assets are
// written: as records of their own in the archive, as plain dictionaries
// on the wire.
enum class Form { Archive, Wire };

void putLocalFields(PlistDictionary& dictionary, const TillDownloadFields& fields) {
  RecordFieldWriter writer(dictionary);
  writer.put("downloadType", fields.downloadType);
  writer.put("relaunchAppWithBundleURL", fields.relaunchAppWithBundleURL);
  writer.put("skipAssetDownloadIfNotAlreadyOnDisk", fields.skipAssetDownloadIfNotAlreadyOnDisk);
  writer.put("status", PlistDictionary{{"isPaused", fields.status.isPaused},
                                       {"isFailed", fields.status.isFailed}});
  writer.put("progress", fields.progress);
  writer.put("installedPath", fields.installedPath);
}

void putFields(PlistDictionary& dictionary, const TillDownloadFields& fields, Form form) {
  PlistArray assets;
  assets.reserve(fields.assets.size());
  for (const TillDownloadAsset& asset : fields.assets) {
    assets.emplace_back(form == Form::Archive ? asset.encodeWithCoder() : asset.toDictionary());
  }
  dictionary.insert_or_assign("metadata", form == Form::Archive ? fields.metadata.encodeWithCoder()
                                                                : fields.metadata.toDictionary());
  dictionary.insert_or_assign("assets", std::move(assets));
  putLocalFields(dictionary, fields);
}

std::optional<TillDownloadMetadata> readMetadata(const PlistValue& stored, Form form) {
  if (form == Form::Archive) return TillDownloadMetadata::initWithCoder(stored);
  const PlistDictionary* dictionary = stored.dictionary();
  if (!dictionary) return std::nullopt;
  return TillDownloadMetadata::fromDictionary(*dictionary);
}

std::optional<TillDownloadAsset> readAsset(const PlistValue& stored, Form form) {
  if (form == Form::Archive) return TillDownloadAsset::initWithCoder(stored);
  const PlistDictionary* dictionary = stored.dictionary();
  if (!dictionary) return std::nullopt;
  return TillDownloadAsset::fromDictionary(*dictionary);
}

std::optional<std::vector<TillDownloadAsset>> readAssets(const PlistValue& stored, Form form) {
  const PlistArray* items = stored.array();
  if (!items) return std::nullopt;
  std::vector<TillDownloadAsset> assets;
  assets.reserve(items->size());
  for (const PlistValue& item : *items) {
    std::optional<TillDownloadAsset> asset = readAsset(item, form);
    if (!asset) return std::nullopt;
    assets.push_back(std::move(*asset));
  }
  return assets;
}

bool readStatus(RecordFieldReader& reader, TillDownloadStatus& status) {
  std::optional<PlistDictionary> stored = reader.dictionary("status");
  if (!stored) return reader.ok();
  RecordFieldReader statusReader(*stored);
  status.isPaused = statusReader.boolean("isPaused").value_or(false);
  status.isFailed = statusReader.boolean("isFailed").value_or(false);
  return statusReader.ok();
}

std::shared_ptr<TillDownload> readDownload(const PlistDictionary& source, Form form) {
  RecordFieldReader reader(source);
  std::optional<TillDownloadMetadata> metadata = readMetadata(reader.value("metadata"), form);
  std::optional<std::vector<TillDownloadAsset>> assets = readAssets(reader.value("assets"), form);
  if (!metadata || !assets) return nullptr;
  // The archive keeps whatever was archived; a download that arrives from
  // outside must be one that can run.
  if (form == Form::Wire && assets->empty()) return nullptr;
  TillDownloadFields fields;
  fields.metadata = std::move(*metadata);
  fields.assets = std::move(*assets);
  fields.downloadType = reader.integer("downloadType").value_or(TillDownload::kInstall);
  fields.relaunchAppWithBundleURL = reader.string("relaunchAppWithBundleURL");
  fields.skipAssetDownloadIfNotAlreadyOnDisk =
      reader.boolean("skipAssetDownloadIfNotAlreadyOnDisk").value_or(false);
  fields.progress = reader.real("progress").value_or(0);
  fields.installedPath = reader.string("installedPath");
  if (!readStatus(reader, fields.status) || !reader.ok()) return nullptr;
  if (fields.progress < 0 || fields.progress > 1) return nullptr;
  return std::make_shared<TillDownload>(std::move(fields));
}

}  // namespace

std::shared_ptr<TillDownload> TillDownload::initWithAssets(std::vector<TillDownloadAsset> assets,
                                                           TillDownloadMetadata metadata) {
  TillDownloadFields fields;
  fields.assets = std::move(assets);
  fields.metadata = std::move(metadata);
  return std::make_shared<TillDownload>(std::move(fields));
}

TillDownloadFields TillDownload::snapshot() const {
  MutexLock lock(mutex_);
  return fields_;
}

void TillDownload::update(const std::function<void(TillDownloadFields&)>& change) {
  MutexLock lock(mutex_);
  change(fields_);
}

TillDownloadMetadata TillDownload::metadata() const {
  return field(&TillDownloadFields::metadata);
}

void TillDownload::setMetadata(TillDownloadMetadata metadata) {
  setField(&TillDownloadFields::metadata, std::move(metadata));
}

std::vector<TillDownloadAsset> TillDownload::assets() const {
  return field(&TillDownloadFields::assets);
}

void TillDownload::setAssets(std::vector<TillDownloadAsset> assets) {
  setField(&TillDownloadFields::assets, std::move(assets));
}

std::int64_t TillDownload::downloadType() const {
  return field(&TillDownloadFields::downloadType);
}

void TillDownload::setDownloadType(std::int64_t type) {
  setField(&TillDownloadFields::downloadType, type);
}

std::optional<std::string> TillDownload::relaunchAppWithBundleURL() const {
  return field(&TillDownloadFields::relaunchAppWithBundleURL);
}

void TillDownload::setRelaunchAppWithBundleURL(std::optional<std::string> url) {
  setField(&TillDownloadFields::relaunchAppWithBundleURL, std::move(url));
}

bool TillDownload::skipAssetDownloadIfNotAlreadyOnDisk() const {
  return field(&TillDownloadFields::skipAssetDownloadIfNotAlreadyOnDisk);
}

void TillDownload::setSkipAssetDownloadIfNotAlreadyOnDisk(bool value) {
  setField(&TillDownloadFields::skipAssetDownloadIfNotAlreadyOnDisk, value);
}

TillDownloadStatus TillDownload::status() const {
  return field(&TillDownloadFields::status);
}

void TillDownload::setStatus(TillDownloadStatus status) {
  setField(&TillDownloadFields::status, status);
}

double TillDownload::progress() const {
  return field(&TillDownloadFields::progress);
}

std::optional<std::string> TillDownload::installedPath() const {
  return field(&TillDownloadFields::installedPath);
}

void TillDownload::setProgress(double fraction) {
  setField(&TillDownloadFields::progress, fraction);
}

PlistDictionary TillDownload::encodeWithCoder() const {
  PlistDictionary encoded = KeyedArchive::record(kClassName);
  putFields(encoded, snapshot(), Form::Archive);
  return encoded;
}

std::shared_ptr<TillDownload> TillDownload::initWithCoder(const PlistValue& encoded) {
  const PlistDictionary* dictionary = encoded.dictionary();
  if (!dictionary || KeyedArchive::classNameOf(encoded) != kClassName) return nullptr;
  return readDownload(*dictionary, Form::Archive);
}

PlistDictionary TillDownload::toDictionary() const {
  PlistDictionary dictionary;
  putFields(dictionary, snapshot(), Form::Wire);
  return dictionary;
}

std::shared_ptr<TillDownload> TillDownload::fromDictionary(const PlistDictionary& dictionary) {
  return readDownload(dictionary, Form::Wire);
}

std::string TillDownload::description() const {
  TillDownloadFields fields = snapshot();
  std::string text =
      "<TillDownload: itemIdentifier=" + std::to_string(fields.metadata.itemIdentifier()) +
      " bundleIdentifier=" + fields.metadata.bundleIdentifier() +
      " bundleVersion=" + fields.metadata.bundleVersion() +
      " downloadType=" + std::to_string(fields.downloadType) +
      " assets=" + std::to_string(fields.assets.size());
  if (fields.status.isPaused) text += " paused";
  if (fields.status.isFailed) text += " failed";
  return text + ">";
}

}  // namespace larder
