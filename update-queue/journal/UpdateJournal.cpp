#include "update-queue/journal/UpdateJournal.h"

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <map>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/Environment.h"
#include "platform/system/FileIO.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "UpdateJournal";
constexpr std::string_view kFileBelowDataDirectory = "/Quaymart/updatejournal.plist";

bool isPending(const PlistDictionary& entry) {
  const auto found = entry.find(UpdateJournal::kPendingKey);
  return found != entry.end() && found->second.boolValue();
}

std::optional<std::string> productKeyOf(const PlistDictionary& entry) {
  const auto found = entry.find(UpdateJournal::kProductKeyKey);
  if (found == entry.end() || !found->second.string()) return std::nullopt;
  return *found->second.string();
}

PlistValue asValue(const std::vector<std::string>& strings) {
  return PlistArray(strings.begin(), strings.end());
}

}  // namespace

UpdateJournal::UpdateJournal() : clock_(systemClock) {}

UpdateJournal::UpdateJournal(std::string path, Clock clock)
    : fixedPath_(std::move(path)), clock_(std::move(clock)) {}

UpdateJournal& UpdateJournal::sharedJournal() {
  static UpdateJournal journal;
  return journal;
}

PlistDate UpdateJournal::systemClock() {
  using Seconds = std::chrono::duration<double>;
  return PlistDate{Seconds(std::chrono::system_clock::now().time_since_epoch()).count()};
}

std::string UpdateJournal::path() const {
  // The data folder is looked up at each use, as every folder of the
  // service is, so that a test's private home is honoured.
  if (!fixedPath_.empty()) return fixedPath_;
  return Environment::dataDirectory() + std::string(kFileBelowDataDirectory);
}

// --- Reads ---

UpdateJournal::Entries UpdateJournal::installedUpdatesJournal() const {
  return installedUpdatesJournalIgnoringPendingUpdates(true);
}

UpdateJournal::Entries UpdateJournal::installedUpdatesJournalIgnoringPendingUpdates(
    bool ignorePending) const {
  MutexLock lock(mutex_);
  return readPrunedLocked(ignorePending);
}

UpdateJournal::Entries UpdateJournal::readPrunedLocked(bool ignorePending) const {
  const Entries& entries = currentEntriesLocked();
  Entries kept;
  const auto first = entries.begin() + static_cast<std::ptrdiff_t>(firstKeptIndex(entries));
  kept.reserve(static_cast<std::size_t>(entries.end() - first));
  std::copy_if(first, entries.end(), std::back_inserter(kept),
               [ignorePending](const PlistDictionary& entry) {
                 return !ignorePending || !isPending(entry);
               });
  return kept;
}

UpdateJournal::Entries UpdateJournal::takePrunedLocked() {
  currentEntriesLocked();
  Entries entries = std::move(cachedEntries_);
  cachedEntries_.clear();
  cachedIdentity_.reset();
  entries.erase(entries.begin(),
                entries.begin() + static_cast<std::ptrdiff_t>(firstKeptIndex(entries)));
  return entries;
}

const UpdateJournal::Entries& UpdateJournal::currentEntriesLocked() const {
  const std::string file = path();
  const std::optional<FileIdentity> before = FileIO::identity(file);
  if (before && before == cachedIdentity_) return cachedEntries_;
  cachedIdentity_.reset();
  cachedEntries_.clear();
  Result<std::vector<std::uint8_t>> bytes = FileIO::read(file);
  if (!bytes) return cachedEntries_;  // no journal yet
  Result<PlistValue> document = PropertyListSerialization::read(*bytes);
  if (!document) {
    // The next change replaces it with its own entries alone.
    TILL_LOG(1, "%@: Update journal at %@ does not parse and counts as empty - %@", kSpeaker, file,
             document.errorDescription());
  } else if (PlistDictionary* top = document->dictionary()) {
    // Items that are not dictionaries make no entry; they are gone at the
    // next write. Moved out of the parsed document, which goes at the end.
    const auto list = top->find(kEntriesKey);
    if (PlistArray* items = list != top->end() ? list->second.array() : nullptr) {
      cachedEntries_.reserve(items->size());
      for (PlistValue& item : *items) {
        if (PlistDictionary* entry = item.dictionary()) cachedEntries_.push_back(std::move(*entry));
      }
    }
  }
  // Cached only when the file did not change while it was read: a version
  // replaced in between would be remembered under the wrong identity.
  if (before && FileIO::identity(file) == before) cachedIdentity_ = before;
  return cachedEntries_;
}

std::size_t UpdateJournal::firstKeptIndex(const Entries& entries) const {
  // The list is oldest first, so the stale entries are at its front. The
  // walk stops at the first recent entry and at the first without a date:
  // an older entry behind either stays until they have gone.
  const double cutoff = clock_().secondsSince1970 - kMaximumAgeSeconds;
  const auto firstKept = std::ranges::find_if(entries, [cutoff](const PlistDictionary& entry) {
    const auto found = entry.find(kInstallDateKey);
    const PlistDate* date = found == entry.end() ? nullptr : found->second.date();
    return date == nullptr || !(date->secondsSince1970 < cutoff);
  });
  return static_cast<std::size_t>(firstKept - entries.begin());
}

// --- Changes ---

void UpdateJournal::appendInstalledUpdates(const std::vector<LedgerUpdateRef>& appUpdates,
                                           const std::vector<SysupQuaymartUpdate>& osUpdates) {
  const PlistDate now = clock_();
  Entries added;
  added.reserve(appUpdates.size() + osUpdates.size());
  for (const LedgerUpdateRef& update : appUpdates) {
    if (!update) {
      // A list may hold a slot without a record; it is no update of any kind.
      TILL_LOG(1, "%@: appendInstalledUpdatesToJournal: unknown update object %@", kSpeaker,
               update);
      continue;
    }
    PlistDictionary entry = update->dictionary();
    if (entry.empty()) continue;
    entry.insert_or_assign(std::string(kInstallDateKey), now);
    added.push_back(std::move(entry));
  }
  for (const SysupQuaymartUpdate& update : osUpdates) {
    std::optional<PlistDictionary> entry = entryOf(update);
    if (!entry) continue;
    entry->insert_or_assign(std::string(kInstallDateKey), now);
    added.push_back(std::move(*entry));
  }
  MutexLock lock(mutex_);
  appendLocked(std::move(added));
}

void UpdateJournal::appendCriticalUpdates(const Entries& entries) {
  MutexLock lock(mutex_);
  appendLocked(entries);
}

std::optional<PlistDictionary> UpdateJournal::entryOf(const SysupQuaymartUpdate& update) const {
  const bool partOfBundle = std::ranges::any_of(
      update.tags(), [](const std::string& tag) { return tag.starts_with(kBundleTagPrefix); });
  if (partOfBundle) return std::nullopt;
  PlistDictionary entry{{std::string(kIsSoftwareUpdateKey), true}};
  auto setIfPresent = [&entry](std::string_view key, const std::optional<std::string>& value) {
    if (value) entry.insert_or_assign(std::string(key), *value);
  };
  setIfPresent(kTitleKey, update.title());
  setIfPresent(kVersionKey, update.versionString());
  setIfPresent(kReleaseNotesKey, update.longDescription());
  if (!update.productKey().empty()) {
    entry.insert_or_assign(std::string(kProductKeyKey), update.productKey());
  }
  // These actions install at the next logout; the platform's report after
  // it says whether they did.
  if (update.action() == 1 || update.action() == 2) {
    entry.insert_or_assign(std::string(kPendingKey), true);
  }
  return entry;
}

void UpdateJournal::appendLocked(Entries added) {
  // Pending entries are read too and written back: the confirmation after
  // the next logout looks for them in the file.
  Entries entries = takePrunedLocked();
  entries.insert(entries.end(), std::make_move_iterator(added.begin()),
                 std::make_move_iterator(added.end()));
  writeLocked(std::move(entries));
}

void UpdateJournal::confirmPendingUpdates(const std::vector<std::string>& productKeys) {
  TILL_LOG(2, "%@: Confirming pending updates in journal with installedProductKeys = %@", kSpeaker,
           asValue(productKeys));
  MutexLock lock(mutex_);
  Entries entries = takePrunedLocked();
  // Walked newest first, so that the newest entry of a product is the one
  // kept; the confirmed ones are added back in the order they stood.
  std::map<std::string, PlistDictionary, std::less<>> confirmed;
  std::vector<std::string> confirmedOrder;
  for (std::size_t index = entries.size(); index-- > 0;) {
    PlistDictionary& entry = entries[index];
    if (!isPending(entry)) continue;
    const std::optional<std::string> key = productKeyOf(entry);
    const bool installed = key && std::ranges::find(productKeys, *key) != productKeys.end();
    if (!installed) {
      TILL_LOG(2, "%@: Removed pending post-logout update from journal: %@", kSpeaker,
               PlistValue(entry));
    } else if (confirmed.contains(*key)) {
      TILL_LOG(2, "%@: Skipping pending post-logout update in journal since it's a duplicate: %@",
               kSpeaker, PlistValue(entry));
    } else {
      PlistDictionary kept = entry;
      kept.erase(kept.find(kPendingKey));
      TILL_LOG(2, "%@: Confirmed pending post-logout update in journal: %@", kSpeaker,
               PlistValue(kept));
      confirmed.emplace(*key, std::move(kept));
      confirmedOrder.push_back(*key);
    }
    entries.erase(entries.begin() + static_cast<std::ptrdiff_t>(index));
  }
  // A confirmed entry keeps the date of the request, so it may stand behind
  // entries with later dates.
  for (auto key = confirmedOrder.rbegin(); key != confirmedOrder.rend(); ++key) {
    entries.push_back(std::move(confirmed.at(*key)));
  }
  writeLocked(std::move(entries));
}

void UpdateJournal::writeLocked(Entries entries) {
  // The binary writer takes every value an entry can hold, so there is no
  // encoding failure to report.
  // Moved, not copied: a braced list would copy every entry once more.
  PlistDictionary document;
  PlistValue& list =
      document
          .emplace(std::string(kEntriesKey), PlistArray(std::make_move_iterator(entries.begin()),
                                                        std::make_move_iterator(entries.end())))
          .first->second;
  const PlistData bytes = PropertyListSerialization::writeBinary(document);
  const std::string file = path();
  // Temporaries of a writer killed mid-write; none of ours is under way
  // while the lock is held.
  FileIO::removeStaleTemporaries(file);
  FileIdentity written;
  if (Result<void> result = FileIO::writeAtomically(file, bytes, &written); !result) {
    TILL_LOG(1, "%@: Failed to write to the auto update journal", kSpeaker);
    TILL_LOG(3, "%@: %@: %@", kSpeaker, file, result.errorDescription());
    return;  // nothing cached: the next call reads what the file holds
  }
  // The entries written are the version the file now holds; moved back
  // out of the document, which goes at the end of the write.
  cachedEntries_.clear();
  cachedEntries_.reserve(list.array()->size());
  for (PlistValue& item : *list.array()) cachedEntries_.push_back(std::move(*item.dictionary()));
  cachedIdentity_ = written;
}

}  // namespace larder
