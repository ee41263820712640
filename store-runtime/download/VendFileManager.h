#pragma once

#include <string>
#include <string_view>

namespace larder {

// File-layer questions of the store runtime, answered for the bundle layout
// and the folders of this platform.
class VendFileManager {
 public:
  // The bundle can be replaced by the update machinery: it is a folder,
  // and both it and the folder that holds it are writable by this user.
  static bool isUpdatableAtPath(const std::string& path);
  // The bundle at the path is store software: a bundle folder with a
  // readable purchase record ("purchase.plist", a dictionary).
  static bool isQuaymartAppAtPath(const std::string& path);
  // The store may install over the bundle at the path: a folder named
  // "*.app" (not a symbolic link) inside one of the application folders,
  // which the update machinery could replace (isUpdatableAtPath).
  static bool isInstallableAtPath(const std::string& path);
  // The name a person sees: HostBundleDisplayName, else HostBundleName,
  // else the folder's name without ".app".
  static std::string displayNameAtPath(const std::string& path);
  // "<cache home>/<name>", created if needed.
  static std::string cacheDirectoryPathWithName(std::string_view name);
  // Mount point of the volume that holds `path`: "<root>/Volumes/<name>"
  // for a path on a volume, "/" for anything on the boot volume.
  static std::string volumePath(std::string_view path);
};

// Compares version strings with runs of digits taken as numbers, so that
// "1.10" is greater than "1.9". Returns <0, 0 or >0.
int compareVersionStrings(std::string_view a, std::string_view b);

}  // namespace larder
