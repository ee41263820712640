#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

// An application bundle on disk: a folder "<Name>.app" with its
// information property list "bundle.plist", resources and executables.
// Every open reads the disk afresh; nothing is cached between opens.
class Bundle {
 public:
  static constexpr std::string_view kInfoFileName = "bundle.plist";
  static constexpr std::string_view kPurchaseFileName = "purchase.plist";
  static constexpr std::string_view kResourcesFolder = "resources";
  static constexpr std::size_t kMaxPropertyListBytes = 1u << 20u;

  // nullopt when `path` is not a folder. A missing or damaged
  // "bundle.plist" gives a bundle with an empty information dictionary.
  static std::optional<Bundle> open(const std::string& path);
  // The first bundle with that identifier in the application folders.
  static std::optional<Bundle> withIdentifier(std::string_view bundleIdentifier);

  [[nodiscard]] const std::string& path() const { return path_; }
  [[nodiscard]] const PlistDictionary& infoDictionary() const { return info_; }
  [[nodiscard]] const PlistValue& infoValue(std::string_view key) const;
  [[nodiscard]] std::optional<std::string> identifier() const;

  // Contents of the resource of that name; tries the name as given, then
  // with the usual image extensions when it has none.
  [[nodiscard]] std::optional<PlistData> resourceData(std::string_view name) const;

  // Reads a property-list file of the bundle; nullopt when missing or
  // damaged.
  [[nodiscard]] std::optional<PlistValue> readPropertyList(std::string_view fileName) const;

 private:
  Bundle(std::string path, PlistDictionary info) : path_(std::move(path)), info_(std::move(info)) {}
  std::string path_;
  PlistDictionary info_;
};

}  // namespace larder
