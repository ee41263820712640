#include "store-runtime/dialogs/LocalizedStringBundle.h"

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/FileIO.h"
#include "store-runtime/core/VendStoreClient.h"
#include "store-runtime/dialogs/LocalizedStringTable.h"

namespace larder {

namespace {

constexpr std::string_view kDefaultTable = "Localizable";
constexpr std::size_t kMaxTableBytes = 4u << 20u;

bool isPlainTableName(std::string_view name) {
  return !name.empty() && name.find('/') == std::string_view::npos && name.front() != '.';
}

std::optional<std::string> textInBundleOnDisk(const std::string& bundlePath, std::string_view key,
                                              std::optional<std::string_view> table) {
  std::string_view name = table && !table->empty() ? *table : kDefaultTable;
  if (!isPlainTableName(name)) return std::nullopt;
  std::string path = bundlePath + "/resources/" + std::string(name) + ".strings";
  std::optional<std::vector<std::uint8_t>> bytes = FileIO::read(path, kMaxTableBytes).optional();
  if (!bytes) return std::nullopt;
  std::optional<PlistValue> strings = PropertyListSerialization::read(*bytes);
  if (!strings) return std::nullopt;
  const std::string* text = (*strings)[key].string();
  return text ? std::optional<std::string>(*text) : std::nullopt;
}

std::optional<std::string> textInCompiledTable(std::string_view key,
                                               std::optional<std::int64_t> clientType) {
  if (clientType == VendStoreClient::kBookApplication) {
    if (auto text = findLocalizedText(bookClientStringOverrides(), key)) return std::string(*text);
  }
  if (auto text = findLocalizedText(tradelineStringTable(), key)) return std::string(*text);
  return std::nullopt;
}

}  // namespace

LocalizedStringBundle LocalizedStringBundle::tradelineFramework() {
  return LocalizedStringBundle(std::string());
}

LocalizedStringBundle LocalizedStringBundle::forVendDialog() {
  return LocalizedStringBundle(std::string());
}

LocalizedStringBundle LocalizedStringBundle::atPath(std::string bundlePath) {
  while (bundlePath.size() > 1 && bundlePath.back() == '/') bundlePath.pop_back();
  return LocalizedStringBundle(std::move(bundlePath));
}

std::optional<std::string> LocalizedStringBundle::textForKey(
    std::string_view key, std::optional<std::string_view> table,
    std::optional<std::int64_t> clientType) const {
  if (isOnDisk()) return textInBundleOnDisk(bundlePath_, key, table);
  return textInCompiledTable(key, clientType);
}

std::string LocalizedStringBundle::localizedStringForKey(
    std::string_view key, std::string_view value, std::optional<std::string_view> table) const {
  if (std::optional<std::string> text = textForKey(key, table, std::nullopt)) return *text;
  return std::string(value.empty() ? key : value);
}

}  // namespace larder
