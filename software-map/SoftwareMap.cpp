#include "software-map/SoftwareMap.h"

#include <malloc.h>

#include <set>

#include "platform/dispatch/DispatchSemaphore.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/KeyedArchive.h"
#include "platform/system/Bundle.h"
#include "platform/system/Environment.h"
#include "platform/system/FileIO.h"
#include "platform/system/Uuid.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/records/VendPurchaseRecord.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "SoftwareMap";
constexpr std::string_view kAppsByPathKey = "appsByPath";
constexpr std::size_t kMostRecordsInLogLine = 5;

const char* stateName(std::int64_t state) {
  switch (state) {
    case kSoftwareProductAdded:
      return "Added";
    case kSoftwareProductChanged:
      return "Changed";
    default:
      return "Removed";
  }
}

bool isInApplicationsFolder(const std::string& path) {
  return Environment::isBelowRootedPrefix(path, "/Applications/");
}

bool isOnBootVolume(const std::string& path) {
  return VendFileManager::volumePath(path) == "/";
}

// Decoding the store builds a property-list tree several times the size of
// the records it yields. The allocator keeps what was freed in the queue
// thread's arena; handing it back keeps an idle service small.
void returnFreedMemoryToSystem() {
#ifdef __GLIBC__
  malloc_trim(0);
#endif
}

}  // namespace

SoftwareMap& SoftwareMap::sharedInstance() {
  static SoftwareMap instance(Options{});
  return instance;
}

SoftwareMap::SoftwareMap(Options options)
    : options_(std::move(options)),
      dispatchQueue_(DispatchQueue::create("SoftwareMap Queue", DispatchQueue::Kind::Concurrent)),
      metadataQueryQueue_(
          DispatchQueue::create("SoftwareMap MetadataQuery Queue", DispatchQueue::Kind::Serial)),
      observerQueue_(
          DispatchQueue::create("SoftwareMap Observer Queue", DispatchQueue::Kind::Serial)),
      storeQueue_(DispatchQueue::create("SoftwareMap Store Queue", DispatchQueue::Kind::Serial)) {
  // The load is a barrier enqueued first, so every later lookup waits for
  // the persisted records and then answers while the discovery runs.
  dispatchQueue_->barrierAsync([this] { asyncInitializeAndLoadPersistedStore(); });
  if (options_.discoverApplications) {
    dispatchQueue_->async([this] { initialDiscovery(); });
  }
}

SoftwareMap::~SoftwareMap() {
  // The queries and the reload call back into the map: stop them, then
  // drain what they enqueued before, so that nothing runs on a dead map.
  waitUntilIdle();
  stopMetadataQueries();
  periodicReload_.reset();
  waitUntilIdle();
}

void SoftwareMap::waitUntilIdle() {
  // A barrier runs after everything queued before it; the notification
  // tasks a barrier enqueues need a second round, and the observer queue
  // a third.
  for (int round = 0; round < 3; ++round) {
    dispatchQueue_->barrierSync([] {});
    metadataQueryQueue_->sync([] {});
    observerQueue_->sync([] {});
    storeQueue_->sync([] {});
  }
}

void SoftwareMap::finishPendingWrites() {
  dispatchQueue_->barrierSync([] {});
  storeQueue_->sync([] {});
}

// MARK: load and store

std::string SoftwareMap::persistedStoreURL() const {
  if (!options_.persistedStorePath.empty()) return options_.persistedStorePath;
  return VendFileManager::cacheDirectoryPathWithName("com.orvane.tradeline") + "/SoftwareMap";
}

void SoftwareMap::asyncInitializeAndLoadPersistedStore() {
  // The observer dictionary exists from construction, so an observer added
  // while the load waits in the queue is kept and hears the discovery.
  std::optional<PlistValue> decoded;
  try {
    decoded = loadPersistedStore();
  } catch (const std::exception& exception) {
    TILL_LOG(1, "%@: Exception loading persisted SoftwareMap - %@", kSpeaker, exception.what());
  }
  std::size_t count = records_->appsByPath ? records_->appsByPath->size() : 0;
  logAppsByPath({2,
                 2,
                 __func__,
                 "%@: After loading persisted store, SoftwareMap is %@",
                 {kSpeaker},
                 "%@: After loading persisted store, SoftwareMap has %ld items",
                 {kSpeaker, LogArgument::number(count)}});
  if (!records_->appsByPath) records_->appsByPath.emplace();
  // Readers wait for this barrier; freeing the decoded archive and handing
  // the memory back can happen after they have their answers.
  // Held by a shared pointer: the task may be copied on its way to a worker,
  // and the tree must be gone before the memory is handed back.
  auto archive = std::make_shared<std::optional<PlistValue>>(std::move(decoded));
  dispatchQueue_->async([archive] {
    archive->reset();
    returnFreedMemoryToSystem();
  });
}

std::optional<PlistValue> SoftwareMap::loadPersistedStore() {
  // A write cut short by a crash leaves its temporary file behind; nothing
  // else would ever remove it.
  if (const std::size_t stale = FileIO::removeStaleTemporaries(persistedStoreURL()); stale > 0) {
    TILL_LOG(2, "%@: Removed %@ stale temporary file(s) beside %@", kSpeaker, stale,
             persistedStoreURL());
  }
  std::optional<PlistData> data = FileIO::read(persistedStoreURL()).optional();
  if (!data || data->empty()) {
    TILL_LOG(2, "%@: Persisted SoftwareMap not found", kSpeaker);
    return std::nullopt;
  }
  static const std::set<std::string, std::less<>> kAllowedClasses{
      std::string(KeyedArchive::kDictionaryClass), std::string(KeyedArchive::kStringClass),
      std::string(LedgerSoftwareProduct::kClassName)};
  std::optional<PlistValue> root = KeyedArchive::unarchivedRoot(*data, kAllowedClasses);
  const PlistValue* records = root ? &(*root)[kAppsByPathKey] : nullptr;
  if (!records || !records->isDictionary()) {
    TILL_LOG(1, "%@: Persisted SoftwareMap did not contain appsByPath dictionary.", kSpeaker);
    return root;
  }
  StringMap<LedgerSoftwareProductRef> loaded;
  loaded.reserve(records->dictionary()->size());
  for (const auto& [path, encoded] : *records->dictionary()) {
    LedgerSoftwareProductRef product = LedgerSoftwareProduct::initWithCoder(encoded);
    // The key is the record's path by invariant; a record that breaks it is
    // not ours to trust.
    if (product && product->bundlePath() == path) loaded.emplace(path, std::move(product));
  }
  records_->appsByPath = std::move(loaded);
  rebuildSecondaryMaps();
  return root;
}

void SoftwareMap::logAppsByPath(MapLogLine line) const {
  auto& log = TillLogManager::sharedManager();
  if (!log.isEnabled(line.level)) return;
  PlistDictionary described;
  if (records_->appsByPath) {
    for (const auto& [path, product] : *records_->appsByPath)
      described.emplace(path, product->toDictionary());
  }
  if (described.size() <= kMostRecordsInLogLine) {
    line.smallArguments.emplace_back(describePlistValue(described));
    log.logWithDescribedArguments(line.level, line.function, __FILE__, __LINE__, line.smallFormat,
                                  line.smallArguments);
    return;
  }
  log.logWithDescribedArguments(line.level, line.function, __FILE__, __LINE__, line.largeFormat,
                                line.largeArguments);
  log.logLevelForPlist(line.sideFileLevel, line.function, __FILE__, __LINE__, described,
                       kAppsByPathKey);
}

void SoftwareMap::writePersistedStoreToDisk() {
  if (!records_->appsByPath) return;
  // The barrier takes only the membership; encoding and the disk, with its
  // fsync, happen on the store queue in the order of the changes, so that
  // readers never wait for the disk. A record's values are read when it is
  // encoded, which is never older than the change that asked for the write.
  auto members = std::make_shared<std::vector<std::pair<std::string, LedgerSoftwareProductRef>>>(
      records_->appsByPath->begin(), records_->appsByPath->end());
  storeQueue_->async([members, path = persistedStoreURL()] {
    PlistDictionary records;
    for (const auto& [memberPath, product] : *members) {
      records.emplace(memberPath, product->encodeWithCoder());
    }
    PlistValue root = KeyedArchive::dictionary(
        {{std::string(kAppsByPathKey), KeyedArchive::dictionary(std::move(records))}});
    PlistData data = KeyedArchive::archivedData(root);
    if (data.empty()) return;
    if (auto written = FileIO::writeAtomically(path, data); !written) {
      TILL_LOG(1, "%@: Exception writing persisted SoftwareMap to %@ - %@", kSpeaker, path,
               written.error().description);
      return;
    }
    TILL_LOG(2, "%@: Updated persisted SoftwareMap at %@", kSpeaker, path);
  });
}

// MARK: secondary maps and lookups

void SoftwareMap::rebuildSecondaryMaps() {
  records_->appsByBundleID.clear();
  records_->appsByItemID.clear();
  if (!records_->appsByPath) return;
  records_->appsByBundleID.reserve(records_->appsByPath->size());
  records_->appsByItemID.reserve(records_->appsByPath->size());
  for (const auto& entry : *records_->appsByPath) {
    const LedgerSoftwareProductRef& product = entry.second;
    bool hasBundleIdentifier = false;
    bool hasItemIdentifier = false;
    product->read([&](const LedgerSoftwareProductFields& fields) {
      hasBundleIdentifier = fields.bundleIdentifier.has_value();
      hasItemIdentifier = fields.itemIdentifier.has_value();
      if (hasBundleIdentifier)
        records_->appsByBundleID[*fields.bundleIdentifier].push_back(product);
      if (hasItemIdentifier) records_->appsByItemID[*fields.itemIdentifier].push_back(product);
    });
    if (!hasBundleIdentifier) {
      TILL_LOG(3, "%@: App does not have bundleIdentifier, ignoring in secondary map: %@", kSpeaker,
               product);
    }
    if (!hasItemIdentifier) {
      TILL_LOG(3, "%@: App does not have itemIdentifier, ignoring in secondary map: %@", kSpeaker,
               product);
    }
  }
}

LedgerSoftwareProductRef SoftwareMap::productWithIdentifierInDictionary(
    const ProductList* candidates, std::string_view identifierDescription) {
  if (!candidates || candidates->empty()) return nullptr;
  if (candidates->size() == 1) return candidates->front();
  LedgerSoftwareProductRef best = candidates->front();
  for (std::size_t i = 1; i < candidates->size(); ++i) {
    if (productSearchResultIsPreferredOverProduct(*(*candidates)[i], *best)) {
      best = (*candidates)[i];
    }
  }
  TILL_LOG(1,
           "%@: productWithIdentifier:inDictionary Warning, multiple matches for %@ found - "
           "returning preferred result %@",
           kSpeaker, identifierDescription, best);
  return best;
}

bool SoftwareMap::productSearchResultIsPreferredOverProduct(const LedgerSoftwareProduct& candidate,
                                                            const LedgerSoftwareProduct& other) {
  LedgerSoftwareProductFields c = candidate.snapshot();
  LedgerSoftwareProductFields o = other.snapshot();
  std::string cVersion = c.bundleVersion.value_or("");
  std::string oVersion = o.bundleVersion.value_or("");
  auto decide = [&](bool candidateWins, const char* format) {
    const auto& winner = candidateWins ? c : o;
    const auto& loser = candidateWins ? o : c;
    TILL_LOG(1, format, kSpeaker, winner.bundleVersion, winner.bundlePath, loser.bundleVersion,
             loser.bundlePath);
    return candidateWins;
  };

  bool candidateUpdatable = VendFileManager::isUpdatableAtPath(c.bundlePath);
  bool otherUpdatable = VendFileManager::isUpdatableAtPath(o.bundlePath);
  if (candidateUpdatable != otherUpdatable) {
    return decide(candidateUpdatable,
                  "%@: Preferring (updatable) app version %@ at %@ over non-updatable version %@ "
                  "at %@");
  }
  if (int order = compareVersionStrings(oVersion, cVersion); order != 0) {
    return decide(order < 0,
                  "%@: Preferring (newer/higher) app version %@ at %@ over version %@ at %@");
  }
  bool candidateInApplications = isInApplicationsFolder(c.bundlePath);
  if (candidateInApplications != isInApplicationsFolder(o.bundlePath)) {
    return decide(candidateInApplications,
                  "%@: Preferring (in /Applications) app version %@ at %@ over version %@ at %@");
  }
  bool candidateOnBoot = isOnBootVolume(c.bundlePath);
  if (candidateOnBoot != isOnBootVolume(o.bundlePath)) {
    return decide(candidateOnBoot,
                  "%@: Preferring (on boot volume) app version %@ at %@ over version %@ at %@");
  }
  return decide(c.bundlePath.size() < o.bundlePath.size(),
                "%@: Preferring (shortest path) app version %@ at %@ over version %@ at %@");
}

LedgerSoftwareProductRef SoftwareMap::productForBundleIdentifier(
    std::string_view bundleIdentifier) {
  LedgerSoftwareProductRef product;
  dispatchQueue_->sync([&] {
    auto found = records_->appsByBundleID.find(bundleIdentifier);
    product = productWithIdentifierInDictionary(
        found == records_->appsByBundleID.end() ? nullptr : &found->second, bundleIdentifier);
  });
  return product;
}

LedgerSoftwareProductRef SoftwareMap::productForItemIdentifier(std::uint64_t itemIdentifier) {
  LedgerSoftwareProductRef product;
  dispatchQueue_->sync([&] {
    auto found = records_->appsByItemID.find(itemIdentifier);
    if (found == records_->appsByItemID.end()) return;
    product = productWithIdentifierInDictionary(&found->second, std::to_string(itemIdentifier));
  });
  return product;
}

SoftwareMap::ProductList SoftwareMap::allProducts() {
  ProductList products;
  dispatchQueue_->sync([&] {
    if (!records_->appsByPath) return;
    products.reserve(records_->appsByPath->size());
    for (const auto& entry : *records_->appsByPath) products.push_back(entry.second);
  });
  return products;
}

// MARK: bundles

LedgerSoftwareProductRef SoftwareMap::createSoftwareProductForAppAtPath(const std::string& path) {
  std::optional<Bundle> bundle = Bundle::open(path);
  if (!bundle) return nullptr;
  LedgerSoftwareProductFields fields;
  fields.bundlePath = path;
  fields.installed = true;
  fields.bundleIdentifier = bundle->identifier();
  if (const std::string* version = bundle->infoValue("HostBundleShortVersionString").string()) {
    fields.bundleVersion = *version;
  }
  if (std::optional<VendPurchaseRecord> record =
          VendPurchaseRecord::purchaseRecordFromBundleAtPath(path)) {
    if (!record->wareID.isNull()) fields.itemIdentifier = record->wareID.uint64Value();
    if (!record->installerVersionID.isNull()) {
      fields.versionIdentifier = record->installerVersionID.int64Value();
    }
    fields.accountOpaqueID = record->opaqueAccountIDString;
  }
  return std::make_shared<LedgerSoftwareProduct>(std::move(fields));
}

PlistDictionary SoftwareMap::bundleInfoFromBundleAtPath(const std::string& path) {
  std::optional<Bundle> bundle = Bundle::open(path);
  return bundle ? bundle->infoDictionary() : PlistDictionary{};
}

std::optional<PlistData> SoftwareMap::iconDataForApplicationWithBundleID(
    std::string_view bundleIdentifier) {
  std::optional<Bundle> bundle;
  if (LedgerSoftwareProductRef product = productForBundleIdentifier(bundleIdentifier)) {
    bundle = Bundle::open(product->bundlePath());
  }
  if (!bundle) bundle = Bundle::withIdentifier(bundleIdentifier);
  if (!bundle) return std::nullopt;
  const std::string* iconName = bundle->infoValue("HostBundleIconFile").string();
  if (!iconName) return std::nullopt;
  return bundle->resourceData(*iconName);
}

// MARK: observers

std::string SoftwareMap::addObserver(std::shared_ptr<VendSoftwareMapObserver> observer) {
  std::string token = Uuid::generateString();
  if (observer) {
    observerQueue_->sync([&] { observers_->emplace(token, std::move(observer)); });
    TILL_LOG(3, "%@: SoftwareMap added observer with token: %@", kSpeaker, token);
  }
  return token;
}

void SoftwareMap::removeObserverWithToken(const std::string& token) {
  bool removed = false;
  observerQueue_->sync([&] { removed = observers_->erase(token) > 0; });
  if (removed) {
    TILL_LOG(3, "%@: Removed SoftwareMap observer for token: %@", kSpeaker, token);
  } else {
    TILL_LOG(3, "%@: Could not find SoftwareMap observer to remove for token: %@", kSpeaker, token);
  }
}

void SoftwareMap::notifyObserversAboutProduct(const LedgerSoftwareProductRef& product,
                                              std::int64_t state) {
  TILL_LOG(3, "%@: Notifying observers of software product change: %@: %@", kSpeaker,
           stateName(state), product);
  observerQueue_->sync([&] {
    for (const auto& entry : *observers_) entry.second->softwareProductUpdatedState(product, state);
  });
}

void SoftwareMap::enqueueNotifications(Changes changes) {
  if (changes.added.empty() && changes.changed.empty() && changes.removed.empty()) return;
  dispatchQueue_->async([this, changes = std::move(changes)] {
    for (const auto& product : changes.added)
      notifyObserversAboutProduct(product, kSoftwareProductAdded);
    for (const auto& product : changes.changed) {
      notifyObserversAboutProduct(product, kSoftwareProductChanged);
    }
    for (const auto& product : changes.removed) {
      notifyObserversAboutProduct(product, kSoftwareProductRemoved);
    }
  });
}

}  // namespace larder
