#include "larder-store/StoreCloudLibrary.h"

#include <algorithm>
#include <limits>
#include <set>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"

namespace larder {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kSpeaker = "StoreCloudLibrary";
constexpr std::size_t kLargestLibraryFile = 64u << 20u;
constexpr std::uint64_t kLargestRevision = std::numeric_limits<std::uint32_t>::max();

bool isWanted(const StoreLibraryItem& item, const StoreCloudLibrary::ItemsQuery& query) {
  if (item.preorder && !query.includePreorders) return false;
  if (!query.mediaKinds || !item.mediaKind) return true;
  return std::find(query.mediaKinds->begin(), query.mediaKinds->end(), *item.mediaKind) !=
         query.mediaKinds->end();
}

}  // namespace

StoreCloudLibrary::StoreCloudLibrary(std::string path) : path_(std::move(path)) {
  MutexLock lock(mutex_);
  refreshLocked();
}

void StoreCloudLibrary::refreshLocked() {
  std::error_code code;
  const auto modified = fs::last_write_time(path_, code);
  const auto size = code ? 0 : fs::file_size(path_, code);
  const std::optional<Stamp> stamp =
      code ? std::nullopt : std::optional<Stamp>(Stamp{modified, size});
  if (stamp == stamp_) return;
  stamp_ = stamp;
  present_ = false;
  bagSettings_.clear();
  revisions_.clear();
  if (stamp) loadLocked();
}

void StoreCloudLibrary::loadLocked() {
  const auto bytes = FileIO::read(path_, kLargestLibraryFile);
  const Result<PlistValue> library =
      bytes ? PropertyListSerialization::read(*bytes) : bytes.error();
  if (!library || !library->isDictionary()) {
    TILL_LOG(1, "%@: ignoring %@: %@", kSpeaker, path_,
             library ? std::string("not a dictionary") : library.errorDescription());
    return;
  }
  present_ = true;
  if (const PlistDictionary* bag = (*library)["bag"].dictionary()) bagSettings_ = *bag;
  const PlistArray* revisions = (*library)["revisions"].array();
  if (!revisions) {
    if (!(*library)["revisions"].isNull()) {
      TILL_LOG(1, "%@: ignoring \"revisions\" of %@: not an array", kSpeaker, path_);
    }
    return;
  }
  for (std::size_t index = 0; index < revisions->size(); ++index) {
    auto revision = revisionFromEntry((*revisions)[index], currentRevisionLocked(), index);
    if (revision) revisions_.push_back(std::move(*revision));
  }
  TILL_LOG(2, "%@: %lu revisions from %@, the latest %u", kSpeaker,
           static_cast<unsigned long>(revisions_.size()), path_, currentRevisionLocked());
}

std::optional<StoreCloudLibrary::Revision> StoreCloudLibrary::revisionFromEntry(
    const PlistValue& entry, std::uint32_t previous, std::size_t index) const {
  const PlistValue& number = entry["revision"];
  if (!number.isInteger() || number.int64Value() <= static_cast<std::int64_t>(previous) ||
      number.uint64Value() > kLargestRevision) {
    TILL_LOG(1, "%@: skipping revision entry %lu: \"revision\" is not a number above %u", kSpeaker,
             static_cast<unsigned long>(index), previous);
    return std::nullopt;
  }
  Revision revision;
  revision.number = static_cast<std::uint32_t>(number.uint64Value());
  if (const PlistArray* items = entry["items"].array()) {
    for (std::size_t itemIndex = 0; itemIndex < items->size(); ++itemIndex) {
      auto item = StoreLibraryItem::fromDictionary((*items)[itemIndex], revision.number);
      if (!item) {
        TILL_LOG(1, "%@: skipping item %lu of revision %u: %@", kSpeaker,
                 static_cast<unsigned long>(itemIndex), revision.number, item.error().description);
        continue;
      }
      revision.items.push_back(std::move(*item));
    }
  }
  if (const PlistArray* deleted = entry["deleted"].array()) {
    for (const PlistValue& identifier : *deleted) {
      if (identifier.isInteger() && identifier.uint64Value() > 0 &&
          (identifier.type() == PlistValue::Type::UnsignedInteger || identifier.int64Value() > 0)) {
        revision.deleted.push_back(identifier.uint64Value());
      } else {
        TILL_LOG(1, "%@: skipping a deleted id of revision %u: not a positive integer", kSpeaker,
                 revision.number);
      }
    }
  }
  return revision;
}

std::uint32_t StoreCloudLibrary::currentRevisionLocked() const {
  return revisions_.empty() ? 0 : revisions_.back().number;
}

bool StoreCloudLibrary::isPresent() {
  MutexLock lock(mutex_);
  refreshLocked();
  return present_;
}

std::optional<PlistDictionary> StoreCloudLibrary::bagEntry(std::string_view baseURL) {
  MutexLock lock(mutex_);
  refreshLocked();
  if (!present_) return std::nullopt;
  PlistDictionary entry{{"base-url", std::string(baseURL) + std::string(kBasePath)}};
  for (const auto& [key, value] : bagSettings_) entry[key] = value;
  return entry;
}

std::uint32_t StoreCloudLibrary::login(std::uint64_t accountID) {
  MutexLock lock(mutex_);
  const std::uint32_t session = nextSession_++;
  if (nextSession_ > static_cast<std::uint32_t>(std::numeric_limits<std::int32_t>::max())) {
    nextSession_ = 1;  // the wire's session id is a signed 32-bit number
  }
  sessions_.emplace_back(session, accountID);
  if (sessions_.size() > kMaxSessions) sessions_.pop_front();
  return session;
}

bool StoreCloudLibrary::hasSession(std::uint32_t sessionID, std::uint64_t accountID) const {
  MutexLock lock(mutex_);
  return std::find(sessions_.begin(), sessions_.end(), std::pair{sessionID, accountID}) !=
         sessions_.end();
}

std::uint32_t StoreCloudLibrary::currentRevision() {
  MutexLock lock(mutex_);
  refreshLocked();
  return currentRevisionLocked();
}

std::size_t StoreCloudLibrary::itemCount() {
  MutexLock lock(mutex_);
  refreshLocked();
  std::map<std::uint64_t, Entry> items;
  std::map<std::uint64_t, std::uint32_t> deletions;
  stateAtLocked(currentRevisionLocked(), items, deletions);
  return items.size();
}

void StoreCloudLibrary::stateAtLocked(std::uint32_t revision, std::map<std::uint64_t, Entry>& items,
                                      std::map<std::uint64_t, std::uint32_t>& deletions) const {
  for (const Revision& entry : revisions_) {
    if (entry.number > revision) break;
    for (const StoreLibraryItem& item : entry.items) {
      items[item.cloudID] = {&item, entry.number};
      deletions.erase(item.cloudID);
    }
    for (const std::uint64_t identifier : entry.deleted) {
      items.erase(identifier);
      deletions[identifier] = entry.number;
    }
  }
}

StoreCloudLibrary::Changes StoreCloudLibrary::changes(const ItemsQuery& query) {
  MutexLock lock(mutex_);
  refreshLocked();
  Changes changes;
  changes.revision = std::min(query.latestVersion, currentRevisionLocked());
  changes.full = query.localVersion == 0 || query.localVersion >= changes.revision;
  std::map<std::uint64_t, Entry> items;
  std::map<std::uint64_t, std::uint32_t> deletions;
  stateAtLocked(changes.revision, items, deletions);
  changes.totalCount = items.size();
  std::map<std::uint64_t, std::uint32_t> held;
  for (const auto& pair : query.held) held[pair.clientID] = pair.tokenCode;
  for (const auto& [identifier, entry] : items) {
    if (!changes.full && entry.revision <= query.localVersion) continue;
    const auto holding = held.find(identifier);
    if (holding != held.end() && holding->second == entry.item->token) continue;
    if (isWanted(*entry.item, query)) changes.items.push_back(*entry.item);
  }
  std::set<std::uint64_t> deleted;
  if (!changes.full) {
    for (const auto& [identifier, revision] : deletions) {
      if (revision > query.localVersion) deleted.insert(identifier);
    }
  }
  for (const auto& [identifier, token] : held) {
    if (!items.contains(identifier)) deleted.insert(identifier);
  }
  changes.deleted.assign(deleted.begin(), deleted.end());
  return changes;
}

}  // namespace larder
