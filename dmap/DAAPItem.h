#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "dmap/DAAPValue.h"

namespace larder {

// One entry of a DMAP listing: a few hot fields plus an open dictionary of
// everything else the server sent. The parsers freeze every item they hand
// out, so that a listing shared between threads cannot change under a
// reader; `thaw` opens the dictionary again. Keyed access (`setValue`,
// `valueForKey`) lets the parsers' setters write into an item exactly as
// into a dictionary.
//
// Items are shared records: make them with `item()` and pass them as
// `DAAPItemRef`. A C++ copy is not offered; `copyWithZone()` makes the
// copy the record type defines.
class DAAPItem {
 public:
  enum class KeyChange { WillChange, DidChange };
  // Told around every change made through `setValueForUndefinedKey`.
  using ChangeObserver = std::function<void(std::string_view key, KeyChange change)>;

  static constexpr std::string_view kClassName = "DAAPItem";

  DAAPItem() = default;
  DAAPItem(const DAAPItem&) = delete;
  DAAPItem& operator=(const DAAPItem&) = delete;

  static DAAPItemRef item();
  static DAAPItemRef itemWithItem(const DAAPItem& other);

  void freeze();
  void thaw();
  [[nodiscard]] bool isFrozen() const { return isFrozen_; }

  // `frozenInfo` when frozen, else `mutableInfo`; null when that is absent.
  [[nodiscard]] const DAAPDictionary* additionalInfo() const;
  [[nodiscard]] const DAAPDictionary* frozenInfo() const;
  [[nodiscard]] const DAAPDictionary* mutableInfo() const;
  void setFrozenInfo(std::optional<DAAPDictionary> info) { frozenInfo_ = std::move(info); }
  void setMutableInfo(std::optional<DAAPDictionary> info) { mutableInfo_ = std::move(info); }

  // Dictionary-style access to the open part.
  [[nodiscard]] DAAPValue objectForKey(std::string_view key) const;
  void setObject(DAAPValue value, const DAAPKey& key);

  // Keyed access in the manner of key-value coding: a key that names a
  // property reads or sets that property, any other key goes to
  // `valueForUndefinedKey` / `setValueForUndefinedKey`. Properties set this
  // way: name, songalbum, songartist, songalbumartist (strings; nothing
  // clears them, a value of another type is ignored), itemID, downloadStatus,
  // containerItemID, songalbumid, itemFlags (numbers; nothing sets 0) and
  // hasVideo. The info dictionaries and the frozen flag are deliberately not
  // reachable by key, since keys can come off the wire.
  [[nodiscard]] DAAPValue valueForKey(std::string_view key) const;
  void setValue(DAAPValue value, const DAAPKey& key);
  [[nodiscard]] DAAPValue valueForUndefinedKey(std::string_view key) const;
  void setValueForUndefinedKey(DAAPValue value, const DAAPKey& key);
  void setChangeObserver(ChangeObserver observer) { changeObserver_ = std::move(observer); }

  void updateItemWithItem(const DAAPItem& other);
  void updateItemWithDictionary(const DAAPDictionary& dictionary);

  // Hot fields.
  [[nodiscard]] const std::optional<std::string>& name() const { return name_; }
  void setName(std::optional<std::string> name) { name_ = std::move(name); }
  [[nodiscard]] const std::optional<std::string>& songalbum() const { return songalbum_; }
  void setSongalbum(std::optional<std::string> text) { songalbum_ = std::move(text); }
  [[nodiscard]] const std::optional<std::string>& songartist() const { return songartist_; }
  void setSongartist(std::optional<std::string> text) { songartist_ = std::move(text); }
  [[nodiscard]] const std::optional<std::string>& songalbumartist() const {
    return songalbumartist_;
  }
  void setSongalbumartist(std::optional<std::string> text) { songalbumartist_ = std::move(text); }
  // While the stored id is 0 this falls back on `dmap.longitemid` of the
  // info and keeps what it found; safe on a frozen item shared by threads.
  [[nodiscard]] std::uint64_t itemID() const;
  void setItemID(std::uint64_t itemID) { itemID_.store(itemID, std::memory_order_relaxed); }
  [[nodiscard]] std::uint8_t downloadStatus() const { return downloadStatus_; }
  void setDownloadStatus(std::uint8_t status) { downloadStatus_ = status; }
  [[nodiscard]] std::uint32_t containerItemID() const { return containerItemID_; }
  void setContainerItemID(std::uint32_t identifier) { containerItemID_ = identifier; }
  [[nodiscard]] std::uint64_t songalbumid() const { return songalbumid_; }
  void setSongalbumid(std::uint64_t identifier) { songalbumid_ = identifier; }
  [[nodiscard]] std::uint8_t itemFlags() const { return itemFlags_; }
  void setItemFlags(std::uint8_t flags) { itemFlags_ = flags; }

  [[nodiscard]] std::int32_t mediaKind() const;
  // True when bit 0 of `itemFlags` is set, otherwise nothing.
  [[nodiscard]] DAAPValue hasVideo() const;
  void setHasVideo(const DAAPValue& flag);

  [[nodiscard]] DAAPDictionary dictionaryRepresentation() const;
  // A new unfrozen item with the name and the open dictionary; the other
  // hot fields are not copied.
  [[nodiscard]] DAAPItemRef copyWithZone() const;

  // Keyed-archive form: a record with `name` and `additionalInfo`.
  [[nodiscard]] PlistDictionary encodeWithCoder() const;
  // An unfrozen item, or null when `encoded` is not such a record.
  static DAAPItemRef initWithCoder(const PlistValue& encoded);

  [[nodiscard]] std::string description() const;

 private:
  static constexpr std::uint8_t kHasVideoFlag = 0x01;

  [[nodiscard]] bool setPropertyForKey(const DAAPValue& value, std::string_view key);
  [[nodiscard]] std::string baseDescription() const;
  [[nodiscard]] std::string speakerDescription() const;

  std::optional<std::string> name_;
  std::optional<std::string> songalbum_;
  std::optional<std::string> songartist_;
  std::optional<std::string> songalbumartist_;
  mutable std::atomic<std::uint64_t> itemID_{0};
  std::uint8_t downloadStatus_ = 0;
  std::uint32_t containerItemID_ = 0;
  std::uint64_t songalbumid_ = 0;
  std::uint8_t itemFlags_ = 0;
  bool isFrozen_ = false;
  std::optional<DAAPDictionary> frozenInfo_;
  std::optional<DAAPDictionary> mutableInfo_;
  ChangeObserver changeObserver_;
};

}  // namespace larder
