// The system update framework's state file, which people edit by hand:
// bytes to property list, then every reading of it the framework does.
#include <cstddef>
#include <cstdint>
#include <set>
#include <span>
#include <string>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/sysup/SysupUpdateState.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  larder::TillLogManager::sharedManager().setLevel(0);
  auto value = larder::PropertyListSerialization::read(std::span(data, size));
  if (!value || !value->dictionary()) return 0;
  const larder::SysupUpdateState state(*value->dictionary());
  std::set<std::string> keys;
  for (const larder::SysupCatalogEntry& entry : state.catalog()) {
    keys.insert(entry.update.productKey());
    (void)entry.update.toDictionary();
  }
  (void)state.catalogEntries(keys);
  (void)state.scanSeconds();
  for (std::string_view list :
       {larder::SysupUpdateState::kAvailableKey, larder::SysupUpdateState::kHiddenKey,
        larder::SysupUpdateState::kLaterKey, larder::SysupUpdateState::kDownloadedKey}) {
    for (const std::string& key : state.keyList(list)) (void)state.catalogEntry(key);
  }
  (void)state.dictionaryKeys(larder::SysupUpdateState::kInstalledKey);
  (void)state.dictionaryKeys(larder::SysupUpdateState::kPostLogoutKey);
  for (const larder::SysupQuaymartUpdate& update : state.availableUpdates()) {
    (void)update.description();
  }
  return 0;
}
