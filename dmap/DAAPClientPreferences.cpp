#include "dmap/DAAPClientPreferences.h"

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/Environment.h"
#include "platform/system/FileIO.h"
#include "store-runtime/core/DaemonDefaults.h"

namespace larder {
namespace {

// A preference file is a small dictionary; anything larger is not one.
constexpr std::size_t kLargestPreferenceFile = 1u << 20u;

std::string fileName() {
  return std::string(kDaemonDefaultsID) + ".plist";
}

}  // namespace

std::string DAAPClientPreferences::userPreferencesPath() {
  return Environment::userConfigDirectory() + "/" + fileName();
}

std::string DAAPClientPreferences::systemPreferencesPath() {
  return Environment::rootedPath("/etc/larder/") + fileName();
}

PlistValue DAAPClientPreferences::valueInFile(const std::string& path, std::string_view key) {
  const auto bytes = FileIO::read(path, kLargestPreferenceFile);
  if (!bytes) return {};
  const auto preferences = PropertyListSerialization::read(*bytes);
  if (!preferences) return {};
  return (*preferences)[key];
}

PlistValue DAAPClientPreferences::valueForKey(std::string_view key) {
  PlistValue value = valueInFile(userPreferencesPath(), key);
  if (!value.isNull()) return value;
  return valueInFile(systemPreferencesPath(), key);
}

}  // namespace larder
