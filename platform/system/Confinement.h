#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/error/Result.h"

namespace larder {

// Confines the process before it serves anyone: no new privileges ever
// (no set-id gains through anything it starts), and, where the kernel has
// Landlock, writes only below the folders the service owns. A kernel
// without Landlock is not a failure; a refused no-new-privileges is.
class Confinement {
 public:
  // The folders a profile may write below.
  static std::vector<std::string> writableFolders(std::string_view profileName);
  // An error of kErrorDomain, its code the errno, when the process could
  // not be confined.
  static constexpr std::string_view kErrorDomain = "Confinement";
  static Result<void> confine(std::string_view profileName);
};

}  // namespace larder
