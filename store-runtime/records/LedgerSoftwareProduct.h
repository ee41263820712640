#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"

namespace larder {

// Values of one piece of installed store software. Absent optional fields
// are absent in every form: archive, wire and description.
struct LedgerSoftwareProductFields {
  std::string bundlePath;
  std::optional<std::string> bundleIdentifier;
  std::optional<std::string> bundleVersion;
  std::optional<std::uint64_t> itemIdentifier;
  std::optional<std::int64_t> versionIdentifier;
  std::optional<std::string> accountOpaqueID;
  std::optional<PlistDate> purchaseDate;
  bool installed = false;
  std::int64_t source = 0;
  bool isLegacyApp = false;
  // Handle of the metadata query's item; 0 for none. Meaningful only while
  // the query lives, so it is neither archived nor sent to clients.
  std::uint64_t mdItemRef = 0;
  bool metadataChangeIsExpected = false;
  std::optional<std::string> expectedBundleVersion;
  std::optional<std::int64_t> expectedStoreVersion;

  friend bool operator==(const LedgerSoftwareProductFields&,
                         const LedgerSoftwareProductFields&) = default;
};

// The shared, mutable record of one product. Every map of the software map
// holds the same object, so an update is seen everywhere at once; the
// record's own lock keeps a reader on another thread from seeing a torn
// update.
class LedgerSoftwareProduct {
 public:
  static constexpr std::string_view kClassName = "LedgerSoftwareProduct";

  enum Source : std::int64_t {
    kSourceMetadataQuery = 2,
    kSourceLegacyQuery = 3,
    kSourceRegistryOrPurchaseRecord = 4,
  };

  LedgerSoftwareProduct() = default;
  explicit LedgerSoftwareProduct(LedgerSoftwareProductFields fields) : fields_(std::move(fields)) {}

  [[nodiscard]] LedgerSoftwareProductFields snapshot() const;
  // Reads under the record's lock without copying every field.
  template <typename Reader>
  auto read(Reader&& reader) const {
    MutexLock lock(mutex_);
    return reader(static_cast<const LedgerSoftwareProductFields&>(fields_));
  }
  void update(const std::function<void(LedgerSoftwareProductFields&)>& change);

  [[nodiscard]] std::string bundlePath() const;
  [[nodiscard]] std::optional<std::string> bundleIdentifier() const;
  [[nodiscard]] std::optional<std::string> bundleVersion() const;
  [[nodiscard]] std::optional<std::uint64_t> itemIdentifier() const;

  // Keyed-archive form: a record dictionary with "$class".
  [[nodiscard]] PlistDictionary encodeWithCoder() const;
  // nullptr when the archived record lacks a path or a field has a wrong type.
  static std::shared_ptr<LedgerSoftwareProduct> initWithCoder(const PlistValue& encoded);

  // Wire form: the field names as keys; absent fields are left out.
  [[nodiscard]] PlistDictionary toDictionary() const;
  static LedgerSoftwareProductFields fieldsFromDictionary(const PlistDictionary& dictionary);

  [[nodiscard]] std::string description() const;

 private:
  mutable Mutex mutex_;
  LedgerSoftwareProductFields fields_ GUARDED_BY(mutex_);
};

using LedgerSoftwareProductRef = std::shared_ptr<LedgerSoftwareProduct>;

}  // namespace larder
