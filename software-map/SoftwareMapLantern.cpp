// The two live metadata queries that keep the map current between scans.
#include <chrono>
#include <cstdlib>

#include "platform/log/TillLogManager.h"
#include "platform/metadata/MetadataAttributes.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/download/VendFileManager.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "SoftwareMap";

std::uint64_t boxedReference(const MetadataItem* item) {
  return static_cast<std::uint64_t>(reinterpret_cast<std::uintptr_t>(item));
}

std::optional<std::string> optionalString(const PlistValue& value) {
  const std::string* text = value.string();
  return text ? std::optional<std::string>(*text) : std::nullopt;
}

double leadingDouble(const std::string& text) {
  return std::strtod(text.c_str(), nullptr);
}

PlistValue describedItems(const std::vector<std::shared_ptr<const MetadataItem>>& items) {
  PlistArray paths;
  for (const auto& item : items) paths.emplace_back(item->path());
  return paths;
}

}  // namespace

// MARK: query strings

const PlistDictionary& SoftwareMap::legacyAppWhiteList() {
  static const PlistDictionary kWhiteList = [] {
    auto entry = [](std::uint64_t wareID, const char* minimumVersion) {
      return PlistValue(PlistDictionary{{"wareID", wareID}, {"minimumVersion", minimumVersion}});
    };
    return PlistDictionary{
        {"com.orvane.Snapbox", entry(400000101, "9.0")},
        {"com.orvane.ReelcutApp", entry(400000102, "9.0")},
        {"com.orvane.Anvil.Quire", entry(400000103, "4.0")},
        {"com.orvane.Anvil.Tally", entry(400000104, "2.0")},
        {"com.orvane.Anvil.Podium", entry(400000105, "5.0")},
        {"com.orvane.Darkbench", entry(400000106, "3.0")},
        {"com.orvane.Fleetdesk", entry(400000107, "1.0")},
    };
  }();
  return kWhiteList;
}

const std::string& SoftwareMap::metadataQueryStringQMT() {
  static const std::string kQuery =
      "kHostItemQuaymartHasPurchaseRecord == 1 || "
      "kHostItemHostBundleIdentifier=='com.orvane.SetupHerald*'";
  return kQuery;
}

const std::string& SoftwareMap::metadataQueryStringLegacy() {
  static const std::string kQuery = [] {
    std::string query =
        "kHostItemContentType=com.orvane.application-bundle && "
        "kHostItemQuaymartHasPurchaseRecord!=1 && kHostItemQuaymartIsDeveloperSigned!=1 && (";
    bool first = true;
    for (const auto& [bundleIdentifier, entry] : legacyAppWhiteList()) {
      if (!first) query += " || ";
      query += "kHostItemHostBundleIdentifier='" + bundleIdentifier + "'";
      first = false;
    }
    return query + ")";
  }();
  return kQuery;
}

std::vector<std::string> SoftwareMap::metadataQueryValueAttributes() {
  return {std::string(MetadataAttributes::kWareID),
          std::string(MetadataAttributes::kInstallerVersionID),
          std::string(MetadataAttributes::kBundleIdentifier),
          std::string(MetadataAttributes::kVersion),
          std::string(MetadataAttributes::kAccountReference),
          std::string(MetadataAttributes::kPurchaseDate)};
}

// MARK: starting and stopping

void SoftwareMap::initializeLantern() {
  records_->appsByMDItem.clear();
  startMetadataQueryForQMTApps();
  startMetadataQueryForLegacyApps();
}

void SoftwareMap::startMetadataQueryForQMTApps() {
  startMetadataQuery(&SoftwareMap::metadataQueryRefQMT_, metadataQueryStringQMT(),
                     "%@: Failed to start lantern query for QMT apps");
}

void SoftwareMap::startMetadataQueryForLegacyApps() {
  startMetadataQuery(&SoftwareMap::metadataQueryRefLegacy_, metadataQueryStringLegacy(),
                     "%@: Failed to start lantern query for Legacy apps");
}

void SoftwareMap::startMetadataQuery(std::shared_ptr<MetadataQuery> SoftwareMap::*handle,
                                     const std::string& queryString, std::string_view failureText) {
  metadataQueryQueue_->barrierAsync([this, handle, &queryString, failureText] {
    if (std::shared_ptr<MetadataQuery>& existing = this->*handle) {
      existing->stop();
      existing.reset();
    }
    auto query = MetadataQuery::create(queryString, metadataQueryValueAttributes());
    metadataQueryStartDate_ = std::chrono::steady_clock::now();
    query->setQueue(metadataQueryQueue_);
    query->setSearchScope(MetadataQuery::SearchScope::Computer);
    query->setHandlers({
        [this](MetadataQuery& finished) { queryDidFinish(finished); },
        [this](MetadataQuery& updated, const MetadataQueryUpdate& update) {
          queryDidUpdateWithUserInfo(updated, update);
        },
        [this](MetadataQuery&) { mdServerPortInvalid(); },
    });
    if (!query->start()) {
      TILL_LOG(1, failureText, kSpeaker);
      return;
    }
    this->*handle = std::move(query);
  });
}

void SoftwareMap::stopMetadataQueries() {
  metadataQueryQueue_->sync([this] {
    for (auto* handle : {&metadataQueryRefQMT_, &metadataQueryRefLegacy_}) {
      if (*handle) (*handle)->stop();
      handle->reset();
    }
  });
}

void SoftwareMap::simulateMetadataQueryOverflowForTesting() {
  metadataQueryQueue_->sync([this] {
    for (const auto& query : {metadataQueryRefQMT_, metadataQueryRefLegacy_}) {
      if (query) query->simulateQueueOverflowForTesting();
    }
  });
}

void SoftwareMap::mdServerPortInvalid() {
  TILL_LOG(1, "%@: Received serverPortInvalid from MetadataQuery. Reinitializing.", kSpeaker);
  dispatchQueue_->barrierAsync([this] { initializeLantern(); });
}

// MARK: records from items

void SoftwareMap::updateApplicationWithMDItem(LedgerSoftwareProduct& product,
                                              const MetadataItemRef& item,
                                              const MetadataQuery& query) const {
  std::optional<std::size_t> index = query.indexOfResult(item.get());
  auto value = [&](std::string_view attribute) {
    return index ? query.valueOfAttribute(attribute, *index)
                 : MetadataQuery::attributeOfItem(*item, attribute);
  };
  PlistValue wareID = value(MetadataAttributes::kWareID);
  PlistValue installerVersionID = value(MetadataAttributes::kInstallerVersionID);
  PlistValue purchaseDate = value(MetadataAttributes::kPurchaseDate);
  std::string path = item->path();
  product.update([&](LedgerSoftwareProductFields& fields) {
    fields.itemIdentifier.reset();
    if (wareID.isNumber()) fields.itemIdentifier = static_cast<std::uint64_t>(wareID.doubleValue());
    fields.versionIdentifier.reset();
    if (installerVersionID.isNumber() && installerVersionID.int64Value() >= 1) {
      fields.versionIdentifier = installerVersionID.int64Value();
    }
    fields.bundleIdentifier = optionalString(value(MetadataAttributes::kBundleIdentifier));
    fields.bundleVersion = optionalString(value(MetadataAttributes::kVersion));
    fields.accountOpaqueID = optionalString(value(MetadataAttributes::kAccountReference));
    fields.purchaseDate.reset();
    if (const PlistDate* date = purchaseDate.date()) fields.purchaseDate = *date;
    fields.bundlePath = path;
    fields.mdItemRef = boxedReference(item.get());
    fields.installed = true;
    fields.source = LedgerSoftwareProduct::kSourceMetadataQuery;
  });
}

LedgerSoftwareProductRef SoftwareMap::applicationFromMDItem(const MetadataItemRef& item) const {
  auto product = std::make_shared<LedgerSoftwareProduct>();
  if (metadataQueryRefQMT_) updateApplicationWithMDItem(*product, item, *metadataQueryRefQMT_);
  return product;
}

LedgerSoftwareProductRef SoftwareMap::legacyApplicationFromMDItem(
    const MetadataItemRef& item) const {
  auto product = std::make_shared<LedgerSoftwareProduct>();
  if (metadataQueryRefLegacy_) {
    updateApplicationWithMDItem(*product, item, *metadataQueryRefLegacy_);
  }
  product->update([](LedgerSoftwareProductFields& fields) {
    fields.isLegacyApp = true;
    fields.source = LedgerSoftwareProduct::kSourceLegacyQuery;
    if (!fields.bundleIdentifier) return;
    auto entry = legacyAppWhiteList().find(*fields.bundleIdentifier);
    if (entry == legacyAppWhiteList().end()) return;
    fields.itemIdentifier = entry->second["wareID"].uint64Value();
    fields.versionIdentifier = 0;
  });
  return legacyApplicationSatifiesMinimumVersionRequirement(*product) ? product : nullptr;
}

bool SoftwareMap::legacyApplicationSatifiesMinimumVersionRequirement(
    const LedgerSoftwareProduct& product) {
  return product.read([](const LedgerSoftwareProductFields& fields) {
    if (!fields.bundleIdentifier) return false;
    auto entry = legacyAppWhiteList().find(*fields.bundleIdentifier);
    if (entry == legacyAppWhiteList().end()) return false;
    const std::string* minimum = entry->second["minimumVersion"].string();
    return minimum && leadingDouble(fields.bundleVersion.value_or("")) >= leadingDouble(*minimum);
  });
}

SoftwareMap::MappedApplications SoftwareMap::mappedApplicationsForUpdateArray(
    const std::vector<MetadataItemRef>& items, bool isLegacy) const {
  MappedApplications mapped;
  for (const MetadataItemRef& item : items) {
    LedgerSoftwareProductRef product =
        isLegacy ? legacyApplicationFromMDItem(item) : applicationFromMDItem(item);
    if (product && !product->bundlePath().empty()) mapped.emplace_back(item, std::move(product));
  }
  return mapped;
}

// MARK: events

void SoftwareMap::queryDidFinish(MetadataQuery& query) {
  bool isQMT = &query == metadataQueryRefQMT_.get();
  if (!isQMT && &query != metadataQueryRefLegacy_.get()) return;
  std::vector<MetadataItemRef> items;
  for (std::size_t index = 0; index < query.resultCount(); ++index) {
    if (MetadataItemRef item = query.resultAtIndex(index)) items.push_back(std::move(item));
  }
  MappedApplications results = mappedApplicationsForUpdateArray(items, !isQMT);
  dispatchQueue_->barrierAsync(
      [this, results = std::move(results)] { mergeFirstResults(results, results.size()); });
}

void SoftwareMap::rememberItem(const MetadataItemRef& item,
                               const LedgerSoftwareProductRef& product) {
  product->update(
      [&](LedgerSoftwareProductFields& fields) { fields.mdItemRef = boxedReference(item.get()); });
  records_->appsByMDItem[item.get()] = MappedItem{item, product};
}

void SoftwareMap::mergeFirstResults(const MappedApplications& results, std::size_t resultCount) {
  if (!records_->appsByPath) records_->appsByPath.emplace();
  Changes changed;
  Changes added;
  for (const auto& [item, fresh] : results) {
    LedgerSoftwareProductRef existing = productAtPath(fresh->bundlePath());
    if (existing) {
      bool didChange = false;
      updateAppWithApp(*existing, *fresh, &didChange);
      if (didChange) {
        changed.changed.push_back(existing);
        TILL_LOG(1,
                 "%@: Warning: Product from Lantern query does not match existing product. New: "
                 "%@ -- Old: %@",
                 kSpeaker, existing, fresh);
      }
      rememberItem(item, existing);
      TILL_LOG(3, "%@: setMDItemRef: %@ for product: %@", kSpeaker, boxedReference(item.get()),
               existing);
    } else if (VendFileManager::isUpdatableAtPath(fresh->bundlePath())) {
      TILL_LOG(1, "%@: Warning: Lantern query found an app that App Registry did not: %@", kSpeaker,
               fresh);
      added.added.push_back(fresh);
      records_->appsByPath->emplace(fresh->bundlePath(), fresh);
      rememberItem(item, fresh);
    }
  }
  bool anyChange = !changed.changed.empty() || !added.added.empty();
  enqueueNotifications(std::move(changed));
  enqueueNotifications(std::move(added));
  if (anyChange) {
    rebuildSecondaryMaps();
    writePersistedStoreToDisk();
  }
  TILL_LOG(3, "%@: MetadataQuery initial load took %f seconds to process %lu apps", kSpeaker,
           std::chrono::duration<double>(std::chrono::steady_clock::now() - metadataQueryStartDate_)
               .count(),
           resultCount);
}

void SoftwareMap::queryDidUpdateWithUserInfo(MetadataQuery& query,
                                             const MetadataQueryUpdate& update) {
  PlistValue described(PlistDictionary{{"added", describedItems(update.added)},
                                       {"changed", describedItems(update.changed)},
                                       {"removed", describedItems(update.removed)}});
  TILL_LOG(3, "%@: Query did update: %@", kSpeaker, described);
  bool isLegacy = &query == metadataQueryRefLegacy_.get();
  if (!isLegacy && &query != metadataQueryRefQMT_.get()) {
    TILL_LOG(1, "%@: Error: Received MetadataQuery update from unknown instance: %@ : %@", kSpeaker,
             query.queryString(), described);
    return;
  }
  MappedApplications added = mappedApplicationsForUpdateArray(update.added, isLegacy);
  MappedApplications changed = mappedApplicationsForUpdateArray(update.changed, isLegacy);
  dispatchQueue_->barrierAsync(
      [this, added = std::move(added), changed = std::move(changed), removed = update.removed] {
        mergeUpdate(added, changed, removed);
      });
}

void SoftwareMap::mergeUpdate(const MappedApplications& added, const MappedApplications& changed,
                              const std::vector<MetadataItemRef>& removed) {
  if (!records_->appsByPath) records_->appsByPath.emplace();
  Changes changes;
  for (const MetadataItemRef& item : removed) {
    auto found = records_->appsByMDItem.find(item.get());
    if (found == records_->appsByMDItem.end()) {
      TILL_LOG(1,
               "%@: Warning: Could not find reference to app reported as removed in "
               "MetadataQuery update: %@",
               kSpeaker, item->path());
      continue;
    }
    LedgerSoftwareProductRef existing = found->second.product;
    if (existing->snapshot().metadataChangeIsExpected) {
      TILL_LOG(3,
               "%@: App reported as removed in MetadataQuery update, but ignoring because it is "
               "being updated: %@",
               kSpeaker, existing);
    } else {
      // Observers get the record itself: it must say that it is no longer there.
      existing->update([](LedgerSoftwareProductFields& fields) { fields.installed = false; });
      changes.removed.push_back(existing);
      records_->appsByPath->erase(existing->bundlePath());
    }
    records_->appsByMDItem.erase(found);
  }
  for (const auto& [item, fresh] : added) {
    std::string path = fresh->bundlePath();
    LedgerSoftwareProductRef existing = productAtPath(path);
    if (existing) {
      std::optional<std::uint64_t> expected = existing->itemIdentifier();
      if (expected && fresh->itemIdentifier() != expected) {
        TILL_LOG(1,
                 "%@: Warning: App already exists at path %@ but does not match the item "
                 "identifier we were expecting (%@ vs %@)",
                 kSpeaker, path, fresh->itemIdentifier(), expected);
        continue;
      }
      existing->update(
          [](LedgerSoftwareProductFields& fields) { fields.metadataChangeIsExpected = false; });
      rememberItem(item, existing);
    } else if (!VendFileManager::isUpdatableAtPath(path)) {
      TILL_LOG(
          1,
          "%@: Ignoring app that MetadataQuery reported as added, because it is not updatable: %@",
          kSpeaker, fresh);
    } else {
      TILL_LOG(1, "%@: Lantern detected added app: %@", kSpeaker, fresh);
      changes.added.push_back(fresh);
      records_->appsByPath->emplace(path, fresh);
      rememberItem(item, fresh);
    }
  }
  for (const auto& [item, fresh] : changed) {
    auto found = records_->appsByMDItem.find(item.get());
    if (found == records_->appsByMDItem.end()) {
      TILL_LOG(
          1, "%@: Error: Lantern reported a change to an app that isn't in our data structures: %@",
          kSpeaker, fresh);
      continue;
    }
    std::string newPath = fresh->bundlePath();
    if (newPath.empty() || !VendFileManager::isUpdatableAtPath(newPath)) continue;
    LedgerSoftwareProductRef existing = found->second.product;
    if (std::string oldPath = existing->bundlePath(); oldPath != newPath) {
      records_->appsByPath->erase(oldPath);
      records_->appsByPath->insert_or_assign(newPath, existing);
    }
    bool didChange = false;
    updateAppWithApp(*existing, *fresh, &didChange);
    if (didChange) {
      TILL_LOG(1, "%@: Lantern detected changed app: %@", kSpeaker, existing);
      changes.changed.push_back(existing);
    }
  }
  if (!changes.added.empty() || !changes.changed.empty() || !changes.removed.empty()) {
    rebuildSecondaryMaps();
    writePersistedStoreToDisk();
  }
  enqueueNotifications(std::move(changes));
}

}  // namespace larder
