#include "larder-store/StoreCatalogue.h"

#include <algorithm>
#include <filesystem>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"

namespace larder {
namespace {

namespace fs = std::filesystem;

constexpr std::size_t kLargestSettingsFile = 16u << 20u;

Result<PlistValue> readPlistFile(const std::string& path) {
  const auto bytes = FileIO::read(path, kLargestSettingsFile);
  if (!bytes) return bytes.error();
  return PropertyListSerialization::read(*bytes);
}

bool exists(const std::string& path) {
  std::error_code code;
  return fs::exists(path, code);
}

}  // namespace

Result<StoreCatalogue> StoreCatalogue::load(const std::string& directory) {
  std::error_code code;
  if (!fs::is_directory(directory, code)) {
    return VendError::withDomain(std::string(kErrorDomain), 1, directory + " is not a folder");
  }
  StoreCatalogue catalogue;
  catalogue.loadSettings(directory + "/store.plist");
  catalogue.accounts_ = StoreAccounts::load(directory + "/accounts.plist");
  catalogue.cloudLibrary_ = std::make_shared<StoreCloudLibrary>(directory + "/library.plist");
  catalogue.loadItems(directory + "/items");
  TILL_LOG(2, "%@: %lu items and %lu accounts from %@", "StoreCatalogue",
           static_cast<unsigned long>(catalogue.items_.size()),
           static_cast<unsigned long>(catalogue.accounts_.size()), directory);
  return catalogue;
}

void StoreCatalogue::loadSettings(const std::string& path) {
  if (!exists(path)) return;
  const auto settings = readPlistFile(path);
  if (!settings || !settings->isDictionary()) {
    TILL_LOG(1, "%@: ignoring %@: %@", "StoreCatalogue", path,
             settings ? std::string("not a dictionary") : settings.errorDescription());
    return;
  }
  if (const PlistDictionary* bag = (*settings)["bag"].dictionary()) {
    bagExtras_ = *bag;
  } else if (!(*settings)["bag"].isNull()) {
    TILL_LOG(1, "%@: ignoring \"bag\" of %@: not a dictionary", "StoreCatalogue", path);
  }
  const PlistValue& chunkSize = (*settings)["chunkSize"];
  if (chunkSize.isInteger() && chunkSize.int64Value() > 0) {
    chunkSize_ = chunkSize.uint64Value();
  } else if (!chunkSize.isNull()) {
    TILL_LOG(1, "%@: ignoring \"chunkSize\" of %@: not a positive integer", "StoreCatalogue", path);
  }
  const PlistValue& extraUpdateItems = (*settings)["extraUpdateItems"];
  if (const PlistArray* items = extraUpdateItems.array()) {
    extraUpdateItems_ = *items;
  } else if (!extraUpdateItems.isNull()) {
    TILL_LOG(1, "%@: ignoring \"extraUpdateItems\" of %@: not an array", "StoreCatalogue", path);
  }
}

void StoreCatalogue::loadItems(const std::string& directory) {
  std::error_code code;
  std::vector<std::string> folders;
  for (fs::directory_iterator entry(directory, code), end; !code && entry != end;
       entry.increment(code)) {
    if (entry->is_directory(code)) folders.push_back(entry->path().string());
  }
  if (code && exists(directory)) {
    TILL_LOG(1, "%@: cannot list %@: %@", "StoreCatalogue", directory, code.message());
  }
  std::sort(folders.begin(), folders.end());
  for (const std::string& folder : folders) loadItem(folder);
}

void StoreCatalogue::loadItem(const std::string& folder) {
  const Result<PlistValue> dictionary = readPlistFile(folder + "/item.plist");
  Result<StoreItem> item =
      dictionary ? StoreItem::fromDictionary(*dictionary, folder) : dictionary.error();
  Result<PackageDigest> digest =
      item ? PackageDigest::compute(item->packagePath(), chunkSize_) : item.error();
  if (!digest) {
    TILL_LOG(1, "%@: skipping item %@: %@", "StoreCatalogue", folder, digest.error().description);
    return;
  }
  item->digest = std::move(*digest);
  TILL_LOG(3, "%@: item %llu (%@), %llu bytes in %lu chunks", "StoreCatalogue",
           static_cast<unsigned long long>(item->wareID), item->bundleID,
           static_cast<unsigned long long>(item->digest.fileSize),
           static_cast<unsigned long>(item->digest.hashes.size()));
  const std::uint64_t wareID = item->wareID;
  items_.emplace(wareID, std::move(*item));
}

const StoreItem* StoreCatalogue::itemWithID(std::uint64_t wareID) const {
  const auto found = items_.find(wareID);
  return found == items_.end() ? nullptr : &found->second;
}

const StoreItem* StoreCatalogue::itemWithBundleID(std::string_view bundleID) const {
  for (const auto& [wareID, item] : items_) {
    if (item.bundleID == bundleID) return &item;
  }
  return nullptr;
}

}  // namespace larder
