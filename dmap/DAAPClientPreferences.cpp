#include "dmap/DAAPClientPreferences.h"

#include "store-runtime/core/DaemonDefaults.h"
#include "store-runtime/host/PreferenceStore.h"

namespace larder {

PlistValue DAAPClientPreferences::valueForKey(std::string_view key) {
  return PreferenceStore::valueForKey(key, kDaemonDefaultsID);
}

}  // namespace larder
