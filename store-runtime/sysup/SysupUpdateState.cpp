#include "store-runtime/sysup/SysupUpdateState.h"

#include <algorithm>

#include "platform/log/TillLogManager.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "SysupUpdateState";

// Absent is fine (the default applies); present with another type is not.
bool hasType(const PlistValue& value, bool (PlistValue::*check)() const) {
  return value.isNull() || (value.*check)();
}

std::optional<SysupCatalogEntry> readEntry(const PlistValue& value) {
  const PlistDictionary* dictionary = value.dictionary();
  if (!dictionary) return std::nullopt;
  const bool simulationFieldsFit = hasType(value["restartRequired"], &PlistValue::isBoolean) &&
                                   hasType(value["downloadSize"], &PlistValue::isInteger) &&
                                   hasType(value["installSeconds"], &PlistValue::isNumber) &&
                                   hasType(value["installFails"], &PlistValue::isBoolean) &&
                                   hasType(value["isPrerelease"], &PlistValue::isBoolean);
  if (!simulationFieldsFit) return std::nullopt;
  std::optional<SysupQuaymartUpdate> update = SysupQuaymartUpdate::fromDictionary(*dictionary);
  if (!update || update->productKey().empty()) return std::nullopt;
  return SysupCatalogEntry{.update = std::move(*update),
                           .restartRequired = value["restartRequired"].boolValue(),
                           .downloadSize = value["downloadSize"].uint64Value(),
                           .installSeconds = value["installSeconds"].doubleValue(),
                           .installFails = value["installFails"].boolValue(),
                           .isPrerelease = value["isPrerelease"].boolValue()};
}

}  // namespace

SysupUpdateState::SysupUpdateState(PlistDictionary dictionary)
    : dictionary_(std::move(dictionary)) {}

const PlistValue& SysupUpdateState::member(std::string_view name) const {
  auto found = dictionary_.find(name);
  return found == dictionary_.end() ? PlistValue::null() : found->second;
}

std::vector<SysupCatalogEntry> SysupUpdateState::catalog() const {
  std::vector<SysupCatalogEntry> entries;
  const PlistArray* stored = member(kCatalogKey).array();
  if (!stored) return entries;
  std::set<std::string> seen;
  for (std::size_t index = 0; index < stored->size(); ++index) {
    std::optional<SysupCatalogEntry> entry = readEntry((*stored)[index]);
    if (!entry || !seen.insert(entry->update.productKey()).second) {
      // A hand-edited file must not take the service down with it.
      TILL_LOG(1, "%@: Skipping damaged or repeated catalogue entry %zu", kSpeaker, index);
      continue;
    }
    entries.push_back(std::move(*entry));
  }
  return entries;
}

std::optional<SysupCatalogEntry> SysupUpdateState::catalogEntry(std::string_view productKey) const {
  for (SysupCatalogEntry& entry : catalog()) {
    if (entry.update.productKey() == productKey) return std::move(entry);
  }
  return std::nullopt;
}

std::vector<SysupCatalogEntry> SysupUpdateState::catalogEntries(
    const std::set<std::string>& keys) const {
  std::vector<SysupCatalogEntry> entries = catalog();
  std::erase_if(entries, [&keys](const SysupCatalogEntry& entry) {
    return !keys.contains(entry.update.productKey());
  });
  return entries;
}

double SysupUpdateState::scanSeconds() const {
  return std::max(0.0, member(kScanSecondsKey).doubleValue());
}

std::vector<std::string> SysupUpdateState::keyList(std::string_view name) const {
  std::vector<std::string> keys;
  const PlistArray* stored = member(name).array();
  if (!stored) return keys;
  for (const PlistValue& value : *stored) {
    if (const std::string* key = value.string()) keys.push_back(*key);
  }
  return keys;
}

std::set<std::string> SysupUpdateState::keySet(std::string_view name) const {
  std::vector<std::string> keys = keyList(name);
  return {keys.begin(), keys.end()};
}

void SysupUpdateState::setKeyList(std::string_view name, const std::vector<std::string>& keys) {
  PlistArray stored;
  for (const std::string& key : keys) {
    if (std::find(stored.begin(), stored.end(), PlistValue(key)) == stored.end()) {
      stored.emplace_back(key);
    }
  }
  dictionary_[std::string(name)] = std::move(stored);
}

std::set<std::string> SysupUpdateState::dictionaryKeys(std::string_view name) const {
  std::set<std::string> keys;
  const PlistDictionary* stored = member(name).dictionary();
  if (!stored) return keys;
  for (const auto& [key, value] : *stored) keys.insert(key);
  return keys;
}

PlistDictionary& SysupUpdateState::dictionaryNamed(std::string_view name) {
  PlistValue& stored = dictionary_[std::string(name)];
  if (!stored.isDictionary()) stored = PlistDictionary{};
  return *stored.dictionary();
}

std::vector<SysupQuaymartUpdate> SysupUpdateState::availableUpdates() const {
  const std::set<std::string> found = keySet(kAvailableKey);
  const std::set<std::string> hidden = keySet(kHiddenKey);
  const std::set<std::string> installed = dictionaryKeys(kInstalledKey);
  std::vector<SysupQuaymartUpdate> updates;
  for (SysupCatalogEntry& entry : catalog()) {
    const std::string& key = entry.update.productKey();
    if (found.contains(key) && !hidden.contains(key) && !installed.contains(key)) {
      updates.push_back(std::move(entry.update));
    }
  }
  return updates;
}

}  // namespace larder
