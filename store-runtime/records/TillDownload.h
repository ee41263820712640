#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/records/TillDownloadAsset.h"
#include "store-runtime/records/TillDownloadMetadata.h"

namespace larder {

// Where a download stands, as its callers see it.
struct TillDownloadStatus {
  bool isPaused = false;
  bool isFailed = false;

  friend bool operator==(const TillDownloadStatus&, const TillDownloadStatus&) = default;
};

struct TillDownloadFields {
  TillDownloadMetadata metadata;
  std::vector<TillDownloadAsset> assets;
  std::int64_t downloadType = 1;
  std::optional<std::string> relaunchAppWithBundleURL;
  bool skipAssetDownloadIfNotAlreadyOnDisk = false;
  TillDownloadStatus status;
  // Share of the assets' bytes on disk and checked, 0 to 1.
  double progress = 0;
  // Where an install put the bundle, once it has: the truth of an ended
  // install, which a look-up by identifier is not while an older copy stays.
  std::optional<std::string> installedPath;

  friend bool operator==(const TillDownloadFields&, const TillDownloadFields&) = default;
};

// One download for the download layer. Callers keep it while the layer
// works on it and change it between runs (a staged download becomes an
// install), and the layer's replies arrive on its own threads, so the
// record guards its fields with its own lock.
class TillDownload {
 public:
  static constexpr std::string_view kClassName = "TillDownload";

  // Bits of `downloadType`.
  enum DownloadType : std::int64_t {
    kInstall = 1,
    kStageOnly = 2,
  };

  TillDownload() = default;
  explicit TillDownload(TillDownloadFields fields) : fields_(std::move(fields)) {}
  static std::shared_ptr<TillDownload> initWithAssets(std::vector<TillDownloadAsset> assets,
                                                      TillDownloadMetadata metadata);

  [[nodiscard]] TillDownloadFields snapshot() const;
  void update(const std::function<void(TillDownloadFields&)>& change);

  [[nodiscard]] TillDownloadMetadata metadata() const;
  void setMetadata(TillDownloadMetadata metadata);
  [[nodiscard]] std::vector<TillDownloadAsset> assets() const;
  void setAssets(std::vector<TillDownloadAsset> assets);
  [[nodiscard]] std::int64_t downloadType() const;
  void setDownloadType(std::int64_t type);
  [[nodiscard]] std::optional<std::string> relaunchAppWithBundleURL() const;
  void setRelaunchAppWithBundleURL(std::optional<std::string> url);
  [[nodiscard]] bool skipAssetDownloadIfNotAlreadyOnDisk() const;
  void setSkipAssetDownloadIfNotAlreadyOnDisk(bool value);
  [[nodiscard]] TillDownloadStatus status() const;
  void setStatus(TillDownloadStatus status);
  [[nodiscard]] double progress() const;
  void setProgress(double fraction);
  [[nodiscard]] std::optional<std::string> installedPath() const;

  // Keyed-archive form: "$class", the metadata and assets as records of
  // their own, and the local fields.
  [[nodiscard]] PlistDictionary encodeWithCoder() const;
  // nullptr when a class is not ours or a field has the wrong type.
  static std::shared_ptr<TillDownload> initWithCoder(const PlistValue& encoded);

  // Wire form: the store's download dictionary, { "metadata": {...},
  // "assets": [...] }, plus the local fields "downloadType",
  // "relaunchAppWithBundleURL", "skipAssetDownloadIfNotAlreadyOnDisk",
  // "status" { "isPaused", "isFailed" }, "progress" and "installedPath".
  [[nodiscard]] PlistDictionary toDictionary() const;
  // nullptr for a malformed download: a field of the wrong type, no
  // metadata, no assets, or an asset whose sizes and digests do not fit.
  static std::shared_ptr<TillDownload> fromDictionary(const PlistDictionary& dictionary);

  [[nodiscard]] std::string description() const;

 private:
  // One field read or written under the record's lock.
  template <typename Value>
  Value field(Value TillDownloadFields::*member) const {
    MutexLock lock(mutex_);
    return fields_.*member;
  }
  template <typename Value, typename Given>
  void setField(Value TillDownloadFields::*member, Given&& value) {
    MutexLock lock(mutex_);
    fields_.*member = std::forward<Given>(value);
  }

  mutable Mutex mutex_;
  TillDownloadFields fields_ GUARDED_BY(mutex_);
};

using TillDownloadRef = std::shared_ptr<TillDownload>;

}  // namespace larder
