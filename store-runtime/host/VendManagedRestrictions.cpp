#include "store-runtime/host/VendManagedRestrictions.h"

#include <string>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/Environment.h"
#include "platform/system/FileIO.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "VendManagedRestrictions";
constexpr std::size_t kMaxRestrictionsBytes = 1u << 20u;

}  // namespace

std::string VendManagedRestrictions::restrictionsFilePath() {
  return Environment::rootedPath("/etc/larder/restrictions.plist");
}

bool VendManagedRestrictions::isRestrictedTo(std::string_view restriction) {
  std::string path = restrictionsFilePath();
  std::optional<PlistData> bytes = FileIO::read(path, kMaxRestrictionsBytes).optional();
  if (!bytes) return false;
  auto restrictions = PropertyListSerialization::read(*bytes);
  if (!restrictions || !restrictions->isDictionary()) {
    TILL_LOG(1, "%@: Ignoring unreadable restrictions at %@ %@", kSpeaker, path,
             restrictions.errorDescription());
    return false;
  }
  const PlistValue& value = (*restrictions)[restriction];
  bool restricted = (value.isBoolean() || value.isInteger()) && value.boolValue();
  if (restricted) TILL_LOG(3, "%@: Restricted to %@", kSpeaker, restriction);
  return restricted;
}

}  // namespace larder
