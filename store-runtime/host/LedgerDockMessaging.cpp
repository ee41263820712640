#include "store-runtime/host/LedgerDockMessaging.h"

#include <chrono>

#include "platform/log/TillLogManager.h"
#include "platform/system/FileIO.h"
#include "store-runtime/host/LedgerSystemState.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerDockMessaging";
constexpr std::size_t kMaxIconBytes = 8u << 20u;
constexpr std::string_view kFileScheme = "file://";

PlatformStateFile stateFile() {
  return PlatformStateFile::named("dock.plist");
}

PlistDictionary& section(PlistDictionary& state, std::string_view name) {
  PlistValue& value = state[std::string(name)];
  if (!value.isDictionary()) value = PlistDictionary{};
  return *value.dictionary();
}

// The local file an icon URL names, if it names one.
std::optional<std::string> localIconPath(std::string_view url) {
  if (url.substr(0, kFileScheme.size()) == kFileScheme) url.remove_prefix(kFileScheme.size());
  if (url.empty() || url.front() != '/') return std::nullopt;
  return std::string(url);
}

// Copies a local icon to where the placeholder code looks for it.
std::optional<std::string> copyLocalIcon(std::string_view url, const std::string& location) {
  std::optional<std::string> source = localIconPath(url);
  if (!source) return std::nullopt;
  std::optional<PlistData> bytes = FileIO::read(*source, kMaxIconBytes).optional();
  if (!bytes || !FileIO::writeAtomically(location, *bytes)) {
    TILL_LOG(1, "%@: Cannot copy the icon %@ to %@", kSpeaker, *source, location);
    return std::nullopt;
  }
  return location;
}

void recordIcon(std::string_view identifier, std::string_view url,
                const VendStoreClient& storeClient) {
  std::string location = LedgerIconLocationForIdentifier(storeClient.identifier(), identifier);
  std::optional<std::string> copied = copyLocalIcon(url, location);
  PlistDictionary entry{{"identifier", PlistValue(identifier)},
                        {"url", PlistValue(url)},
                        {"storeClient", PlistValue(storeClient.identifier())},
                        {"date", PlistValue(PlistDate::now())}};
  if (copied) entry["location"] = *copied;
  std::string key = storeClient.identifier() + "/" + std::string(identifier);
  stateFile().updateDictionary(
      [&](PlistDictionary& state) { section(state, "icons")[key] = std::move(entry); });
}

PlistValue firstString(const PlistDictionary& dictionary, std::string_view key) {
  auto found = dictionary.find(key);
  return found != dictionary.end() && found->second.isString() ? found->second : PlistValue();
}

}  // namespace

LedgerDockMessaging& LedgerDockMessaging::sharedInstance() {
  static LedgerDockMessaging instance;
  return instance;
}

std::string LedgerDockMessaging::stateFilePath() {
  return stateFile().path();
}

void LedgerDockMessaging::loadIconForProductID(std::uint64_t productID, std::string_view url,
                                               const VendStoreClient& storeClient) {
  recordIcon(std::to_string(productID), url, storeClient);
}

void LedgerDockMessaging::loadIconForIdentifier(std::string_view identifier, std::string_view url,
                                                const VendStoreClient& storeClient) {
  recordIcon(identifier, url, storeClient);
}

void LedgerDockMessaging::createPlaceholderWithName(std::string_view name, std::int64_t identifier,
                                                    const PlistData& iconData) {
  TILL_LOG(3, "%@: Placeholder %@", kSpeaker, name);
  stateFile().updateDictionary([&](PlistDictionary& state) {
    section(state, "placeholders")[std::string(name)] =
        PlistDictionary{{"identifier", PlistValue(identifier)},
                        {"iconData", PlistValue(iconData)},
                        {"date", PlistValue(PlistDate::now())}};
  });
}

void LedgerDockMessaging::removePlaceholderWithName(std::string_view name) {
  TILL_LOG(3, "%@: Placeholder %@ removed", kSpeaker, name);
  stateFile().updateDictionary(
      [&](PlistDictionary& state) { section(state, "placeholders").erase(std::string(name)); });
}

void LedgerDockMessaging::sendMessageForUpdate(const PlistDictionary& update,
                                               const PlistDictionary& status) {
  PlistValue productKey = firstString(update, "productKey");
  PlistValue title = firstString(update, "title");
  const std::string* key = productKey.isString() ? productKey.string() : title.string();
  if (!key) {
    TILL_LOG(1, "%@: Message for an update without product key or title dropped", kSpeaker);
    return;
  }
  PlistDictionary entry{{"status", PlistValue(status)}, {"date", PlistValue(PlistDate::now())}};
  if (!productKey.isNull()) entry["productKey"] = productKey;
  if (!title.isNull()) entry["title"] = title;
  std::string messageKey = *key;
  stateFile().updateDictionary(
      [&](PlistDictionary& state) { section(state, "messages")[messageKey] = std::move(entry); });
}

}  // namespace larder
