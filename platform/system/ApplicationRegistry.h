#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace larder {

// The platform's list of applications: every bundle in the application
// folders, any volume included.
//   <root>/Applications (and one level of subfolders)
//   $HOME/Applications
//   <root>/Volumes/*/Applications
class ApplicationRegistry {
 public:
  static std::vector<std::string> applicationFolders();
  // Paths of all bundles, in folder order, each folder's entries sorted.
  static std::vector<std::string> allApplicationPaths();
  static std::optional<std::string> pathForBundleIdentifier(std::string_view bundleIdentifier);
};

}  // namespace larder
