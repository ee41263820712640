#include "platform/system/Bundle.h"

#include <array>
#include <filesystem>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/ApplicationRegistry.h"
#include "platform/system/FileIO.h"

namespace larder {

namespace {

bool hasExtension(std::string_view name) {
  return std::filesystem::path(name).has_extension();
}

bool isPlainResourceName(std::string_view name) {
  return !name.empty() && name.find("..") == std::string_view::npos && name.front() != '/';
}

}  // namespace

std::optional<Bundle> Bundle::open(const std::string& path) {
  std::error_code code;
  if (!std::filesystem::is_directory(path, code)) return std::nullopt;
  Bundle bundle(path, {});
  if (std::optional<PlistValue> info = bundle.readPropertyList(kInfoFileName)) {
    if (PlistDictionary* dictionary = info->dictionary()) bundle.info_ = std::move(*dictionary);
  }
  return bundle;
}

std::optional<Bundle> Bundle::withIdentifier(std::string_view bundleIdentifier) {
  std::optional<std::string> path = ApplicationRegistry::pathForBundleIdentifier(bundleIdentifier);
  if (!path) return std::nullopt;
  return open(*path);
}

const PlistValue& Bundle::infoValue(std::string_view key) const {
  auto found = info_.find(key);
  return found == info_.end() ? PlistValue::null() : found->second;
}

std::optional<std::string> Bundle::identifier() const {
  const std::string* identifier = infoValue("HostBundleIdentifier").string();
  return identifier ? std::optional<std::string>(*identifier) : std::nullopt;
}

std::optional<PlistValue> Bundle::readPropertyList(std::string_view fileName) const {
  auto bytes = FileIO::read(path_ + "/" + std::string(fileName), kMaxPropertyListBytes);
  if (!bytes) return std::nullopt;
  return PropertyListSerialization::read(*bytes).optional();
}

std::optional<PlistData> Bundle::resourceData(std::string_view name) const {
  if (!isPlainResourceName(name)) return std::nullopt;
  std::string base = path_ + "/" + std::string(kResourcesFolder) + "/" + std::string(name);
  if (std::optional<PlistData> data = FileIO::read(base).optional()) return data;
  if (hasExtension(name)) return std::nullopt;
  static constexpr std::array<std::string_view, 4> kImageExtensions = {".png", ".tiff", ".svg",
                                                                       ".icns"};
  for (std::string_view extension : kImageExtensions) {
    if (std::optional<PlistData> data = FileIO::read(base + std::string(extension)).optional())
      return data;
  }
  return std::nullopt;
}

}  // namespace larder
