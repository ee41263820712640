#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "larder-store/StoreAccounts.h"
#include "larder-store/StoreItem.h"
#include "platform/PlistValue.h"

namespace larder {

// Everything the store serves, read once from the catalogue folder:
//   store.plist                 { bag: { extra bag entries }, chunkSize }
//   accounts.plist              the accounts
//   items/<ware-id>/item.plist  an item, with its package beside it
// Entries that are malformed are skipped with a line on standard error, so
// that one bad item never takes the store down.
class StoreCatalogue {
 public:
  static constexpr std::uint64_t kDefaultChunkSize = 10u << 20u;

  // nullopt (with *error) only when the folder itself cannot be read.
  static std::optional<StoreCatalogue> load(const std::string& directory, std::string* error);

  [[nodiscard]] const StoreAccounts& accounts() const { return accounts_; }
  [[nodiscard]] const PlistDictionary& bagExtras() const { return bagExtras_; }
  [[nodiscard]] std::uint64_t chunkSize() const { return chunkSize_; }
  [[nodiscard]] const std::map<std::uint64_t, StoreItem>& items() const { return items_; }

  [[nodiscard]] const StoreItem* itemWithID(std::uint64_t wareID) const;
  [[nodiscard]] const StoreItem* itemWithBundleID(std::string_view bundleID) const;

 private:
  void loadSettings(const std::string& path);
  void loadItems(const std::string& directory);
  void loadItem(const std::string& folder);

  StoreAccounts accounts_;
  PlistDictionary bagExtras_;
  std::uint64_t chunkSize_ = kDefaultChunkSize;
  std::map<std::uint64_t, StoreItem> items_;
};

}  // namespace larder
