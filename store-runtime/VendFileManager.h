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
