#include "dmap/DAAPItem.h"

#include <cstdio>

#include "platform/plist/KeyedArchive.h"

namespace larder {

namespace {

constexpr std::string_view kNameKey = "name";
constexpr std::string_view kAdditionalInfoKey = "additionalInfo";
constexpr std::string_view kSongArtistKey = "daap.songartist";
constexpr std::string_view kSongAlbumKey = "daap.songalbum";
constexpr std::string_view kSongAlbumArtistKey = "daap.songalbumartist";
constexpr std::string_view kSongAlbumIDKey = "daap.songalbumid";
constexpr std::string_view kItemIDKey = "dmap.itemid";
constexpr std::string_view kLongItemIDKey = "dmap.longitemid";
constexpr std::string_view kContainerItemIDKey = "dmap.containeritemid";
constexpr std::string_view kHasVideoKey = "hasVideo";
constexpr std::string_view kMediaKindKey = "mediaKind";
constexpr std::string_view kStoreMediaKindKey = "com.orvane.sonorel.mediakind";
// Archived info nests no deeper than what a parse can produce, with room.
constexpr int kMaxArchiveDepth = 64;

DAAPValue optionalString(const std::optional<std::string>& text) {
  return text ? DAAPValue(*text) : DAAPValue();
}

std::string describeOptional(const std::optional<std::string>& text) {
  return text ? *text : std::string("(null)");
}

// The string properties take text; nothing clears them; anything else
// leaves them as they are rather than storing a value of the wrong type.
void assignString(std::optional<std::string>& field, const DAAPValue& value) {
  if (value.isNull()) {
    field.reset();
  } else if (const std::string* text = value.string()) {
    field = *text;
  }
}

template <typename Number>
void assignNumber(Number& field, const DAAPValue& value) {
  if (value.isNull()) {
    field = 0;
  } else if (value.isNumber() || value.isString()) {
    field = static_cast<Number>(value.uint64Value());
  }
}

PlistValue archived(const DAAPValue& value);

PlistValue archivedDictionary(const DAAPDictionary& dictionary) {
  PlistDictionary entries;
  for (const auto& [key, element] : dictionary) {
    PlistValue encoded = archived(element);
    if (!encoded.isNull()) entries.emplace_hint(entries.end(), key.str(), std::move(encoded));
  }
  return KeyedArchive::dictionary(std::move(entries));
}

PlistValue archived(const DAAPValue& value) {
  if (const DAAPDictionary* dictionary = value.dictionary()) return archivedDictionary(*dictionary);
  if (const DAAPArray* array = value.array()) {
    PlistArray items;
    for (const DAAPValue& element : *array) {
      PlistValue encoded = archived(element);
      if (!encoded.isNull()) items.push_back(std::move(encoded));
    }
    return KeyedArchive::array(std::move(items));
  }
  if (DAAPItemRef item = value.item()) return item->encodeWithCoder();
  return value.toPlist();
}

DAAPItemRef decodeItem(const PlistValue& encoded, int depth);

// Reads the archive form back; whatever does not decode is dropped.
DAAPValue unarchived(const PlistValue& encoded, int depth) {
  if (depth > kMaxArchiveDepth) return {};
  if (!encoded.isDictionary())
    return encoded.isArray() ? DAAPValue() : DAAPValue::fromPlist(encoded);
  const std::string_view className = KeyedArchive::classNameOf(encoded);
  if (className == KeyedArchive::kDictionaryClass) {
    DAAPDictionary dictionary;
    if (const PlistDictionary* entries = encoded["$entries"].dictionary()) {
      for (const auto& [key, element] : *entries) {
        DAAPValue value = unarchived(element, depth + 1);
        if (!value.isNull())
          dictionary.emplace_hint(dictionary.end(), DAAPKey(key), std::move(value));
      }
    }
    return dictionary;
  }
  if (className == KeyedArchive::kArrayClass) {
    DAAPArray array;
    if (const PlistArray* items = encoded["$items"].array()) {
      for (const PlistValue& element : *items) {
        DAAPValue value = unarchived(element, depth + 1);
        if (!value.isNull()) array.push_back(std::move(value));
      }
    }
    return array;
  }
  if (className == DAAPItem::kClassName) return decodeItem(encoded, depth + 1);
  return {};
}

DAAPItemRef decodeItem(const PlistValue& encoded, int depth) {
  if (depth > kMaxArchiveDepth || KeyedArchive::classNameOf(encoded) != DAAPItem::kClassName) {
    return nullptr;
  }
  DAAPItemRef item = DAAPItem::item();
  if (const std::string* name = encoded[kNameKey].string()) item->setName(*name);
  DAAPValue info = unarchived(encoded[kAdditionalInfoKey], depth + 1);
  if (DAAPDictionary* dictionary = info.dictionary()) item->setMutableInfo(std::move(*dictionary));
  return item;
}

}  // namespace

DAAPItemRef DAAPItem::item() {
  return std::make_shared<DAAPItem>();
}

DAAPItemRef DAAPItem::itemWithItem(const DAAPItem& other) {
  DAAPItemRef item = DAAPItem::item();
  item->updateItemWithItem(other);
  return item;
}

void DAAPItem::freeze() {
  if (isFrozen_) return;
  isFrozen_ = true;
  // Moving rather than copying: the mutable dictionary is dropped anyway,
  // and a parse freezes every item it makes.
  frozenInfo_ = mutableInfo_ ? std::move(*mutableInfo_) : DAAPDictionary{};
  mutableInfo_.reset();
}

void DAAPItem::thaw() {
  if (!isFrozen_) return;
  isFrozen_ = false;
  mutableInfo_ = std::move(frozenInfo_);
  frozenInfo_.reset();
}

const DAAPDictionary* DAAPItem::additionalInfo() const {
  return isFrozen_ ? frozenInfo() : mutableInfo();
}

const DAAPDictionary* DAAPItem::frozenInfo() const {
  return frozenInfo_ ? &*frozenInfo_ : nullptr;
}

const DAAPDictionary* DAAPItem::mutableInfo() const {
  return mutableInfo_ ? &*mutableInfo_ : nullptr;
}

DAAPValue DAAPItem::objectForKey(std::string_view key) const {
  if (key == kSongArtistKey) return optionalString(songartist_);
  if (key == kSongAlbumKey) return optionalString(songalbum_);
  if (key == kSongAlbumIDKey) return std::to_string(songalbumid_);
  const DAAPDictionary* info = additionalInfo();
  return info ? lookup(*info, key) : DAAPValue();
}

void DAAPItem::setObject(DAAPValue value, const DAAPKey& key) {
  if (isFrozen_) return;
  if (value.isNull()) {
    if (mutableInfo_) {
      const auto found = mutableInfo_->find(key.view());
      if (found != mutableInfo_->end()) mutableInfo_->erase(found);
    }
    return;
  }
  if (!mutableInfo_) mutableInfo_.emplace();
  mutableInfo_->insert_or_assign(key, std::move(value));
}

DAAPValue DAAPItem::valueForKey(std::string_view key) const {
  if (key == "name") return optionalString(name_);
  if (key == "songalbum") return optionalString(songalbum_);
  if (key == "songartist") return optionalString(songartist_);
  if (key == "songalbumartist") return optionalString(songalbumartist_);
  if (key == "itemID") return itemID();
  if (key == "downloadStatus") return std::int64_t{downloadStatus_};
  if (key == "containerItemID") return std::int64_t{containerItemID_};
  if (key == "songalbumid") return songalbumid_;
  if (key == "itemFlags") return std::int64_t{itemFlags_};
  if (key == "hasVideo") return hasVideo();
  if (key == "mediaKind") return std::int64_t{mediaKind()};
  if (key == "isFrozen") return isFrozen_;
  return valueForUndefinedKey(key);
}

bool DAAPItem::setPropertyForKey(const DAAPValue& value, std::string_view key) {
  if (key == "name") {
    assignString(name_, value);
  } else if (key == "songalbum") {
    assignString(songalbum_, value);
  } else if (key == "songartist") {
    assignString(songartist_, value);
  } else if (key == "songalbumartist") {
    assignString(songalbumartist_, value);
  } else if (key == "itemID") {
    std::uint64_t identifier = 0;
    assignNumber(identifier, value);
    setItemID(identifier);
  } else if (key == "downloadStatus") {
    assignNumber(downloadStatus_, value);
  } else if (key == "containerItemID") {
    assignNumber(containerItemID_, value);
  } else if (key == "songalbumid") {
    assignNumber(songalbumid_, value);
  } else if (key == "itemFlags") {
    assignNumber(itemFlags_, value);
  } else if (key == "hasVideo") {
    setHasVideo(value);
  } else {
    return false;
  }
  return true;
}

void DAAPItem::setValue(DAAPValue value, const DAAPKey& key) {
  if (setPropertyForKey(value, key.view())) return;
  setValueForUndefinedKey(std::move(value), key);
}

DAAPValue DAAPItem::valueForUndefinedKey(std::string_view key) const {
  return objectForKey(key);
}

void DAAPItem::setValueForUndefinedKey(DAAPValue value, const DAAPKey& key) {
  if (changeObserver_) changeObserver_(key.view(), KeyChange::WillChange);
  setObject(std::move(value), key);
  if (changeObserver_) changeObserver_(key.view(), KeyChange::DidChange);
}

void DAAPItem::updateItemWithItem(const DAAPItem& other) {
  if (isFrozen_) return;
  if (other.name_) name_ = other.name_;
  if (const DAAPDictionary* info = other.additionalInfo()) updateItemWithDictionary(*info);
}

void DAAPItem::updateItemWithDictionary(const DAAPDictionary& dictionary) {
  if (isFrozen_) return;
  if (mutableInfo_ && &dictionary == &*mutableInfo_) {
    // Writing into the dictionary being walked: walk a copy instead.
    const DAAPDictionary snapshot =
        dictionary;  // NOLINT(performance-unnecessary-copy-initialization):
                     // the walk changes the original
    updateItemWithDictionary(snapshot);
    return;
  }
  for (const auto& [key, value] : dictionary) setValue(value, key);
}

std::uint64_t DAAPItem::itemID() const {
  std::uint64_t identifier = itemID_.load(std::memory_order_relaxed);
  if (identifier != 0) return identifier;
  if (const DAAPDictionary* info = additionalInfo()) {
    identifier = lookup(*info, kLongItemIDKey).uint64Value();
    itemID_.store(identifier, std::memory_order_relaxed);
  }
  return identifier;
}

std::int32_t DAAPItem::mediaKind() const {
  const DAAPDictionary* info = additionalInfo();
  if (!info) return 0;
  const DAAPValue& kind = lookup(*info, kMediaKindKey);
  const DAAPValue& chosen = kind.isNull() ? lookup(*info, kStoreMediaKindKey) : kind;
  return static_cast<std::int32_t>(chosen.int64Value());
}

DAAPValue DAAPItem::hasVideo() const {
  return (itemFlags_ & kHasVideoFlag) != 0 ? DAAPValue(true) : DAAPValue();
}

void DAAPItem::setHasVideo(const DAAPValue& flag) {
  if (flag.boolValue()) {
    itemFlags_ |= kHasVideoFlag;
  } else {
    itemFlags_ &= static_cast<std::uint8_t>(~kHasVideoFlag);
  }
}

DAAPDictionary DAAPItem::dictionaryRepresentation() const {
  const DAAPDictionary* info = additionalInfo();
  DAAPDictionary representation = info ? *info : DAAPDictionary{};
  auto setIfPresent = [&](std::string_view key, const std::optional<std::string>& text) {
    if (text) representation.insert_or_assign(DAAPKey::literal(key), *text);
  };
  setIfPresent(kNameKey, name_);
  setIfPresent(kSongAlbumKey, songalbum_);
  setIfPresent(kSongArtistKey, songartist_);
  setIfPresent(kSongAlbumArtistKey, songalbumartist_);
  representation.insert_or_assign(DAAPKey::literal(kItemIDKey), DAAPValue(itemID()));
  representation.insert_or_assign(DAAPKey::literal(kSongAlbumIDKey), DAAPValue(songalbumid_));
  representation.insert_or_assign(DAAPKey::literal(kContainerItemIDKey),
                                  DAAPValue(std::int64_t{containerItemID_}));
  if (hasVideo().isNull()) {
    const auto found = representation.find(kHasVideoKey);
    if (found != representation.end()) representation.erase(found);
  } else {
    representation.insert_or_assign(DAAPKey::literal(kHasVideoKey), DAAPValue(true));
  }
  return representation;
}

DAAPItemRef DAAPItem::copyWithZone() const {
  DAAPItemRef copy = DAAPItem::item();
  copy->name_ = name_;
  if (const DAAPDictionary* info = additionalInfo()) copy->updateItemWithDictionary(*info);
  return copy;
}

PlistDictionary DAAPItem::encodeWithCoder() const {
  PlistDictionary encoded = KeyedArchive::record(kClassName);
  if (name_) encoded.emplace(kNameKey, *name_);
  if (const DAAPDictionary* info = additionalInfo()) {
    encoded.emplace(kAdditionalInfoKey, archivedDictionary(*info));
  }
  return encoded;
}

DAAPItemRef DAAPItem::initWithCoder(const PlistValue& encoded) {
  return decodeItem(encoded, 0);
}

std::string DAAPItem::baseDescription() const {
  char base[64];
  std::snprintf(base, sizeof base, "<%s: %p>", kClassName.data(), static_cast<const void*>(this));
  return base;
}

std::string DAAPItem::description() const {
  if (!objectForKey("macAddress").isNull()) return speakerDescription();
  return baseDescription() + " " + describeOptional(name_) + ", " + std::to_string(itemID()) +
         ", " + describeOptional(songalbum_) + ", " + describeOptional(songartist_) +
         ", containerItemID = " + std::to_string(containerItemID_);
}

// A speaker of a remote-control listing describes itself the way its
// owner's user interface names it.
std::string DAAPItem::speakerDescription() const {
  std::string text = baseDescription() + " ";
  text += objectForKey("supportsVideo").isNull() ? "Skylane" : "Skylane Video";
  text += ": " + describeOptional(name_) + ", ";
  if (objectForKey("isPlaying").boolValue()) text += "isPlaying, ";
  const DAAPValue volume = objectForKey("volume");
  if (objectForKey("selected").boolValue()) {
    char selected[64];
    std::snprintf(selected, sizeof selected, "selected v:%f ", volume.doubleValue());
    text += selected;
  }
  text += "supportsVolume:" + std::to_string(volume.boolValue() ? 1 : 0);
  text += ", locked:" + std::to_string(objectForKey("hasPassword").boolValue() ? 1 : 0);
  text += ", macAddress:" + objectForKey("macAddress").description();
  return text;
}

}  // namespace larder
