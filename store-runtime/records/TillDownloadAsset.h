#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/PlistValue.h"
#include "store-runtime/http/VendURLRequest.h"

namespace larder {

// One file of a download and what it is checked against: the file is cut
// into chunks of `numberOfBytesToHash` bytes (the last may be shorter) and
// `hashes` holds the hex digest of each chunk, in order.
class TillDownloadAsset {
 public:
  static constexpr std::string_view kClassName = "TillDownloadAsset";
  // The only kind of asset there is: a package to install.
  static constexpr std::int64_t kTypeSoftwarePackage = 10;

  TillDownloadAsset() = default;

  [[nodiscard]] std::int64_t type() const { return type_; }
  void setType(std::int64_t type) { type_ = type; }
  [[nodiscard]] bool external() const { return external_; }
  void setExternal(bool value) { external_ = value; }
  [[nodiscard]] const VendURLRequest& URLRequest() const { return URLRequest_; }
  void setURLRequest(VendURLRequest request) { URLRequest_ = std::move(request); }
  [[nodiscard]] std::int64_t fileSize() const { return fileSize_; }
  void setFileSize(std::int64_t size) { fileSize_ = size; }
  [[nodiscard]] const std::vector<std::string>& hashes() const { return hashes_; }
  void setHashes(std::vector<std::string> hashes) { hashes_ = std::move(hashes); }
  [[nodiscard]] std::int64_t numberOfBytesToHash() const { return numberOfBytesToHash_; }
  void setNumberOfBytesToHash(std::int64_t size) { numberOfBytesToHash_ = size; }

  // Why the asset cannot be downloaded and checked as it stands (no URL,
  // no package, sizes and digests that do not fit together), or nullopt.
  [[nodiscard]] std::optional<std::string> unusableReason() const;

  // Keyed-archive form: the wire keys plus "$class". An archive gives back
  // what was archived, usable or not; only wrong types refuse it.
  [[nodiscard]] PlistDictionary encodeWithCoder() const;
  static std::optional<TillDownloadAsset> initWithCoder(const PlistValue& encoded);

  // Wire form, the store's asset dictionary: "type", "URL", "fileSize",
  // "numberOfBytesToHash", "hashes", plus the local "external" and, only
  // for a request that is more than a plain fetch of its URL, the whole
  // request under "URLRequest". nullopt when a field has the wrong type or
  // the asset is unusable.
  [[nodiscard]] PlistDictionary toDictionary() const;
  static std::optional<TillDownloadAsset> fromDictionary(const PlistDictionary& dictionary);

  [[nodiscard]] std::string description() const;

  friend bool operator==(const TillDownloadAsset&, const TillDownloadAsset&) = default;

 private:
  std::int64_t type_ = kTypeSoftwarePackage;
  bool external_ = false;
  VendURLRequest URLRequest_;
  std::int64_t fileSize_ = 0;
  std::vector<std::string> hashes_;
  std::int64_t numberOfBytesToHash_ = 0;
};

}  // namespace larder
