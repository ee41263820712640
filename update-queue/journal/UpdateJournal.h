#pragma once

#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/system/FileIO.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"

namespace larder {

// The record of what was installed in the last 30 days, which the store
// application shows as the user's update history: one entry per installed
// app update and OS update, oldest first, in a binary property list
// {"autoInstalledUpdates": [entry, ...]} below the user's data folder.
//
// An OS update installed only at the next logout enters as pending; the
// platform's report after the logout confirms it or drops it. Pending
// entries stay in the file (every change reads them) but are left out of
// what the store application is shown.
//
// The file is the truth: each call checks its identity (inode, size,
// modification time) and parses it again when it is not the version last
// read or written here, so a change made by another process is seen. The
// entries of that version stay in memory, so that a read after our own
// write, and a change after it, do not parse again. (A rewrite in place
// that keeps the size and lands within the same tick of the file system's
// clock would not be seen; every writer of this file replaces it by rename.)
// Each change writes the file whole. One lock covers every read, change and write, so
// that two changes that meet never lose an entry; writes are atomic, so a
// process killed at any moment leaves the old file or the new one. Nothing
// here calls into the update queue, whose barrier a caller may hold.
class UpdateJournal {
 public:
  static constexpr std::string_view kEntriesKey = "autoInstalledUpdates";
  static constexpr std::string_view kInstallDateKey = "installDate";
  static constexpr std::string_view kPendingKey = "__postLogoutInstallPending";
  static constexpr std::string_view kIsSoftwareUpdateKey = "__isSoftwareUpdate";
  static constexpr std::string_view kProductKeyKey = "productKey";
  static constexpr std::string_view kTitleKey = "title";
  static constexpr std::string_view kVersionKey = "version";
  static constexpr std::string_view kReleaseNotesKey = "release-notes";
  // An OS update that carries a tag with this prefix is part of a bundle
  // install and gets no entry of its own.
  static constexpr std::string_view kBundleTagPrefix = "SysupBUNDLE:";
  // Entries older than this go, from the front of the list.
  static constexpr double kMaximumAgeSeconds = 2592000;

  using Entries = std::vector<PlistDictionary>;
  // The current moment, as the entries' dates are written.
  using Clock = std::function<PlistDate()>;

  // The journal of the user's data folder: "<data>/Quaymart/updatejournal.plist"
  // with the data folder of `Environment::dataDirectory()`, read at each use.
  UpdateJournal();
  // A journal at `path`, timed by `clock`; for tests and benchmarks.
  explicit UpdateJournal(std::string path, Clock clock = systemClock);
  UpdateJournal(const UpdateJournal&) = delete;
  UpdateJournal& operator=(const UpdateJournal&) = delete;

  // The process's journal.
  static UpdateJournal& sharedJournal();
  static PlistDate systemClock();

  [[nodiscard]] std::string path() const;

  // One entry for each app update (every key of its record) and for each OS
  // update that is not part of a bundle (its title, version, release notes
  // and product key; pending when its action is 1 or 2), dated now, after
  // the entries that stand.
  void appendInstalledUpdates(const std::vector<LedgerUpdateRef>& appUpdates,
                              const std::vector<SysupQuaymartUpdate>& osUpdates) EXCLUDES(mutex_);
  // Entries made elsewhere (the background scan report's), added as they are.
  void appendCriticalUpdates(const Entries& entries) EXCLUDES(mutex_);

  // The entries of the last 30 days without the pending ones.
  [[nodiscard]] Entries installedUpdatesJournal() const EXCLUDES(mutex_);
  // The entries of the last 30 days; pending ones left out when `ignorePending`.
  [[nodiscard]] Entries installedUpdatesJournalIgnoringPendingUpdates(bool ignorePending) const
      EXCLUDES(mutex_);

  // The platform installed the OS updates of `productKeys` after a logout:
  // the newest pending entry of each becomes an ordinary entry, every other
  // pending entry goes.
  void confirmPendingUpdates(const std::vector<std::string>& productKeys) EXCLUDES(mutex_);

 private:
  // The file's entries, the stale ones at the front pruned; a missing or
  // damaged file gives none. A copy of the cached version.
  [[nodiscard]] Entries readPrunedLocked(bool ignorePending) const REQUIRES(mutex_);
  // The same, taken out of the cache for a change that writes them back.
  [[nodiscard]] Entries takePrunedLocked() REQUIRES(mutex_);
  // The entries of the file as it is now, parsed only when it is not the
  // version cached.
  const Entries& currentEntriesLocked() const REQUIRES(mutex_);
  // Index of the first entry the prune keeps.
  [[nodiscard]] std::size_t firstKeptIndex(const Entries& entries) const;
  void writeLocked(Entries entries) REQUIRES(mutex_);
  void appendLocked(Entries added) REQUIRES(mutex_);
  // The entry of one OS update, or nullopt for a part of a bundle.
  [[nodiscard]] std::optional<PlistDictionary> entryOf(const SysupQuaymartUpdate& update) const;

  // Empty for the journal of the user's data folder.
  std::string fixedPath_;
  Clock clock_;
  mutable Mutex mutex_;
  // The parsed entries of the file version `cachedIdentity_` names; no
  // version is cached when it is empty.
  mutable std::optional<FileIdentity> cachedIdentity_ GUARDED_BY(mutex_);
  mutable Entries cachedEntries_ GUARDED_BY(mutex_);
};

}  // namespace larder
