#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/value/PlistValue.h"

namespace larder {

struct SysupQuaymartUpdateFields {
  std::string productKey;
  std::vector<std::string> tags;
  std::optional<std::string> title;
  std::optional<std::string> versionString;
  std::optional<std::string> longDescription;
  // What the update needs; 1 and 2 leave its journal entry pending.
  std::int64_t action = 0;
  bool isCritical = false;
  bool isRecommended = false;
  // Texts the user has to see before the install; absent when none.
  std::optional<std::string> firmwareWarning;
  std::optional<std::string> licenseAgreement;
  std::vector<std::string> applicationIdentifiersToClose;
  bool allowedToUseInstallLater = false;
  // The download metadata in its wire form; empty when there is none.
  PlistDictionary downloadMetadata;

  friend bool operator==(const SysupQuaymartUpdateFields&,
                         const SysupQuaymartUpdateFields&) = default;
};

// One OS update as the system update framework reports it. The service only
// reads it, so it is a plain value.
class SysupQuaymartUpdate {
 public:
  static constexpr std::string_view kClassName = "SysupQuaymartUpdate";
  static constexpr std::string_view kThumbnailImageURLKey = "thumbnailImageURL";

  // Only the framework makes these, always with a product key.
  explicit SysupQuaymartUpdate(SysupQuaymartUpdateFields fields) : fields_(std::move(fields)) {}

  [[nodiscard]] const SysupQuaymartUpdateFields& fields() const { return fields_; }
  [[nodiscard]] const std::string& productKey() const { return fields_.productKey; }
  [[nodiscard]] const std::vector<std::string>& tags() const { return fields_.tags; }
  [[nodiscard]] const std::optional<std::string>& title() const { return fields_.title; }
  [[nodiscard]] const std::optional<std::string>& versionString() const {
    return fields_.versionString;
  }
  [[nodiscard]] const std::optional<std::string>& longDescription() const {
    return fields_.longDescription;
  }
  [[nodiscard]] std::int64_t action() const { return fields_.action; }
  [[nodiscard]] bool isCritical() const { return fields_.isCritical; }
  [[nodiscard]] bool isRecommended() const { return fields_.isRecommended; }
  [[nodiscard]] const std::optional<std::string>& firmwareWarning() const {
    return fields_.firmwareWarning;
  }
  [[nodiscard]] const std::optional<std::string>& licenseAgreement() const {
    return fields_.licenseAgreement;
  }
  [[nodiscard]] const std::vector<std::string>& applicationIdentifiersToClose() const {
    return fields_.applicationIdentifiersToClose;
  }
  [[nodiscard]] bool allowedToUseInstallLater() const { return fields_.allowedToUseInstallLater; }
  [[nodiscard]] const PlistDictionary& downloadMetadataDictionary() const {
    return fields_.downloadMetadata;
  }
  // The icon of the download metadata, for the launcher bar.
  [[nodiscard]] std::optional<std::string> thumbnailImageURL() const;

  // Keyed-archive form: the wire keys plus "$class".
  [[nodiscard]] PlistDictionary encodeWithCoder() const;
  // nullopt when the class is not ours, the product key is missing or a
  // field has the wrong type.
  static std::optional<SysupQuaymartUpdate> initWithCoder(const PlistValue& encoded);

  // Wire form: the field names; the metadata goes as "downloadMetadata".
  [[nodiscard]] PlistDictionary toDictionary() const;
  static std::optional<SysupQuaymartUpdate> fromDictionary(const PlistDictionary& dictionary);

  [[nodiscard]] std::string description() const;

  friend bool operator==(const SysupQuaymartUpdate&, const SysupQuaymartUpdate&) = default;

 private:
  SysupQuaymartUpdateFields fields_;
};

}  // namespace larder
