// The update request body, and the questions that the software map answers
// with a look at the disk: which bundle an incoming version replaces and
// whether a pushed install may go ahead.
#include <charconv>
#include <unordered_set>

#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/ApplicationRegistry.h"
#include "platform/system/Environment.h"
#include "platform/system/FileIO.h"
#include "platform/system/Mutex.h"
#include "software-map/SoftwareMap.h"
#include "store-runtime/download/VendFileManager.h"
#include "store-runtime/http/VendGzip.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "SoftwareMap";

constexpr std::string_view kLocalSoftwareKey = "local-software";
constexpr std::string_view kBundledSoftwareKey = "bundled-software";
constexpr std::string_view kWareIDKey = "ware-id";
constexpr std::string_view kInstalledVersionKey = "installed-version-identifier";
constexpr std::string_view kBundleIdentifierKey = "HostBundleIdentifier";
constexpr std::string_view kBundleVersionKey = "HostBundleShortVersionString";
constexpr std::string_view kRequestBodySideFile = "UpdateQueueRequstBody";

constexpr std::string_view kManifestPath = "/var/db/.QMTManifest";
// The manifest lists what came with the machine: a few hundred rows at
// most. Anything far larger is not a manifest.
constexpr std::size_t kMaxManifestBytes = 8u << 20u;

// MARK: XML

// The body's XML is written here rather than through a property-list tree:
// with ten thousand installed products the tree and the general writer cost
// several times the rest of the request. The layout is the general writer's,
// so the two give the same bytes for the same dictionary.
class XmlBodyWriter {
 public:
  explicit XmlBodyWriter(std::size_t expectedBytes) {
    xml_.reserve(expectedBytes);
    xml_ += "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n";
  }

  std::string finish() && {
    xml_ += "</plist>\n";
    return std::move(xml_);
  }

  void openContainer(std::string_view tag, int depth) {
    indent(depth);
    xml_ += '<';
    xml_ += tag;
    xml_ += ">\n";
  }
  void closeContainer(std::string_view tag, int depth) {
    indent(depth);
    xml_ += "</";
    xml_ += tag;
    xml_ += ">\n";
  }
  void emptyContainer(std::string_view tag, int depth) {
    indent(depth);
    xml_ += '<';
    xml_ += tag;
    xml_ += "/>\n";
  }

  void key(std::string_view text, int depth) { element("key", text, depth); }
  void string(std::string_view text, int depth) { element("string", text, depth); }
  template <typename Integer>
  void integer(Integer value, int depth) {
    char digits[24];
    auto [end, error] = std::to_chars(std::begin(digits), std::end(digits), value);
    indent(depth);
    xml_ += "<integer>";
    xml_.append(digits, end);
    xml_ += "</integer>\n";
  }

 private:
  void indent(int depth) { xml_.append(static_cast<std::size_t>(depth), '\t'); }

  void element(std::string_view tag, std::string_view text, int depth) {
    indent(depth);
    xml_ += '<';
    xml_ += tag;
    xml_ += '>';
    appendEscaped(text);
    xml_ += "</";
    xml_ += tag;
    xml_ += ">\n";
  }

  // Only the three characters that markup needs are replaced; everything
  // else, control characters included, goes as it is, as the general
  // writer does.
  void appendEscaped(std::string_view text) {
    std::size_t runStart = 0;
    for (std::size_t i = 0; i < text.size(); ++i) {
      std::string_view entity;
      switch (text[i]) {
        case '&':
          entity = "&amp;";
          break;
        case '<':
          entity = "&lt;";
          break;
        case '>':
          entity = "&gt;";
          break;
        default:
          continue;
      }
      xml_.append(text.substr(runStart, i - runStart));
      xml_ += entity;
      runStart = i + 1;
    }
    xml_.append(text.substr(runStart));
  }

  std::string xml_;
};

// MARK: bundled manifest

// The manifest's rows, held for the life of the process once a usable file
// has been read. The lock is held through the read, so a thread that comes
// while another reads waits for the whole list.
struct HeldBundledManifest {
  Mutex mutex;
  std::shared_ptr<const PlistArray> rows GUARDED_BY(mutex);
};

HeldBundledManifest& heldBundledManifest() {
  static HeldBundledManifest held;
  return held;
}

// The rows of the manifest file; nullptr when there is no usable file, so
// that the next request tries again.
std::shared_ptr<const PlistArray> readBundledManifestRows() {
  std::string path = Environment::rootedPath(kManifestPath);
  Result<PlistData> bytes = FileIO::read(path, kMaxManifestBytes);
  if (!bytes) {
    // Most machines have none.
    TILL_LOG(3, "%@: No bundled applications manifest at %@ (%@)", kSpeaker, path,
             bytes.error().description);
    return nullptr;
  }
  PlistReadLimits limits;
  limits.maxBytes = kMaxManifestBytes;
  Result<PlistValue> root = PropertyListSerialization::read(*bytes, limits);
  if (!root) {
    TILL_LOG(1, "%@: Could not read the bundled applications manifest at %@: %@", kSpeaker, path,
             root.error().description);
    return nullptr;
  }
  PlistArray* rows = root->array();
  if (!rows) {
    TILL_LOG(1, "%@: Bundled applications manifest at %@ is not a list, ignoring it", kSpeaker,
             path);
    return nullptr;
  }
  PlistArray kept;
  kept.reserve(rows->size());
  for (std::size_t index = 0; index < rows->size(); ++index) {
    if (!(*rows)[index].isDictionary()) {
      TILL_LOG(1, "%@: Bundled applications manifest row %ld is not a dictionary, skipping it",
               kSpeaker, index);
      continue;
    }
    kept.push_back(std::move((*rows)[index]));
  }
  TILL_LOG(2, "%@: Read %ld bundled applications from %@", kSpeaker, kept.size(), path);
  return std::make_shared<const PlistArray>(std::move(kept));
}

std::shared_ptr<const PlistArray> bundledManifestRows() {
  HeldBundledManifest& held = heldBundledManifest();
  MutexLock lock(held.mutex);
  if (!held.rows) held.rows = readBundledManifestRows();
  return held.rows;
}

std::optional<std::string> stringValue(const PlistValue& value) {
  const std::string* text = value.string();
  return text ? std::optional<std::string>(*text) : std::nullopt;
}

// The body as it goes out: gzip when asked and possible, else the XML.
PlistData bodyDataCompressedIfWanted(const std::string& xml, bool shouldCompress,
                                     bool* compressed) {
  std::span<const std::uint8_t> bytes(reinterpret_cast<const std::uint8_t*>(xml.data()),
                                      xml.size());
  std::optional<PlistData> zipped;
  if (shouldCompress) {
    zipped = VendCopyGzippedDataForData(bytes);
    if (zipped) {
      TILL_LOG(2, "%@: Compressed the request body", kSpeaker);
    } else {
      TILL_LOG(1, "%@: Could not zip request body, sending unzipped", kSpeaker);
    }
  }
  if (compressed) *compressed = zipped.has_value();
  return zipped ? std::move(*zipped) : PlistData(bytes.begin(), bytes.end());
}

}  // namespace

// MARK: software entries

// One entry of the body. A field without value is left out of the entry.
struct SoftwareMap::SoftwareEntry {
  // Text for installed software; the manifest's own value, string or
  // integer, for bundled software.
  PlistValue wareID;
  std::optional<std::int64_t> installedVersionIdentifier;
  std::optional<std::string> bundleIdentifier;
  std::optional<std::string> bundleVersion;

  static SoftwareEntry fromProduct(const LedgerSoftwareProductFields& fields) {
    SoftwareEntry entry;
    if (fields.itemIdentifier) entry.wareID = std::to_string(*fields.itemIdentifier);
    entry.installedVersionIdentifier = fields.versionIdentifier;
    entry.bundleIdentifier = fields.bundleIdentifier;
    entry.bundleVersion = fields.bundleVersion;
    return entry;
  }

  // Values of a type that the store would not understand are left out.
  static SoftwareEntry fromManifestRow(const PlistValue& row) {
    SoftwareEntry entry;
    const PlistValue& wareID = row["wareID"];
    if (wareID.isString() || wareID.isInteger()) entry.wareID = wareID;
    const PlistValue& installerVersionID = row["installerVersionID"];
    if (installerVersionID.isNumber() || installerVersionID.isString()) {
      entry.installedVersionIdentifier = installerVersionID.int64Value();
    }
    entry.bundleIdentifier = stringValue(row["bundleID"]);
    entry.bundleVersion = stringValue(row["version"]);
    return entry;
  }

  [[nodiscard]] bool isEmpty() const {
    return wareID.isNull() && !installedVersionIdentifier && !bundleIdentifier && !bundleVersion;
  }

  // Keys in the order of their bytes, as in any property-list dictionary.
  void writeXml(XmlBodyWriter& writer, int depth) const {
    if (isEmpty()) {
      writer.emptyContainer("dict", depth);
      return;
    }
    writer.openContainer("dict", depth);
    if (bundleIdentifier) {
      writer.key(kBundleIdentifierKey, depth + 1);
      writer.string(*bundleIdentifier, depth + 1);
    }
    if (bundleVersion) {
      writer.key(kBundleVersionKey, depth + 1);
      writer.string(*bundleVersion, depth + 1);
    }
    if (installedVersionIdentifier) {
      writer.key(kInstalledVersionKey, depth + 1);
      writer.integer(*installedVersionIdentifier, depth + 1);
    }
    writeWareID(writer, depth + 1);
    writer.closeContainer("dict", depth);
  }

  [[nodiscard]] PlistDictionary toDictionary() const {
    PlistDictionary dictionary;
    if (!wareID.isNull()) dictionary.emplace(kWareIDKey, wareID);
    if (installedVersionIdentifier) {
      dictionary.emplace(kInstalledVersionKey, *installedVersionIdentifier);
    }
    if (bundleIdentifier) dictionary.emplace(kBundleIdentifierKey, *bundleIdentifier);
    if (bundleVersion) dictionary.emplace(kBundleVersionKey, *bundleVersion);
    return dictionary;
  }

  // The root dictionary with the lists that were made; keys sorted, as in
  // any property-list dictionary.
  static std::string bodyXml(const std::optional<SoftwareEntries>& local,
                             const std::optional<SoftwareEntries>& bundled) {
    std::size_t count = (local ? local->size() : 0) + (bundled ? bundled->size() : 0);
    XmlBodyWriter writer(kExpectedHeaderBytes + count * kExpectedXmlBytes);
    if (!local && !bundled) {
      writer.emptyContainer("dict", 0);
      return std::move(writer).finish();
    }
    writer.openContainer("dict", 0);
    if (bundled) writeListXml(writer, kBundledSoftwareKey, *bundled);
    if (local) writeListXml(writer, kLocalSoftwareKey, *local);
    writer.closeContainer("dict", 0);
    return std::move(writer).finish();
  }

  static PlistDictionary bodyDictionary(const std::optional<SoftwareEntries>& local,
                                        const std::optional<SoftwareEntries>& bundled) {
    PlistDictionary body;
    if (local) body.emplace(kLocalSoftwareKey, listDictionaries(*local));
    if (bundled) body.emplace(kBundledSoftwareKey, listDictionaries(*bundled));
    return body;
  }

 private:
  // One list of the body, under `key` of the root dictionary.
  static void writeListXml(XmlBodyWriter& writer, std::string_view key,
                           const SoftwareEntries& entries) {
    writer.key(key, 1);
    if (entries.empty()) {
      writer.emptyContainer("array", 1);
      return;
    }
    writer.openContainer("array", 1);
    for (const SoftwareEntry& entry : entries) entry.writeXml(writer, 2);
    writer.closeContainer("array", 1);
  }

  static PlistArray listDictionaries(const SoftwareEntries& entries) {
    PlistArray described;
    described.reserve(entries.size());
    for (const SoftwareEntry& entry : entries) described.emplace_back(entry.toDictionary());
    return described;
  }

  // Generous guesses of the body's size, so that the buffer is sized once.
  static constexpr std::size_t kExpectedHeaderBytes = 256;
  static constexpr std::size_t kExpectedXmlBytes = 320;

  void writeWareID(XmlBodyWriter& writer, int depth) const {
    if (wareID.isNull()) return;
    writer.key(kWareIDKey, depth);
    if (const std::string* text = wareID.string()) {
      writer.string(*text, depth);
    } else if (wareID.type() == PlistValue::Type::UnsignedInteger) {
      writer.integer(wareID.uint64Value(), depth);
    } else {
      writer.integer(wareID.int64Value(), depth);
    }
  }
};

// MARK: body

SoftwareMap::SoftwareEntries SoftwareMap::copyApplicationDictionariesForUpdateSkipping(
    const std::vector<std::string>& skipList) {
  std::unordered_set<std::string_view> skipped(skipList.begin(), skipList.end());
  SoftwareEntries entries;
  dispatchQueue_->sync([&] {
    entries.reserve(records_->appsByItemID.size());
    for (const auto& [itemIdentifier, copies] : records_->appsByItemID) {
      // Of several copies of one application only the preferred one is
      // offered for update.
      LedgerSoftwareProductRef product =
          productWithIdentifierInDictionary(&copies, std::to_string(itemIdentifier));
      if (!product) continue;
      product->read([&](const LedgerSoftwareProductFields& fields) {
        if (!skipped.empty()) {
          if (fields.itemIdentifier && skipped.contains(std::to_string(*fields.itemIdentifier))) {
            return;
          }
          if (fields.bundleIdentifier && skipped.contains(*fields.bundleIdentifier)) return;
        }
        entries.push_back(SoftwareEntry::fromProduct(fields));
      });
    }
  });
  return entries;
}

SoftwareMap::SoftwareEntries SoftwareMap::bundledApplicationsListConditional(
    bool /*conditionally*/) {
  // The request's condition does not change the list: the store decides
  // what to make of it.
  SoftwareEntries entries;
  std::shared_ptr<const PlistArray> rows = bundledManifestRows();
  if (!rows) return entries;
  entries.reserve(rows->size());
  for (const PlistValue& row : *rows) entries.push_back(SoftwareEntry::fromManifestRow(row));
  return entries;
}

void SoftwareMap::resetBundledManifestForTesting() {
  HeldBundledManifest& held = heldBundledManifest();
  MutexLock lock(held.mutex);
  held.rows.reset();
}

std::optional<PlistData> SoftwareMap::updateRequestBodyData(
    bool* compressed, bool includeInstalledApps, bool includeBundledApps, bool conditionally,
    bool* hadBundledApps, bool shouldCompress, const std::vector<std::string>& skipList) {
  std::optional<SoftwareEntries> local;
  std::optional<SoftwareEntries> bundled;
  if (includeInstalledApps) local = copyApplicationDictionariesForUpdateSkipping(skipList);
  if (includeBundledApps || conditionally) {
    bundled = bundledApplicationsListConditional(conditionally);
    if (hadBundledApps) *hadBundledApps = !bundled->empty();
  }

  TILL_LOG(2, "%@: installed: %d; bundled: %d; conditional: %d", kSpeaker, includeInstalledApps,
           includeBundledApps, conditionally);
  TILL_LOG_PLIST(3, SoftwareEntry::bodyDictionary(local, bundled), kRequestBodySideFile);
  return bodyDataCompressedIfWanted(SoftwareEntry::bodyXml(local, bundled), shouldCompress,
                                    compressed);
}

// MARK: path to upgrade and pushed installs

std::optional<std::string> SoftwareMap::productPathToUpgradeForBundleIdentifier(
    std::string_view bundleIdentifier, std::string_view versionNumber) {
  if (LedgerSoftwareProductRef product = productForBundleIdentifier(bundleIdentifier)) {
    // The map's copy is the one to replace, whatever version comes.
    std::string path = product->bundlePath();
    if (VendFileManager::isUpdatableAtPath(path)) {
      TILL_LOG(1, "%@: Found app at %@ using SoftwareMap to upgrade to %@", kSpeaker, path,
               versionNumber);
      return path;
    }
    TILL_LOG(1,
             "%@: Found app at %@ using SoftwareMap but it is not upgradable, "
             "productPathToUpgradeForBundleIdentifier:versionNumber will return nil",
             kSpeaker, path);
    return std::nullopt;
  }

  std::optional<std::string> path = ApplicationRegistry::pathForBundleIdentifier(bundleIdentifier);
  if (path && !path->empty()) {
    if (VendFileManager::isQuaymartAppAtPath(*path) && VendFileManager::isUpdatableAtPath(*path)) {
      // Not in the map yet: only a newer version may replace it.
      PlistDictionary info = bundleInfoFromBundleAtPath(*path);
      auto version = info.find(kBundleVersionKey);
      const std::string* installed = version == info.end() ? nullptr : version->second.string();
      if (installed && !installed->empty() &&
          compareVersionStrings(versionNumber, *installed) > 0) {
        TILL_LOG(1, "%@: Found app at %@ with bundle ID %@ using AppRegistry to upgrade to %@",
                 kSpeaker, *path, bundleIdentifier, versionNumber);
        return path;
      }
    } else {
      TILL_LOG(3, "%@: isQuaymartAppAtPath or isUpdatableAtPath failed for app at %@", kSpeaker,
               *path);
    }
  }
  TILL_LOG(1, "%@: No app was found with bundle ID %@ to upgrade to %@", kSpeaker, bundleIdentifier,
           versionNumber);
  return std::nullopt;
}

bool SoftwareMap::shouldAllowAutoPushForBundleID(std::string_view bundleID,
                                                 std::string_view bundleVersion) {
  auto isInstallableStoreApp = [](const std::string& path) {
    return VendFileManager::isQuaymartAppAtPath(path) && VendFileManager::isInstallableAtPath(path);
  };
  std::optional<std::string> path =
      productPathToUpgradeForBundleIdentifier(bundleID, bundleVersion);
  if (path && isInstallableStoreApp(*path)) return true;
  // A store copy that this version cannot replace stands in the way.
  for (const LedgerSoftwareProductRef& product : allProducts()) {
    if (product->bundleIdentifier() != bundleID) continue;
    if (isInstallableStoreApp(product->bundlePath())) return false;
  }
  return true;
}

}  // namespace larder
