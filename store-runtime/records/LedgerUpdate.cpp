#include "store-runtime/records/LedgerUpdate.h"

#include "platform/log/TillLogManager.h"
#include "platform/plist/KeyedArchive.h"
#include "store-runtime/records/RecordFieldReader.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerUpdate";
constexpr std::string_view kDictionaryKey = "dictionary";

enum class Kind { Identifier, String, Date, Boolean, Integer };

// How a field by name maps to a key of the item. One table serves the
// check of an item, the wire form and its reading, so the three cannot
// drift apart.
struct ItemField {
  std::string_view fieldName;
  std::string_view itemKey;
  Kind kind;
};

constexpr ItemField kItemFields[] = {
    {"itemIdentifier", LedgerUpdate::kWareIDKey, Kind::Identifier},
    {"bundleID", LedgerUpdate::kBundleIDKey, Kind::String},
    {"title", LedgerUpdate::kTitleKey, Kind::String},
    {"version", LedgerUpdate::kVersionKey, Kind::String},
    {"actionParams", LedgerUpdate::kActionParamsKey, Kind::String},
    {"releaseDate", LedgerUpdate::kReleaseDateKey, Kind::Date},
    {"isStaged", LedgerUpdate::kIsStagedKey, Kind::Boolean},
    {"hasBeenSeenByUser", LedgerUpdate::kHasBeenSeenByUserKey, Kind::Boolean},
    {"autoUpdateAbortCode", LedgerUpdate::kAutoUpdateAbortCodeKey, Kind::Integer},
    {"firstAutoUpdateAttemptDate", LedgerUpdate::kFirstAutoUpdateAttemptDateKey, Kind::Date},
    {"didFailToAutoInstall", LedgerUpdate::kDidFailToAutoInstallKey, Kind::Boolean},
};

// The value under `key` in the type its kind has on the wire; nullopt when
// absent, and a failed reader when of the wrong type.
std::optional<PlistValue> readKind(RecordFieldReader& reader, std::string_view key, Kind kind) {
  auto boxed = [](const auto& value) -> std::optional<PlistValue> {
    if (!value) return std::nullopt;
    return PlistValue(*value);
  };
  switch (kind) {
    case Kind::Identifier:
      return boxed(reader.unsignedInteger(key));
    case Kind::String:
      return boxed(reader.string(key));
    case Kind::Date:
      return boxed(reader.date(key));
    case Kind::Boolean:
      return boxed(reader.boolean(key));
    case Kind::Integer:
      return boxed(reader.integer(key));
  }
  return std::nullopt;
}

// Marks that are plain values are always sent, so a client need not know
// their defaults; the store's fields and the date are sent only when known.
std::optional<PlistValue> defaultOnWire(Kind kind) {
  switch (kind) {
    case Kind::Boolean:
      return PlistValue(false);
    case Kind::Integer:
      return PlistValue(std::int64_t{0});
    default:
      return std::nullopt;
  }
}

// The item with every known key in the type of its kind: a value that
// converts is stored converted, one that doesn't is dropped with a log
// line. A store that sends a number for a version must not lose the whole
// item, and with it the cached record, over one field.
PlistDictionary readableItem(PlistDictionary item) {
  const PlistDictionary sent = item;
  RecordFieldReader reader(sent, RecordFieldReader::Reading::kConverting);
  for (const ItemField& field : kItemFields) {
    const auto found = item.find(field.itemKey);
    if (found == item.end()) continue;
    if (std::optional<PlistValue> value = readKind(reader, field.itemKey, field.kind)) {
      found->second = std::move(*value);
      continue;
    }
    TILL_LOG(2, "%@: Item %@ has an unreadable \"%@\" (%@); the field is skipped", kSpeaker,
             reader.value(LedgerUpdate::kWareIDKey), std::string(field.itemKey), found->second);
    item.erase(found);
  }
  return item;
}

}  // namespace

bool LedgerUpdate::isValidItem(const PlistDictionary& item) {
  RecordFieldReader reader(item, RecordFieldReader::Reading::kConverting);
  return reader.unsignedInteger(kWareIDKey).value_or(0) > 0;
}

std::shared_ptr<LedgerUpdate> LedgerUpdate::initWithDictionary(PlistDictionary item) {
  if (!isValidItem(item)) return nullptr;
  return std::make_shared<LedgerUpdate>(Validated{}, readableItem(std::move(item)));
}

LedgerUpdate::LedgerUpdate(Validated, PlistDictionary item)
    : item_(std::move(item)),
      itemIdentifierValue_(RecordFieldReader(item_).unsignedInteger(kWareIDKey).value_or(0)),
      bundleID_(RecordFieldReader(item_).string(kBundleIDKey)) {}

PlistDictionary LedgerUpdate::dictionary() const {
  MutexLock lock(mutex_);
  return item_;
}

std::optional<std::string> LedgerUpdate::stringForKey(std::string_view key) const {
  MutexLock lock(mutex_);
  return RecordFieldReader(item_).string(key);
}

bool LedgerUpdate::boolForKey(std::string_view key) const {
  MutexLock lock(mutex_);
  return RecordFieldReader(item_).boolean(key).value_or(false);
}

std::optional<PlistDate> LedgerUpdate::dateForKey(std::string_view key) const {
  MutexLock lock(mutex_);
  return RecordFieldReader(item_).date(key);
}

void LedgerUpdate::setValueForKey(std::string_view key, PlistValue value) {
  MutexLock lock(mutex_);
  item_.insert_or_assign(std::string(key), std::move(value));
}

PlistValue LedgerUpdate::itemIdentifier() const {
  MutexLock lock(mutex_);
  const auto found = item_.find(kWareIDKey);
  return found == item_.end() ? PlistValue() : found->second;
}

std::optional<std::string> LedgerUpdate::title() const {
  return stringForKey(kTitleKey);
}
std::optional<std::string> LedgerUpdate::version() const {
  return stringForKey(kVersionKey);
}
std::optional<std::string> LedgerUpdate::actionParams() const {
  return stringForKey(kActionParamsKey);
}

std::optional<PlistDate> LedgerUpdate::releaseDate() const {
  return dateForKey(kReleaseDateKey);
}

bool LedgerUpdate::isStaged() const {
  return boolForKey(kIsStagedKey);
}
void LedgerUpdate::setIsStaged(bool staged) {
  setValueForKey(kIsStagedKey, staged);
}

bool LedgerUpdate::hasBeenSeenByUser() const {
  return boolForKey(kHasBeenSeenByUserKey);
}
void LedgerUpdate::setHasBeenSeenByUser(bool seen) {
  setValueForKey(kHasBeenSeenByUserKey, seen);
}

std::int64_t LedgerUpdate::autoUpdateAbortCode() const {
  MutexLock lock(mutex_);
  return RecordFieldReader(item_).integer(kAutoUpdateAbortCodeKey).value_or(0);
}
void LedgerUpdate::setAutoUpdateAbortCode(std::int64_t code) {
  setValueForKey(kAutoUpdateAbortCodeKey, code);
}

std::optional<PlistDate> LedgerUpdate::firstAutoUpdateAttemptDate() const {
  return dateForKey(kFirstAutoUpdateAttemptDateKey);
}
void LedgerUpdate::setFirstAutoUpdateAttemptDate(std::optional<PlistDate> date) {
  if (date) {
    setValueForKey(kFirstAutoUpdateAttemptDateKey, *date);
    return;
  }
  MutexLock lock(mutex_);
  item_.erase(std::string(kFirstAutoUpdateAttemptDateKey));
}

bool LedgerUpdate::didFailToAutoInstall() const {
  return boolForKey(kDidFailToAutoInstallKey);
}
void LedgerUpdate::setDidFailToAutoInstall(bool failed) {
  setValueForKey(kDidFailToAutoInstallKey, failed);
}

PlistDictionary LedgerUpdate::encodeWithCoder() const {
  PlistDictionary encoded = KeyedArchive::record(kClassName);
  encoded.emplace(kDictionaryKey, dictionary());
  return encoded;
}

std::shared_ptr<LedgerUpdate> LedgerUpdate::initWithCoder(const PlistValue& encoded) {
  if (KeyedArchive::classNameOf(encoded) != kClassName) return nullptr;
  const PlistDictionary* item = encoded[kDictionaryKey].dictionary();
  return item ? initWithDictionary(*item) : nullptr;
}

PlistDictionary LedgerUpdate::toDictionary() const {
  PlistDictionary item = dictionary();
  PlistDictionary wire;
  RecordFieldReader reader(item);
  for (const ItemField& field : kItemFields) {
    std::optional<PlistValue> value = readKind(reader, field.itemKey, field.kind);
    if (!value) value = defaultOnWire(field.kind);
    if (value) wire.emplace(field.fieldName, std::move(*value));
  }
  wire.emplace(kDictionaryKey, std::move(item));
  return wire;
}

std::shared_ptr<LedgerUpdate> LedgerUpdate::fromDictionary(const PlistDictionary& dictionary) {
  RecordFieldReader reader(dictionary);
  PlistDictionary item =
      readableItem(reader.dictionary(kDictionaryKey).value_or(PlistDictionary{}));
  if (!reader.ok()) return nullptr;
  RecordFieldReader itemReader(item);
  for (const ItemField& field : kItemFields) {
    std::optional<PlistValue> sent = readKind(reader, field.fieldName, field.kind);
    if (!sent) continue;
    // A value that only repeats what the item already says (a default
    // included) leaves the item as it is, so the item round-trips exactly.
    std::optional<PlistValue> current = readKind(itemReader, field.itemKey, field.kind);
    if (!current) current = defaultOnWire(field.kind);
    if (sent != current) item.insert_or_assign(std::string(field.itemKey), std::move(*sent));
  }
  if (!reader.ok() || !itemReader.ok()) return nullptr;
  return initWithDictionary(std::move(item));
}

std::string LedgerUpdate::description() const {
  return "<LedgerUpdate: itemIdentifier=" + std::to_string(itemIdentifierValue()) +
         " bundleID=" + bundleID().value_or("(null)") + " version=" + version().value_or("(null)") +
         " title=" + title().value_or("(null)") + " isStaged=" + (isStaged() ? "1" : "0") +
         " abortCode=" + std::to_string(autoUpdateAbortCode()) + ">";
}

}  // namespace larder
