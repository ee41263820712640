#include "platform/system/ApplicationRegistry.h"

#include <algorithm>
#include <filesystem>

#include "platform/system/Bundle.h"
#include "platform/system/Environment.h"

namespace larder {

namespace {

namespace fs = std::filesystem;

bool isBundleName(const fs::path& path) {
  return path.extension() == ".app";
}

// Entries of a folder, sorted; an unreadable or vanished folder has none.
std::vector<fs::path> sortedEntries(const std::string& folder) {
  std::vector<fs::path> entries;
  std::error_code code;
  fs::directory_iterator iterator(folder, code);
  if (code) return entries;
  for (fs::directory_iterator end; iterator != end; iterator.increment(code)) {
    if (code) break;
    entries.push_back(iterator->path());
  }
  std::sort(entries.begin(), entries.end());
  return entries;
}

bool isDirectory(const fs::path& path) {
  std::error_code code;
  return fs::is_directory(path, code);
}

void collectBundles(const std::string& folder, int subfolderLevels,
                    std::vector<std::string>& bundles) {
  for (const fs::path& entry : sortedEntries(folder)) {
    if (!isDirectory(entry)) continue;
    if (isBundleName(entry)) {
      bundles.push_back(entry.string());
    } else if (subfolderLevels > 0) {
      collectBundles(entry.string(), subfolderLevels - 1, bundles);
    }
  }
}

}  // namespace

std::vector<std::string> ApplicationRegistry::applicationFolders() {
  std::vector<std::string> folders{Environment::rootedPath("/Applications"),
                                   Environment::homeDirectory() + "/Applications"};
  for (const fs::path& volume : sortedEntries(Environment::rootedPath("/Volumes"))) {
    folders.push_back((volume / "Applications").string());
  }
  folders.erase(std::unique(folders.begin(), folders.end()), folders.end());
  return folders;
}

std::vector<std::string> ApplicationRegistry::allApplicationPaths() {
  std::vector<std::string> bundles;
  std::vector<std::string> folders = applicationFolders();
  for (std::size_t i = 0; i < folders.size(); ++i) {
    collectBundles(folders[i], i == 0 ? 1 : 0, bundles);
  }
  return bundles;
}

std::optional<std::string> ApplicationRegistry::pathForBundleIdentifier(
    std::string_view bundleIdentifier) {
  for (const std::string& path : allApplicationPaths()) {
    std::optional<Bundle> bundle = Bundle::open(path);
    if (bundle && bundle->identifier() == bundleIdentifier) return path;
  }
  return std::nullopt;
}

}  // namespace larder
