#pragma once

#include <string>

#include "platform/error/Result.h"

namespace larder {

// Builds a package: an uncompressed tar archive (ustar, with pax headers
// only where ustar cannot say it) that holds a bundle as its one top-level
// "<Name>.app/" folder. Modes are kept, symbolic links stay links; owners
// are left out, as the installer decides them.
class PackageBuilder {
 public:
  // Writes the package of `bundleDirectory` to `outputPath`, replacing it
  // only when the whole archive has been written.
  static constexpr std::string_view kErrorDomain = "PackageBuilder";
  static Result<void> pack(const std::string& bundleDirectory, const std::string& outputPath);

  // "Foo.app" for ".../Foo.app/" and for ".../Foo".
  static std::string topLevelName(const std::string& bundleDirectory);
};

}  // namespace larder
