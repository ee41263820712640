#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/PlistValue.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"

namespace larder {

// One update the simulated vendor offers, with what the simulation needs to
// know about it beside the record itself.
struct SysupCatalogEntry {
  SysupQuaymartUpdate update;
  bool restartRequired = false;
  std::uint64_t downloadSize = 0;
  double installSeconds = 0;
  bool installFails = false;
  bool isPrerelease = false;
};

// The contents of the system update framework's state file, read into
// plain values. The controller reads one of these for every question and
// changes the dictionary through it inside a locked read-modify-write, so
// the format is spelled out in this one place.
class SysupUpdateState {
 public:
  static constexpr std::string_view kCatalogKey = "catalog";
  static constexpr std::string_view kScanSecondsKey = "scanSeconds";
  static constexpr std::string_view kAvailableKey = "available";
  static constexpr std::string_view kHiddenKey = "hidden";
  static constexpr std::string_view kLaterKey = "later";
  static constexpr std::string_view kInstalledKey = "installed";
  static constexpr std::string_view kPostLogoutKey = "postLogout";
  static constexpr std::string_view kPostLogoutResultsKey = "postLogoutResults";
  static constexpr std::string_view kDownloadedKey = "downloaded";

  explicit SysupUpdateState(PlistDictionary dictionary);

  [[nodiscard]] const PlistDictionary& dictionary() const { return dictionary_; }
  [[nodiscard]] PlistDictionary& dictionary() { return dictionary_; }

  // The well-formed catalogue entries in catalogue order; a damaged entry
  // (not a dictionary, no product key, a field of the wrong type, a product
  // key seen before) is left out with a log line.
  [[nodiscard]] std::vector<SysupCatalogEntry> catalog() const;
  [[nodiscard]] std::optional<SysupCatalogEntry> catalogEntry(std::string_view productKey) const;
  // Catalogue entries whose product key is in `keys`, in catalogue order.
  [[nodiscard]] std::vector<SysupCatalogEntry> catalogEntries(
      const std::set<std::string>& keys) const;
  [[nodiscard]] double scanSeconds() const;

  // A list of product keys ("available", "hidden", "later", "downloaded");
  // entries that are not strings are ignored.
  [[nodiscard]] std::vector<std::string> keyList(std::string_view name) const;
  [[nodiscard]] std::set<std::string> keySet(std::string_view name) const;
  void setKeyList(std::string_view name, const std::vector<std::string>& keys);
  // The keys of a dictionary keyed by product key ("installed", "postLogout").
  [[nodiscard]] std::set<std::string> dictionaryKeys(std::string_view name) const;
  // The dictionary stored under `name`, made (or replaced when of another
  // type) on first use.
  PlistDictionary& dictionaryNamed(std::string_view name);

  // The entries the last scan found, less hidden and installed ones.
  [[nodiscard]] std::vector<SysupQuaymartUpdate> availableUpdates() const;

 private:
  [[nodiscard]] std::vector<SysupCatalogEntry> entriesWhere(
      const std::function<bool(const std::string&)>& wanted) const;
  // The stored value itself, not a copy: callers keep pointers into it.
  [[nodiscard]] const PlistValue& member(std::string_view name) const;

  PlistDictionary dictionary_;
};

}  // namespace larder
