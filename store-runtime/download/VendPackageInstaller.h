#pragma once

#include <string>

#include "platform/error/VendError.h"

namespace larder {

// Installs a package (an uncompressed tar holding one "<Name>.app" folder)
// so that the bundle appears whole or not at all:
//  - the package is checked entry by entry before anything is written;
//  - it is extracted into a fresh staging folder beside the destination,
//    on the same file system, and flushed to disk;
//  - the staging folder then takes the destination's place in one rename
//    (a new bundle) or one exchange (a bundle that is already installed,
//    whose old tree is removed afterwards).
// The destination is the installed bundle of that identifier, which must be
// store software this user may replace, else "<root>/Applications/<Name>.app".
// After a failure the destination is as it was and no staging folder
// remains.
class VendPackageInstaller {
 public:
  struct Options {
    // Swap an installed bundle in one step where the file system can. Off,
    // the old bundle is renamed aside first and put back if the new one
    // cannot take its place (the way for file systems without exchange).
    bool useExchange = true;
  };

  struct Result {
    std::string installedPath;
    bool replacedExisting = false;
    OptionalError error;
  };

  VendPackageInstaller() = default;
  explicit VendPackageInstaller(Options options) : options_(options) {}

  // `bundleIdentifier` finds the installed bundle to replace; the package's
  // bundle must carry an identifier, the same one when it is not empty.
  [[nodiscard]] Result install(const std::string& packagePath,
                               const std::string& bundleIdentifier) const;

 private:
  Options options_;
};

}  // namespace larder
