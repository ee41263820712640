#include "platform/metadata/MetadataAttributes.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdint>
#include <filesystem>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/Bundle.h"
#include "platform/system/FileDescriptor.h"

namespace larder {

namespace {

// A bundle can hold anything where its property lists should be: a pipe must not block the index
// and a huge file must not be read whole.
PlistValue readSourceFile(const std::string& path) {
  FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!file.valid()) return {};
  struct stat info {};
  if (::fstat(file.get(), &info) != 0 || !S_ISREG(info.st_mode)) return {};
  if (static_cast<std::uint64_t>(info.st_size) > MetadataAttributes::kMaxSourceFileBytes) return {};
  PlistData bytes(static_cast<std::size_t>(info.st_size));
  std::size_t filled = 0;
  while (filled < bytes.size()) {
    const ssize_t got = ::read(file.get(), bytes.data() + filled, bytes.size() - filled);
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) break;
    filled += static_cast<std::size_t>(got);
  }
  // A file truncated while being read is parsed as what was there; a writer's next event brings
  // the rest.
  bytes.resize(filled);
  PlistReadLimits limits;
  limits.maxBytes = MetadataAttributes::kMaxSourceFileBytes;
  limits.maxDepth = 64;
  limits.maxObjects = 100'000;
  std::optional<PlistValue> value = PropertyListSerialization::read(bytes, limits);
  return value ? std::move(*value) : PlistValue();
}

std::optional<std::int64_t> wholeNumberFromText(const std::string& text) {
  std::int64_t number = 0;
  const char* end = text.data() + text.size();
  auto [stop, error] = std::from_chars(text.data(), end, number);
  if (error != std::errc() || stop != end || text.empty()) return std::nullopt;
  return number;
}

void setIfString(PlistDictionary& attributes, std::string_view name, const PlistValue& value) {
  if (value.isString()) attributes.insert_or_assign(std::string(name), value);
}

void setVersion(PlistDictionary& attributes, const PlistValue& info) {
  const std::string* shortVersion = info["HostBundleShortVersionString"].string();
  if (shortVersion && !shortVersion->empty()) {
    attributes.insert_or_assign(std::string(MetadataAttributes::kVersion), *shortVersion);
    return;
  }
  setIfString(attributes, MetadataAttributes::kVersion, info["HostBundleVersion"]);
}

void setWareID(PlistDictionary& attributes, const PlistValue& value) {
  std::optional<double> number;
  if (value.isNumber()) number = value.doubleValue();
  if (const std::string* text = value.string()) {
    if (auto whole = wholeNumberFromText(*text)) number = static_cast<double>(*whole);
  }
  if (number) attributes.insert_or_assign(std::string(MetadataAttributes::kWareID), *number);
}

void setInstallerVersionID(PlistDictionary& attributes, const PlistValue& value) {
  std::optional<std::int64_t> number;
  if (value.isNumber()) number = value.int64Value();
  if (const std::string* text = value.string()) number = wholeNumberFromText(*text);
  if (number) {
    attributes.insert_or_assign(std::string(MetadataAttributes::kInstallerVersionID), *number);
  }
}

void setPurchaseAttributes(PlistDictionary& attributes, const PlistValue& purchase) {
  const bool hasRecord = purchase.isDictionary();
  attributes.insert_or_assign(std::string(MetadataAttributes::kHasPurchaseRecord),
                              std::int64_t{hasRecord ? 1 : 0});
  if (!hasRecord) return;
  setWareID(attributes, purchase["wareID"]);
  setInstallerVersionID(attributes, purchase["installerVersionID"]);
  setIfString(attributes, MetadataAttributes::kAccountReference, purchase["opaqueAccountIDString"]);
  if (purchase["purchaseDate"].isDate()) {
    attributes.insert_or_assign(std::string(MetadataAttributes::kPurchaseDate),
                                purchase["purchaseDate"]);
  }
}

bool isDirectory(const std::string& path) {
  struct stat info {};
  return ::stat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
}

}  // namespace

std::optional<MetadataAttributes::Reading> MetadataAttributes::readBundle(const std::string& path) {
  if (!isDirectory(path)) return std::nullopt;
  const PlistValue info = readSourceFile(path + "/" + std::string(Bundle::kInfoFileName));
  const PlistValue purchase = readSourceFile(path + "/" + std::string(Bundle::kPurchaseFileName));
  return Reading{fromPropertyLists(path, info, purchase), info.isDictionary()};
}

PlistDictionary MetadataAttributes::fromPropertyLists(const std::string& path,
                                                      const PlistValue& info,
                                                      const PlistValue& purchase) {
  PlistDictionary attributes;
  attributes.insert_or_assign(std::string(kPath), path);
  if (isBundleName(std::filesystem::path(path).filename().string())) {
    attributes.insert_or_assign(std::string(kContentType),
                                std::string(kApplicationBundleContentType));
  }
  setIfString(attributes, kBundleIdentifier, info["HostBundleIdentifier"]);
  setVersion(attributes, info);
  const PlistValue& developerSigned = info["HostBundleDeveloperSigned"];
  attributes.insert_or_assign(
      std::string(kIsDeveloperSigned),
      std::int64_t{developerSigned.isNumber() && developerSigned.boolValue()});
  setPurchaseAttributes(attributes, purchase);
  return attributes;
}

bool MetadataAttributes::isSourceFileName(std::string_view fileName) {
  return fileName == Bundle::kInfoFileName || fileName == Bundle::kPurchaseFileName;
}

bool MetadataAttributes::isBundleName(std::string_view name) {
  static constexpr std::string_view kSuffix = ".app";
  return name.size() > kSuffix.size() && name.substr(name.size() - kSuffix.size()) == kSuffix;
}

}  // namespace larder
