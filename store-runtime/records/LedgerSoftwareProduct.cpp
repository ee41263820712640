#include "store-runtime/records/LedgerSoftwareProduct.h"

#include "platform/plist/KeyedArchive.h"

namespace larder {

namespace {

// The keys of the wire form and of the archive are the field names.
template <typename T>
void putOptional(PlistDictionary& dictionary, const char* key, const std::optional<T>& value) {
  if (value) dictionary.emplace(key, *value);
}

void putFields(PlistDictionary& dictionary, const LedgerSoftwareProductFields& fields) {
  dictionary.emplace("bundlePath", fields.bundlePath);
  putOptional(dictionary, "bundleIdentifier", fields.bundleIdentifier);
  putOptional(dictionary, "bundleVersion", fields.bundleVersion);
  putOptional(dictionary, "itemIdentifier", fields.itemIdentifier);
  putOptional(dictionary, "versionIdentifier", fields.versionIdentifier);
  putOptional(dictionary, "accountOpaqueID", fields.accountOpaqueID);
  putOptional(dictionary, "purchaseDate", fields.purchaseDate);
  dictionary.emplace("installed", fields.installed);
  dictionary.emplace("source", fields.source);
  dictionary.emplace("isLegacyApp", fields.isLegacyApp);
  dictionary.emplace("metadataChangeIsExpected", fields.metadataChangeIsExpected);
  putOptional(dictionary, "expectedBundleVersion", fields.expectedBundleVersion);
  putOptional(dictionary, "expectedStoreVersion", fields.expectedStoreVersion);
}

// Readers that accept a value only of the expected type: a field of the
// wrong type reads as absent and `ok` turns false.
class FieldReader {
 public:
  explicit FieldReader(const PlistValue& source) : source_(source) {}

  std::optional<std::string> string(std::string_view key) {
    const PlistValue& value = source_[key];
    if (value.isNull()) return std::nullopt;
    if (const std::string* text = value.string()) return *text;
    ok = false;
    return std::nullopt;
  }
  std::optional<std::int64_t> integer(std::string_view key) {
    const PlistValue& value = source_[key];
    if (value.isNull()) return std::nullopt;
    if (value.isNumber()) return value.int64Value();
    ok = false;
    return std::nullopt;
  }
  std::optional<std::uint64_t> unsignedInteger(std::string_view key) {
    const PlistValue& value = source_[key];
    if (value.isNull()) return std::nullopt;
    if (value.isNumber()) return value.uint64Value();
    ok = false;
    return std::nullopt;
  }
  std::optional<PlistDate> date(std::string_view key) {
    const PlistValue& value = source_[key];
    if (value.isNull()) return std::nullopt;
    if (const PlistDate* date = value.date()) return *date;
    if (value.isNumber()) return PlistDate{value.doubleValue()};
    ok = false;
    return std::nullopt;
  }
  bool boolean(std::string_view key) { return integer(key).value_or(0) != 0; }

  bool ok = true;

 private:
  const PlistValue& source_;
};

LedgerSoftwareProductFields readFields(FieldReader& reader) {
  LedgerSoftwareProductFields fields;
  fields.bundlePath = reader.string("bundlePath").value_or("");
  fields.bundleIdentifier = reader.string("bundleIdentifier");
  fields.bundleVersion = reader.string("bundleVersion");
  fields.itemIdentifier = reader.unsignedInteger("itemIdentifier");
  fields.versionIdentifier = reader.integer("versionIdentifier");
  fields.accountOpaqueID = reader.string("accountOpaqueID");
  fields.purchaseDate = reader.date("purchaseDate");
  fields.installed = reader.boolean("installed");
  fields.source = reader.integer("source").value_or(0);
  fields.isLegacyApp = reader.boolean("isLegacyApp");
  fields.metadataChangeIsExpected = reader.boolean("metadataChangeIsExpected");
  fields.expectedBundleVersion = reader.string("expectedBundleVersion");
  fields.expectedStoreVersion = reader.integer("expectedStoreVersion");
  return fields;
}

template <typename T>
std::string describeOptional(const std::optional<T>& value) {
  if (!value) return "(null)";
  if constexpr (std::is_same_v<T, std::string>) {
    return *value;
  } else if constexpr (std::is_same_v<T, PlistDate>) {
    return std::to_string(value->secondsSince1970);
  } else {
    return std::to_string(*value);
  }
}

}  // namespace

LedgerSoftwareProductFields LedgerSoftwareProduct::snapshot() const {
  MutexLock lock(mutex_);
  return fields_;
}

void LedgerSoftwareProduct::update(
    const std::function<void(LedgerSoftwareProductFields&)>& change) {
  MutexLock lock(mutex_);
  change(fields_);
}

std::string LedgerSoftwareProduct::bundlePath() const {
  MutexLock lock(mutex_);
  return fields_.bundlePath;
}

std::optional<std::string> LedgerSoftwareProduct::bundleIdentifier() const {
  MutexLock lock(mutex_);
  return fields_.bundleIdentifier;
}

std::optional<std::string> LedgerSoftwareProduct::bundleVersion() const {
  MutexLock lock(mutex_);
  return fields_.bundleVersion;
}

std::optional<std::uint64_t> LedgerSoftwareProduct::itemIdentifier() const {
  MutexLock lock(mutex_);
  return fields_.itemIdentifier;
}

PlistDictionary LedgerSoftwareProduct::encodeWithCoder() const {
  PlistDictionary encoded = KeyedArchive::record(kClassName);
  putFields(encoded, snapshot());
  return encoded;
}

std::shared_ptr<LedgerSoftwareProduct> LedgerSoftwareProduct::initWithCoder(
    const PlistValue& encoded) {
  if (KeyedArchive::classNameOf(encoded) != kClassName) return nullptr;
  FieldReader reader(encoded);
  LedgerSoftwareProductFields fields = readFields(reader);
  if (!reader.ok || fields.bundlePath.empty()) return nullptr;
  return std::make_shared<LedgerSoftwareProduct>(std::move(fields));
}

PlistDictionary LedgerSoftwareProduct::toDictionary() const {
  PlistDictionary dictionary;
  putFields(dictionary, snapshot());
  return dictionary;
}

LedgerSoftwareProductFields LedgerSoftwareProduct::fieldsFromDictionary(
    const PlistDictionary& dictionary) {
  PlistValue wrapped(dictionary);
  FieldReader reader(wrapped);
  return readFields(reader);
}

std::string LedgerSoftwareProduct::description() const {
  LedgerSoftwareProductFields fields = snapshot();
  return "<LedgerSoftwareProduct: bundleIdentifier=" + describeOptional(fields.bundleIdentifier) +
         " bundleVersion=" + describeOptional(fields.bundleVersion) +
         " itemIdentifier=" + describeOptional(fields.itemIdentifier) +
         " versionIdentifier=" + describeOptional(fields.versionIdentifier) +
         " bundlePath=" + fields.bundlePath + " installed=" + (fields.installed ? "1" : "0") +
         " source=" + std::to_string(fields.source) + ">";
}

}  // namespace larder
