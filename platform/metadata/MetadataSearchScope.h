#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace larder {

// The folders a metadata query over the whole computer watches, as they are on disk right now:
// the application folders of the platform's registry, and the folders in which an application
// folder can appear ("anchors").
//
//   <root>                      anchor: "Applications" and "Volumes" may appear
//   <root>/Applications         bundles, and subfolders that hold bundles (one level)
//   <root>/Applications/<name>  bundles
//   $HOME                       anchor: "Applications" may appear
//   $HOME/Applications          bundles
//   <root>/Volumes              anchor: any volume may appear
//   <root>/Volumes/<name>       anchor: "Applications" may appear
//   <root>/Volumes/<name>/Applications  bundles
//
// Only folders that exist are listed; a folder reached through a symbolic link is followed, one
// that cannot be resolved (a loop) is left out.
class MetadataSearchScope {
 public:
  enum class Role {
    PlatformRoot,
    Home,
    Volumes,
    Volume,
    // Holds bundles and subfolders of bundles.
    TopApplications,
    // Holds bundles.
    ApplicationFolder,
  };

  struct Folder {
    std::string path;
    Role role;
    friend bool operator==(const Folder&, const Folder&) = default;
  };

  // The folders under the current platform root and home folder; bundle folders come in the
  // order of the application registry.
  static MetadataSearchScope current();

  [[nodiscard]] const std::vector<Folder>& folders() const { return folders_; }
  [[nodiscard]] bool holdsBundleFolder(std::string_view path) const;

  static bool holdsBundles(Role role);
  // True when a child of that name appearing or going in a folder of `role` changes the scope.
  static bool childChangesScope(Role role, std::string_view name);

 private:
  void add(std::string path, Role role);
  std::vector<Folder> folders_;
};

}  // namespace larder
