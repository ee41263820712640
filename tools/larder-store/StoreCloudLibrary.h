#pragma once

#include <cstdint>
#include <deque>
#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "dmap/DAAPItemsRequest.h"
#include "larder-store/StoreLibraryItem.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"

namespace larder {

// The cloud library of the catalogue, "library.plist":
//   { bag?: { entries of the bag's "purchase-daap" },
//     revisions: [ { revision: n, items?: [ item ], deleted?: [ cloud id ] } ] }
// Revisions count up; the library as of revision n is every item listed
// up to n (a later entry of the same id replaces the earlier one) less the
// ids deleted since. The file is read again whenever it changes, so that a
// test or a demo can publish a revision while the store runs. It also
// keeps the sessions it has handed out. Any thread may use it.
class StoreCloudLibrary {
 public:
  // Where the service lives on the store; the bag's "base-url".
  static constexpr std::string_view kBasePath = "/daap";
  // Sessions kept; older ones are forgotten.
  static constexpr std::size_t kMaxSessions = 4096;

  struct ItemsQuery {
    std::uint32_t latestVersion = 0;
    std::uint32_t localVersion = 0;
    // What the client holds: left out of the answer when unchanged, and
    // answered as deleted when gone from the library.
    std::vector<DAAPItemsRequest::TokenPair> held;
    // Only items of these kinds (items without a kind always); all when absent.
    std::optional<std::vector<std::int64_t>> mediaKinds;
    bool includePreorders = false;
  };

  struct Changes {
    std::uint32_t revision = 0;  // the revision answered
    bool full = false;           // the whole library rather than a difference
    std::size_t totalCount = 0;  // items in the library at that revision
    std::vector<StoreLibraryItem> items;
    std::vector<std::uint64_t> deleted;
  };

  explicit StoreCloudLibrary(std::string path);

  // Whether the catalogue has a library (the file exists and reads).
  [[nodiscard]] bool isPresent();
  // The bag's "purchase-daap" dictionary, nothing without a library.
  [[nodiscard]] std::optional<PlistDictionary> bagEntry(std::string_view baseURL);

  [[nodiscard]] std::uint32_t login(std::uint64_t accountID);
  [[nodiscard]] bool hasSession(std::uint32_t sessionID, std::uint64_t accountID) const;

  [[nodiscard]] std::uint32_t currentRevision();
  [[nodiscard]] std::size_t itemCount();
  // What changed between the query's revisions: a difference when the
  // local revision lies between 0 and the latest, else the whole library
  // (a first fetch, or a forced refresh with both revisions the same). The
  // latest revision is capped at the library's.
  [[nodiscard]] Changes changes(const ItemsQuery& query);

 private:
  struct Revision {
    std::uint32_t number = 0;
    std::vector<StoreLibraryItem> items;
    std::vector<std::uint64_t> deleted;
  };
  struct Entry {
    const StoreLibraryItem* item = nullptr;
    std::uint32_t revision = 0;
  };
  using Stamp = std::pair<std::filesystem::file_time_type, std::uintmax_t>;

  void refreshLocked() REQUIRES(mutex_);
  void loadLocked() REQUIRES(mutex_);
  std::optional<Revision> revisionFromEntry(const PlistValue& entry, std::uint32_t previous,
                                            std::size_t index) const;
  // The library as of `revision`, by cloud id, and when each id was deleted.
  void stateAtLocked(std::uint32_t revision, std::map<std::uint64_t, Entry>& items,
                     std::map<std::uint64_t, std::uint32_t>& deletions) const REQUIRES(mutex_);
  [[nodiscard]] std::uint32_t currentRevisionLocked() const REQUIRES(mutex_);

  std::string path_;
  mutable Mutex mutex_;
  std::optional<Stamp> stamp_ GUARDED_BY(mutex_);
  bool present_ GUARDED_BY(mutex_) = false;
  PlistDictionary bagSettings_ GUARDED_BY(mutex_);
  std::vector<Revision> revisions_ GUARDED_BY(mutex_);
  std::deque<std::pair<std::uint32_t, std::uint64_t>> sessions_ GUARDED_BY(mutex_);
  std::uint32_t nextSession_ GUARDED_BY(mutex_) = 1;
};

}  // namespace larder
