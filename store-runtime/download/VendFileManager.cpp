#include "store-runtime/download/VendFileManager.h"

#include <unistd.h>

#include <algorithm>
#include <filesystem>

#include "platform/system/ApplicationRegistry.h"
#include "platform/system/Bundle.h"
#include "platform/system/Environment.h"
#include "platform/system/FileIO.h"
#include "store-runtime/records/VendPurchaseRecord.h"

namespace larder {

bool VendFileManager::isUpdatableAtPath(const std::string& path) {
  std::error_code code;
  if (!std::filesystem::is_directory(path, code)) return false;
  std::string parent = std::filesystem::path(path).parent_path().string();
  return ::access(path.c_str(), W_OK) == 0 && ::access(parent.c_str(), W_OK) == 0;
}

namespace {

constexpr std::string_view kBundleExtension = ".app";

bool endsWith(std::string_view text, std::string_view suffix) {
  return text.size() >= suffix.size() && text.substr(text.size() - suffix.size()) == suffix;
}

std::string lastPathComponent(const std::string& path) {
  std::filesystem::path plain(path);
  while (plain.has_parent_path() && !plain.has_filename()) plain = plain.parent_path();
  return plain.filename().string();
}

// Below one of the application folders, and not inside another bundle
// (a helper bundle inside an application is the application's business).
bool isInApplicationFolder(const std::string& path) {
  for (const std::string& folder : ApplicationRegistry::applicationFolders()) {
    std::string prefix = folder.back() == '/' ? folder : folder + "/";
    if (path.size() <= prefix.size() || path.compare(0, prefix.size(), prefix) != 0) continue;
    std::filesystem::path inside = std::filesystem::path(path.substr(prefix.size())).parent_path();
    bool nested = std::any_of(inside.begin(), inside.end(), [](const std::filesystem::path& part) {
      return endsWith(part.string(), kBundleExtension) || part == "..";
    });
    if (!nested) return true;
  }
  return false;
}

const std::string* nonEmptyString(const PlistValue& value) {
  const std::string* text = value.string();
  return text && !text->empty() ? text : nullptr;
}

}  // namespace

bool VendFileManager::isQuaymartAppAtPath(const std::string& path) {
  return VendPurchaseRecord::purchaseRecordFromBundleAtPath(path).has_value();
}

bool VendFileManager::isInstallableAtPath(const std::string& givenPath) {
  std::string path = givenPath;
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  std::error_code code;
  if (!endsWith(lastPathComponent(path), kBundleExtension)) return false;
  if (std::filesystem::is_symlink(path, code)) return false;
  if (!isInApplicationFolder(path)) return false;
  return isUpdatableAtPath(path);
}

std::string VendFileManager::displayNameAtPath(const std::string& path) {
  if (std::optional<Bundle> bundle = Bundle::open(path)) {
    for (std::string_view key : {"HostBundleDisplayName", "HostBundleName"}) {
      if (const std::string* name = nonEmptyString(bundle->infoValue(key))) return *name;
    }
  }
  std::string name = lastPathComponent(path);
  if (endsWith(name, kBundleExtension) && name.size() > kBundleExtension.size()) {
    name.resize(name.size() - kBundleExtension.size());
  }
  return name;
}

std::string VendFileManager::cacheDirectoryPathWithName(std::string_view name) {
  std::string path = Environment::cacheHome() + "/" + std::string(name);
  // A folder that cannot be made shows where the caller first writes in it.
  (void)FileIO::createDirectories(path);
  return path;
}

std::string VendFileManager::volumePath(std::string_view path) {
  std::string volumes = Environment::rootedPath("/Volumes/");
  if (path.size() <= volumes.size() || path.substr(0, volumes.size()) != volumes) return "/";
  std::string_view rest = path.substr(volumes.size());
  std::size_t slash = rest.find('/');
  return volumes + std::string(rest.substr(0, slash));
}

namespace {

bool isDigit(char c) {
  return c >= '0' && c <= '9';
}

// Compares two runs of digits as numbers of any length.
int compareDigitRuns(std::string_view a, std::string_view b) {
  while (a.size() > 1 && a.front() == '0') a.remove_prefix(1);
  while (b.size() > 1 && b.front() == '0') b.remove_prefix(1);
  if (a.size() != b.size()) return a.size() < b.size() ? -1 : 1;
  int order = a.compare(b);
  return order < 0 ? -1 : (order > 0 ? 1 : 0);
}

std::string_view takeDigits(std::string_view text, std::size_t& index) {
  std::size_t start = index;
  while (index < text.size() && isDigit(text[index])) ++index;
  return text.substr(start, index - start);
}

}  // namespace

int compareVersionStrings(std::string_view a, std::string_view b) {
  std::size_t i = 0;
  std::size_t j = 0;
  while (i < a.size() && j < b.size()) {
    if (isDigit(a[i]) && isDigit(b[j])) {
      int order = compareDigitRuns(takeDigits(a, i), takeDigits(b, j));
      if (order != 0) return order;
      continue;
    }
    if (a[i] != b[j])
      return static_cast<unsigned char>(a[i]) < static_cast<unsigned char>(b[j]) ? -1 : 1;
    ++i;
    ++j;
  }
  if (i < a.size()) return 1;
  if (j < b.size()) return -1;
  return 0;
}

}  // namespace larder
