#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace larder {

// Confines the process before it serves anyone: no new privileges ever
// (no set-id gains through anything it starts), and, where the kernel has
// Landlock, writes only below the folders the service owns. A kernel
// without Landlock is not a failure; a refused no-new-privileges is.
class Confinement {
 public:
  // The folders a profile may write below.
  static std::vector<std::string> writableFolders(std::string_view profileName);
  // false with `errorText` set when the process could not be confined.
  static bool confine(std::string_view profileName, std::string* errorText);
};

}  // namespace larder
