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
  return entriesWhere([](const std::string&) { return true; });
}

std::optional<SysupCatalogEntry> SysupUpdateState::catalogEntry(std::string_view productKey) const {
  std::vector<SysupCatalogEntry> found =
      entriesWhere([productKey](const std::string& key) { return key == productKey; });
  if (found.empty()) return std::nullopt;
  return std::move(found.front());
}

std::vector<SysupCatalogEntry> SysupUpdateState::catalogEntries(
    const std::set<std::string>& keys) const {
  return entriesWhere([&keys](const std::string& key) { return keys.contains(key); });
}

// Only the entries asked for are read whole: a question about one update
// costs a look at each product key, not a parse of the catalogue.
std::vector<SysupCatalogEntry> SysupUpdateState::entriesWhere(
    const std::function<bool(const std::string&)>& wanted) const {
  std::vector<SysupCatalogEntry> entries;
  const PlistArray* stored = member(kCatalogKey).array();
  if (!stored) return entries;
  std::set<std::string> seen;
  for (std::size_t index = 0; index < stored->size(); ++index) {
    const PlistValue& value = (*stored)[index];
    const std::string* key = value["productKey"].string();
    if (key && !wanted(*key)) {
      seen.insert(*key);
      continue;
    }
    std::optional<SysupCatalogEntry> entry = readEntry(value);
    if (!entry || !seen.insert(entry->update.productKey()).second) {
      // A hand-edited file must not take the service down with it.
      TILL_LOG(1, "%@: Skipping damaged or repeated catalogue entry %zu", kSpeaker, index);
      continue;
    }
    entries.push_back(std::move(*entry));
  }
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
