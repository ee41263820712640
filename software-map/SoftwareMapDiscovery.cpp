// Discovery of the application registry and the merge of what it found.
#include <chrono>
#include <filesystem>

#include "platform/log/TillLogManager.h"
#include "platform/system/ApplicationRegistry.h"
#include "platform/system/Bundle.h"
#include "platform/system/Environment.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/records/VendPurchaseRecord.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "SoftwareMap";
constexpr std::string_view kInstallerIdentifierPrefix = "com.orvane.SetupHerald";

double secondsSince(std::chrono::steady_clock::time_point start) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

}  // namespace

LedgerSoftwareProductRef SoftwareMap::productFromPurchaseRecord(const std::string& path,
                                                                const VendPurchaseRecord& record) {
  LedgerSoftwareProductFields fields;
  fields.source = LedgerSoftwareProduct::kSourceRegistryOrPurchaseRecord;
  fields.bundlePath = path;
  fields.installed = true;
  fields.bundleIdentifier = record.bundleIdentifier;
  fields.bundleVersion = record.bundleVersion;
  fields.accountOpaqueID = record.opaqueAccountIDString;
  if (!record.wareID.isNull()) fields.itemIdentifier = record.wareID.uint64Value();
  if (!record.installerVersionID.isNull()) {
    fields.versionIdentifier = record.installerVersionID.int64Value();
  }
  fields.purchaseDate = record.purchaseDate;
  return std::make_shared<LedgerSoftwareProduct>(std::move(fields));
}

namespace {

// The OS installer application is in the map without purchase record.
LedgerSoftwareProductRef installerProduct(const std::string& path) {
  std::optional<Bundle> bundle = Bundle::open(path);
  if (!bundle) return nullptr;
  std::optional<std::string> identifier = bundle->identifier();
  if (!identifier || !identifier->starts_with(kInstallerIdentifierPrefix)) return nullptr;
  LedgerSoftwareProductFields fields;
  fields.source = LedgerSoftwareProduct::kSourceRegistryOrPurchaseRecord;
  fields.bundlePath = path;
  fields.installed = true;
  fields.bundleIdentifier = identifier;
  if (const std::string* version = bundle->infoValue("HostBundleVersion").string()) {
    fields.bundleVersion = *version;
  }
  return std::make_shared<LedgerSoftwareProduct>(std::move(fields));
}

template <typename T>
bool assignIfDifferent(std::optional<T>& existing, const std::optional<T>& fresh) {
  if (existing == fresh) return false;
  existing = fresh;
  return true;
}

void logChangeList(std::string_view kind, const SoftwareMap::ProductList& products) {
  auto& log = TillLogManager::sharedManager();
  if (!log.isEnabled(3)) return;
  PlistArray described;
  for (const auto& product : products) described.emplace_back(product->toDictionary());
  log.logLevel(
      3, "_rebuildMapUsingDiscoveredApps:", __FILE__, __LINE__,
      std::string("%@: rebuildMap found the following apps were ") + std::string(kind) + " %@",
      kSpeaker, PlistValue(std::move(described)));
}

}  // namespace

void SoftwareMap::initialDiscovery() {
  // The install environment may set the variable without a value: being set is what counts.
  if (std::optional<std::string> recovery = Environment::variableIfSet("__OSINSTALL_ENVIRONMENT")) {
    TILL_LOG(1, "%@: Running in recovery mode (%s) - Disabling all software map sources", kSpeaker,
             *recovery);
    return;
  }
  ProductList discovered = discoverAppsUsingAppRegistry();
  dispatchQueue_->barrierAsync([this, discovered = std::move(discovered)] {
    rebuildMapUsingDiscoveredApps(discovered);
    logAppsByPath({3,
                   3,
                   "initialDiscovery",
                   "SoftwareMap: Finished initial load with %@",
                   {},
                   "SoftwareMap: Finished initial load (%ld items)",
                   {LogArgument::number(records_->appsByPath->size())}});
    registerForPeriodicReload();
    if (options_.liveQueries) dispatchQueue_->async([this] { initializeLantern(); });
  });
}

void SoftwareMap::registerForPeriodicReload() {
  if (!options_.periodicReload) return;
  BackgroundActivityCriteria criteria;
  criteria.repeating = true;
  criteria.delay = std::chrono::hours(10);
  criteria.gracePeriod = std::chrono::hours(2);
  criteria.priority = BackgroundActivityPriority::Maintenance;
  criteria.allowBattery = false;
  periodicReload_ = std::make_unique<BackgroundActivityScheduler>();
  periodicReload_->registerActivity(
      "com.orvane.pantryd.SoftwareMap.periodicReload", criteria,
      [this](const BackgroundActivity&, BackgroundActivityState state) {
        if (state != BackgroundActivityState::Run) return;
        dispatchQueue_->async([this] {
          TILL_LOG(1, "%@: Performing periodic reload of SoftwareMap", kSpeaker);
          ProductList discovered = discoverAppsUsingAppRegistry();
          dispatchQueue_->barrierAsync([this, discovered = std::move(discovered)] {
            rebuildMapUsingDiscoveredApps(discovered);
          });
        });
      });
}

void SoftwareMap::reloadFromApplicationRegistry() {
  ProductList discovered = discoverAppsUsingAppRegistry();
  dispatchQueue_->barrierSync([&] { rebuildMapUsingDiscoveredApps(discovered); });
}

SoftwareMap::ProductList SoftwareMap::discoverAppsUsingAppRegistry() {
  auto start = std::chrono::steady_clock::now();
  ProductList discovered;
  for (const std::string& path : ApplicationRegistry::allApplicationPaths()) {
    if (path.empty()) continue;
    if (std::optional<VendPurchaseRecord> record =
            VendPurchaseRecord::purchaseRecordFromBundleAtPath(path)) {
      if (VendFileManager::isUpdatableAtPath(path)) {
        discovered.push_back(productFromPurchaseRecord(path, *record));
      }
    } else if (LedgerSoftwareProductRef installer = installerProduct(path)) {
      discovered.push_back(std::move(installer));
    }
  }
  TILL_LOG(1, "%@: Software map discovery took %.4f seconds for %lu records", kSpeaker,
           secondsSince(start), discovered.size());
  return discovered;
}

void SoftwareMap::rebuildMapUsingDiscoveredApps(const ProductList& discovered) {
  auto start = std::chrono::steady_clock::now();
  if (!records_->appsByPath) records_->appsByPath.emplace();
  Changes changes;
  StringMap<LedgerSoftwareProductRef> removed = *records_->appsByPath;
  for (const LedgerSoftwareProductRef& fresh : discovered) {
    std::string path = fresh->bundlePath();
    auto existing = records_->appsByPath->find(path);
    if (existing == records_->appsByPath->end()) {
      changes.added.push_back(fresh);
      records_->appsByPath->emplace(std::move(path), fresh);
      continue;
    }
    bool didChange = false;
    updateAppWithApp(*existing->second, *fresh, &didChange);
    if (didChange) changes.changed.push_back(existing->second);
    removed.erase(path);
  }
  for (auto& [path, product] : removed) {
    std::error_code code;
    if (std::filesystem::exists(path, code) &&
        VendPurchaseRecord::purchaseRecordFromBundleAtPath(path)) {
      TILL_LOG(
          1,
          "%@: Valid QMT app at path %@ was not found in full app scan, but seems to exist on disk",
          kSpeaker, path);
    }
    records_->appsByPath->erase(path);
    product->update([](LedgerSoftwareProductFields& fields) { fields.installed = false; });
    changes.removed.push_back(product);
  }
  rebuildSecondaryMaps();
  writePersistedStoreToDisk();
  logRebuild(secondsSince(start));
  logChangeList("ADDED", changes.added);
  logChangeList("CHANGED", changes.changed);
  logChangeList("REMOVED", changes.removed);
  enqueueNotifications(std::move(changes));
}

void SoftwareMap::logRebuild(double seconds) {
  std::vector<LogArgument> arguments{kSpeaker, LogArgument::number(seconds),
                                     LogArgument::number(records_->appsByPath->size())};
  logAppsByPath({1, 3, "_rebuildMapUsingDiscoveredApps:",
                 "%@: Software map rebuild took %.4f seconds for %lu records and produced: %@",
                 arguments, "%@: Software map rebuild took %.4f seconds for %lu records",
                 arguments});
}

void SoftwareMap::updateAppWithApp(LedgerSoftwareProduct& existing,
                                   const LedgerSoftwareProduct& fresh, bool* didChange) {
  LedgerSoftwareProductFields incoming = fresh.snapshot();
  bool changed = false;
  std::optional<std::string> actualVersion;
  std::optional<std::string> expectedVersion;
  std::optional<std::int64_t> actualStoreVersion;
  std::optional<std::int64_t> expectedStoreVersion;
  bool expectationEnded = false;
  existing.update([&](LedgerSoftwareProductFields& fields) {
    changed |= assignIfDifferent(fields.accountOpaqueID, incoming.accountOpaqueID);
    changed |= assignIfDifferent(fields.itemIdentifier, incoming.itemIdentifier);
    changed |= assignIfDifferent(fields.versionIdentifier, incoming.versionIdentifier);
    changed |= assignIfDifferent(fields.bundleIdentifier, incoming.bundleIdentifier);
    changed |= assignIfDifferent(fields.bundleVersion, incoming.bundleVersion);
    if (fields.bundlePath != incoming.bundlePath) {
      fields.bundlePath = incoming.bundlePath;
      changed = true;
    }
    fields.source = incoming.source;
    if (!fields.metadataChangeIsExpected) return;
    expectationEnded = true;
    actualVersion = fields.bundleVersion;
    expectedVersion = fields.expectedBundleVersion;
    actualStoreVersion = fields.versionIdentifier;
    expectedStoreVersion = fields.expectedStoreVersion;
    fields.metadataChangeIsExpected = false;
    fields.expectedBundleVersion.reset();
    fields.expectedStoreVersion.reset();
  });
  if (expectationEnded) {
    if (expectedVersion != actualVersion) {
      TILL_LOG(1, "%@: Changed product bundle version (%@) does not match expected value (%@)",
               kSpeaker, actualVersion, expectedVersion);
    }
    if (!actualStoreVersion || actualStoreVersion != expectedStoreVersion) {
      TILL_LOG(1, "%@: Changed product bundle version (%@) does not match expected value (%@)",
               kSpeaker, actualStoreVersion, expectedStoreVersion);
    }
  }
  if (didChange) *didChange = changed;
}

}  // namespace larder
