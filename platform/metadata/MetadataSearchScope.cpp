#include "platform/metadata/MetadataSearchScope.h"

#include <sys/stat.h>

#include <algorithm>
#include <filesystem>

#include "platform/metadata/MetadataAttributes.h"
#include "platform/system/Environment.h"

namespace larder {

namespace {

namespace fs = std::filesystem;

bool isDirectory(const std::string& path) {
  struct stat info {};
  return ::stat(path.c_str(), &info) == 0 && S_ISDIR(info.st_mode);
}

// Names of the folders in `folder`, sorted; nothing when it cannot be read or goes away.
std::vector<std::string> sortedSubfolderNames(const std::string& folder) {
  std::vector<std::string> names;
  std::error_code code;
  fs::directory_iterator iterator(folder, code);
  if (code) return names;
  for (fs::directory_iterator end; iterator != end; iterator.increment(code)) {
    if (code) break;
    std::string name = iterator->path().filename().string();
    if (isDirectory(folder + "/" + name)) names.push_back(std::move(name));
  }
  std::sort(names.begin(), names.end());
  return names;
}

std::string joined(const std::string& folder, std::string_view name) {
  if (folder == "/") return "/" + std::string(name);
  return folder + "/" + std::string(name);
}

}  // namespace

MetadataSearchScope MetadataSearchScope::current() {
  MetadataSearchScope scope;
  const std::string root = Environment::platformRoot();
  const std::string applications = joined(root, "Applications");
  const std::string home = Environment::homeDirectory();
  const std::string volumes = joined(root, "Volumes");

  scope.add(root, Role::PlatformRoot);
  scope.add(applications, Role::TopApplications);
  for (const std::string& name : sortedSubfolderNames(applications)) {
    if (!MetadataAttributes::isBundleName(name)) {
      scope.add(joined(applications, name), Role::ApplicationFolder);
    }
  }
  scope.add(home, Role::Home);
  scope.add(joined(home, "Applications"), Role::ApplicationFolder);
  scope.add(volumes, Role::Volumes);
  for (const std::string& name : sortedSubfolderNames(volumes)) {
    const std::string volume = joined(volumes, name);
    scope.add(volume, Role::Volume);
    scope.add(joined(volume, "Applications"), Role::ApplicationFolder);
  }
  return scope;
}

void MetadataSearchScope::add(std::string path, Role role) {
  if (!isDirectory(path)) return;
  // The same folder in two roles is watched in both, except that a bundle folder is listed once:
  // its first role says how it is scanned.
  const bool listedAlready = std::any_of(folders_.begin(), folders_.end(), [&](const Folder& f) {
    return f.path == path && (f.role == role || (holdsBundles(f.role) && holdsBundles(role)));
  });
  if (!listedAlready) folders_.push_back({std::move(path), role});
}

bool MetadataSearchScope::holdsBundleFolder(std::string_view path) const {
  return std::any_of(folders_.begin(), folders_.end(),
                     [&](const Folder& f) { return f.path == path && holdsBundles(f.role); });
}

bool MetadataSearchScope::holdsBundles(Role role) {
  return role == Role::TopApplications || role == Role::ApplicationFolder;
}

bool MetadataSearchScope::childChangesScope(Role role, std::string_view name) {
  switch (role) {
    case Role::PlatformRoot:
      return name == "Applications" || name == "Volumes";
    case Role::Home:
    case Role::Volume:
      return name == "Applications";
    case Role::Volumes:
      return true;
    case Role::TopApplications:
      return !MetadataAttributes::isBundleName(name);
    case Role::ApplicationFolder:
      return false;
  }
  return false;
}

}  // namespace larder
