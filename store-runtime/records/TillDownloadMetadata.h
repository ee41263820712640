#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

// What a download is: the store item, the software it brings and how to
// show it. A plain value; the download that holds it guards it.
class TillDownloadMetadata {
 public:
  static constexpr std::string_view kClassName = "TillDownloadMetadata";

  TillDownloadMetadata() = default;

  // 0 when the download does not come from a store item (a managed
  // manifest's package, for one).
  [[nodiscard]] std::uint64_t itemIdentifier() const { return itemIdentifier_; }
  void setItemIdentifier(std::uint64_t identifier) { itemIdentifier_ = identifier; }
  [[nodiscard]] const std::string& bundleIdentifier() const { return bundleIdentifier_; }
  void setBundleIdentifier(std::string identifier) { bundleIdentifier_ = std::move(identifier); }
  [[nodiscard]] const std::string& bundleVersion() const { return bundleVersion_; }
  void setBundleVersion(std::string version) { bundleVersion_ = std::move(version); }
  [[nodiscard]] const std::string& title() const { return title_; }
  void setTitle(std::string title) { title_ = std::move(title); }
  [[nodiscard]] const std::optional<std::string>& thumbnailImageURL() const {
    return thumbnailImageURL_;
  }
  void setThumbnailImageURL(std::optional<std::string> url) { thumbnailImageURL_ = std::move(url); }
  [[nodiscard]] const std::optional<std::string>& preflightPackageURL() const {
    return preflightPackageURL_;
  }
  void setPreflightPackageURL(std::optional<std::string> url) {
    preflightPackageURL_ = std::move(url);
  }
  // The store's additional information: a dictionary, or null when none.
  [[nodiscard]] const PlistValue& auxInfo() const { return auxInfo_; }
  void setAuxInfo(PlistValue info) { auxInfo_ = std::move(info); }
  [[nodiscard]] bool isMDMProvided() const { return isMDMProvided_; }
  void setIsMDMProvided(bool value) { isMDMProvided_ = value; }

  // Keyed-archive form: the wire keys plus "$class".
  [[nodiscard]] PlistDictionary encodeWithCoder() const;
  // nullopt when the class is not ours or a field has the wrong type.
  static std::optional<TillDownloadMetadata> initWithCoder(const PlistValue& encoded);

  // Wire form, the store's "metadata" dictionary: "itemIdentifier",
  // "bundleIdentifier", "bundleVersion", "title", "thumbnailImageURL",
  // "preflightPackageURL", "auxInfo", "isMDMProvided". Absent URLs and
  // auxInfo are left out. nullopt when a field has the wrong type.
  [[nodiscard]] PlistDictionary toDictionary() const;
  static std::optional<TillDownloadMetadata> fromDictionary(const PlistDictionary& dictionary);

  [[nodiscard]] std::string description() const;

  friend bool operator==(const TillDownloadMetadata&, const TillDownloadMetadata&) = default;

 private:
  std::uint64_t itemIdentifier_ = 0;
  std::string bundleIdentifier_;
  std::string bundleVersion_;
  std::string title_;
  std::optional<std::string> thumbnailImageURL_;
  std::optional<std::string> preflightPackageURL_;
  PlistValue auxInfo_;
  bool isMDMProvided_ = false;
};

}  // namespace larder
