#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "larder-store/StoreAccounts.h"
#include "larder-store/StoreCloudLibrary.h"
#include "larder-store/StoreItem.h"
#include "platform/error/Result.h"
#include "platform/value/PlistValue.h"

namespace larder {

// Everything the store serves, read once from the catalogue folder:
//   store.plist                 { bag: { extra bag entries }, chunkSize,
//                                 extraUpdateItems }
//   accounts.plist              the accounts
//   items/<ware-id>/item.plist  an item, with its package beside it
//   library.plist               the cloud library (StoreCloudLibrary)
// Entries that are malformed are skipped with a line on standard error, so
// that one bad item never takes the store down.
class StoreCatalogue {
 public:
  static constexpr std::uint64_t kDefaultChunkSize = 10u << 20u;

  // nullopt (with *error) only when the folder itself cannot be read.
  static constexpr std::string_view kErrorDomain = "StoreCatalogue";
  static Result<StoreCatalogue> load(const std::string& directory);

  [[nodiscard]] const StoreAccounts& accounts() const { return accounts_; }
  [[nodiscard]] const PlistDictionary& bagExtras() const { return bagExtras_; }
  [[nodiscard]] std::uint64_t chunkSize() const { return chunkSize_; }
  // Appended as they are to the "items" of every update check answer, so
  // that tests can hand a client malformed items.
  [[nodiscard]] const PlistArray& extraUpdateItems() const { return extraUpdateItems_; }
  [[nodiscard]] const std::map<std::uint64_t, StoreItem>& items() const { return items_; }
  // The cloud library of "library.plist", which follows its file.
  [[nodiscard]] StoreCloudLibrary& cloudLibrary() const { return *cloudLibrary_; }

  [[nodiscard]] const StoreItem* itemWithID(std::uint64_t wareID) const;
  [[nodiscard]] const StoreItem* itemWithBundleID(std::string_view bundleID) const;

 private:
  void loadSettings(const std::string& path);
  void loadItems(const std::string& directory);
  void loadItem(const std::string& folder);

  StoreAccounts accounts_;
  PlistDictionary bagExtras_;
  std::uint64_t chunkSize_ = kDefaultChunkSize;
  PlistArray extraUpdateItems_;
  std::map<std::uint64_t, StoreItem> items_;
  // A catalogue that was not loaded has an absent library.
  std::shared_ptr<StoreCloudLibrary> cloudLibrary_ = std::make_shared<StoreCloudLibrary>("");
};

}  // namespace larder
