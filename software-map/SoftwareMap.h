#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform/background/BackgroundActivityScheduler.h"
#include "platform/dispatch/DispatchQueue.h"
#include "platform/dispatch/QueueConfined.h"
#include "platform/log/TillLogManager.h"
#include "platform/metadata/MetadataQuery.h"
#include "platform/value/PlistValue.h"
#include "software-map/VendSoftwareMapObserver.h"
#include "store-runtime/records/LedgerSoftwareProduct.h"

namespace larder {

class VendStoreClient;

// The process's one index of the store software installed on the machine.
// All maps are guarded by `dispatchQueue`: readers enter it synchronously,
// every change is a barrier. Records are shared between the maps, so a
// change of a record is seen through all of them at once.
class SoftwareMap {
 public:
  struct Options {
    // Where the persisted store lives; empty means the standard place in
    // the user's caches folder.
    std::string persistedStorePath;
    // Run the discovery of the application registry after the load, and
    // then the live queries.
    bool discoverApplications = true;
    // Keep the map live with the metadata queries after the first discovery.
    bool liveQueries = true;
    // Repeat the discovery every ten hours on mains power.
    bool periodicReload = true;
  };

  using ProductList = std::vector<LedgerSoftwareProductRef>;

  static SoftwareMap& sharedInstance();

  explicit SoftwareMap(Options options);
  ~SoftwareMap();
  SoftwareMap(const SoftwareMap&) = delete;
  SoftwareMap& operator=(const SoftwareMap&) = delete;

  // A new record for the bundle at `path`, read from the disk as it is now;
  // not stored in any map. nullptr when the bundle cannot be opened.
  static LedgerSoftwareProductRef createSoftwareProductForAppAtPath(const std::string& path);
  // The bundle's information property list; empty when it has none.
  static PlistDictionary bundleInfoFromBundleAtPath(const std::string& path);

  LedgerSoftwareProductRef productForBundleIdentifier(std::string_view bundleIdentifier);
  LedgerSoftwareProductRef productForItemIdentifier(std::uint64_t itemIdentifier);
  ProductList allProducts();
  std::optional<PlistData> iconDataForApplicationWithBundleID(std::string_view bundleIdentifier);

  // The body of an update check: a dictionary with the installed software
  // ("local-software") and/or the software that came with the machine
  // ("bundled-software"), as an XML property list, gzip-compressed when
  // asked and possible. `compressed` tells whether it was; `hadBundledApps`
  // is written only when the bundled list was made. Items whose item
  // identifier (in decimal) or bundle identifier is on `skipList` are left
  // out. nullopt would mean no body; the writer always gives one.
  std::optional<PlistData> updateRequestBodyData(bool* compressed, bool includeInstalledApps,
                                                 bool includeBundledApps, bool conditionally,
                                                 bool* hadBundledApps, bool shouldCompress,
                                                 const std::vector<std::string>& skipList = {});
  // The path that an incoming `versionNumber` of the application should
  // replace; nullopt when there is none that may be replaced.
  std::optional<std::string> productPathToUpgradeForBundleIdentifier(
      std::string_view bundleIdentifier, std::string_view versionNumber);
  // Whether a pushed install of that version may go ahead: yes when it has
  // a store copy to replace or when the application is not here at all.
  bool shouldAllowAutoPushForBundleID(std::string_view bundleID, std::string_view bundleVersion);
  // The name of the account that owns `product`, asked of the store with
  // the purchase record of its bundle. Blocks until the store has
  // answered; nullopt without product, purchase record or answer.
  static std::optional<std::string> lookupOrvaneIDForApp(const LedgerSoftwareProduct* product,
                                                         const VendStoreClient& storeClient);
  // The manifest of bundled software is read once per process; tests that
  // change the platform root between cases forget it.
  static void resetBundledManifestForTesting();

  // Observers are kept by token; a null observer still gets a token.
  std::string addObserver(std::shared_ptr<VendSoftwareMapObserver> observer);
  void removeObserverWithToken(const std::string& token);
  void notifyObserversAboutProduct(const LedgerSoftwareProductRef& product, std::int64_t state);

  [[nodiscard]] const std::shared_ptr<DispatchQueue>& dispatchQueue() const {
    return dispatchQueue_;
  }
  [[nodiscard]] const std::shared_ptr<DispatchQueue>& metadataQueryQueue() const {
    return metadataQueryQueue_;
  }
  [[nodiscard]] const std::shared_ptr<DispatchQueue>& observerQueue() const {
    return observerQueue_;
  }
  [[nodiscard]] std::string persistedStorePath() const { return persistedStoreURL(); }

  // The update machinery's notice that the bundle at `path` is about to be
  // replaced, so that the index's removal and addition are not taken for
  // an uninstall; and its report that the replacement is done.
  void productAtPathWillBeUpdatedToBundleVersionStoreVersion(const std::string& path,
                                                             const std::string& bundleVersion,
                                                             std::int64_t storeVersion);
  void productAtPathWasUpdatedToBundleVersionStoreVersion(const std::string& path, bool wasUpdated,
                                                          const std::string& bundleVersion,
                                                          std::int64_t storeVersion);

  // Scan and merge, as at start; returns once the merge is done (the
  // notifications may still be on their way).
  void reloadFromApplicationRegistry();

  // Waits until every task enqueued on the map's queues so far has run.
  void waitUntilIdle();
  // Waits until the changes made so far are on disk: the change under way
  // ends, then the writes it queued. Unlike `waitUntilIdle` it does not wait
  // for the observers.
  void finishPendingWrites();

  // Makes both live queries behave as on an overflow of the kernel's event
  // queue, for tests of the recovery.
  void simulateMetadataQueryOverflowForTesting();

  // The two live queries, their strings and attributes.
  static const std::string& metadataQueryStringQMT();
  static const std::string& metadataQueryStringLegacy();
  static std::vector<std::string> metadataQueryValueAttributes();
  // Bundle identifier → {"wareID": number, "minimumVersion": string}.
  static const PlistDictionary& legacyAppWhiteList();

 private:
  struct Changes {
    ProductList added;
    ProductList changed;
    ProductList removed;
  };

  // Load and store.
  void asyncInitializeAndLoadPersistedStore();
  // Loads the records; returns the decoded archive for the caller to free.
  std::optional<PlistValue> loadPersistedStore();
  void writePersistedStoreToDisk();
  [[nodiscard]] std::string persistedStoreURL() const;
  // Logs a line about the primary map: with at most five records the line
  // ends with the map (`smallFormat`, its last "%@"), with more it gives
  // `largeFormat` and the map goes to the side file "appsByPath".
  struct MapLogLine {
    int level;
    int sideFileLevel;
    std::string_view function;
    std::string_view smallFormat;
    std::vector<LogArgument> smallArguments;
    std::string_view largeFormat;
    std::vector<LogArgument> largeArguments;
  };
  void logAppsByPath(MapLogLine line) const;

  // Secondary maps and lookups, called inside the queue.
  [[nodiscard]] LedgerSoftwareProductRef productAtPath(const std::string& path) const;
  void rebuildSecondaryMaps();
  LedgerSoftwareProductRef productWithIdentifierInDictionary(
      const ProductList* candidates, std::string_view identifierDescription);
  static bool productSearchResultIsPreferredOverProduct(const LedgerSoftwareProduct& candidate,
                                                        const LedgerSoftwareProduct& other);

  // Discovery and merge.
  void initialDiscovery();
  static ProductList discoverAppsUsingAppRegistry();
  static LedgerSoftwareProductRef productFromPurchaseRecord(
      const std::string& path, const struct VendPurchaseRecord& record);
  void rebuildMapUsingDiscoveredApps(const ProductList& discovered);
  void logRebuild(double seconds);
  void registerForPeriodicReload();
  static void updateAppWithApp(LedgerSoftwareProduct& existing, const LedgerSoftwareProduct& fresh,
                               bool* didChange);

  void enqueueNotifications(Changes changes);

  // Update request body.
  struct SoftwareEntry;
  using SoftwareEntries = std::vector<SoftwareEntry>;
  SoftwareEntries copyApplicationDictionariesForUpdateSkipping(
      const std::vector<std::string>& skipList);
  static SoftwareEntries bundledApplicationsListConditional(bool conditionally);

  // Live queries.
  using MetadataItemRef = std::shared_ptr<const MetadataItem>;
  // Records of one query event, by the item they were made from.
  using MappedApplications = std::vector<std::pair<MetadataItemRef, LedgerSoftwareProductRef>>;
  void initializeLantern();
  void startMetadataQueryForQMTApps();
  void startMetadataQueryForLegacyApps();
  void startMetadataQuery(std::shared_ptr<MetadataQuery> SoftwareMap::*handle,
                          const std::string& queryString, std::string_view failureText);
  void updateApplicationWithMDItem(LedgerSoftwareProduct& product, const MetadataItemRef& item,
                                   const MetadataQuery& query) const;
  LedgerSoftwareProductRef applicationFromMDItem(const MetadataItemRef& item) const;
  LedgerSoftwareProductRef legacyApplicationFromMDItem(const MetadataItemRef& item) const;
  static bool legacyApplicationSatifiesMinimumVersionRequirement(
      const LedgerSoftwareProduct& product);
  void queryDidFinish(MetadataQuery& query);
  void queryDidUpdateWithUserInfo(MetadataQuery& query, const MetadataQueryUpdate& update);
  MappedApplications mappedApplicationsForUpdateArray(const std::vector<MetadataItemRef>& items,
                                                      bool isLegacy) const;
  void mdServerPortInvalid();
  void mergeFirstResults(const MappedApplications& results, std::size_t resultCount);
  void mergeUpdate(const MappedApplications& added, const MappedApplications& changed,
                   const std::vector<MetadataItemRef>& removed);
  void rememberItem(const MetadataItemRef& item, const LedgerSoftwareProductRef& product);
  void stopMetadataQueries();

  Options options_;
  std::shared_ptr<DispatchQueue> dispatchQueue_;
  std::shared_ptr<DispatchQueue> metadataQueryQueue_;
  std::shared_ptr<DispatchQueue> observerQueue_;
  // Writes of the persisted store, in order, outside the map's barriers.
  std::shared_ptr<DispatchQueue> storeQueue_;

  struct StringHash {
    using is_transparent = void;
    std::size_t operator()(std::string_view text) const {
      return std::hash<std::string_view>{}(text);
    }
  };
  template <typename Value>
  using StringMap = std::unordered_map<std::string, Value, StringHash, std::equal_to<>>;

  // Items the queries reported, by identity, with their records. The item
  // is held so that its address stays a valid key.
  struct MappedItem {
    MetadataItemRef item;
    LedgerSoftwareProductRef product;
  };
  // The records and their indexes: read in tasks of dispatchQueue_, changed
  // in its barriers (and by initializeLantern, before any query reports).
  struct Records {
    std::optional<StringMap<LedgerSoftwareProductRef>> appsByPath;
    StringMap<ProductList> appsByBundleID;
    std::unordered_map<std::uint64_t, ProductList> appsByItemID;
    std::unordered_map<const MetadataItem*, MappedItem> appsByMDItem;
  };
  QueueConfined<Records> records_{dispatchQueue_};

  // Owned by metadataQueryQueue_.
  std::shared_ptr<MetadataQuery> metadataQueryRefQMT_;
  std::shared_ptr<MetadataQuery> metadataQueryRefLegacy_;
  std::chrono::steady_clock::time_point metadataQueryStartDate_;

  std::unique_ptr<BackgroundActivityScheduler> periodicReload_;

  QueueConfined<std::map<std::string, std::shared_ptr<VendSoftwareMapObserver>>> observers_{
      observerQueue_};
};

}  // namespace larder
