#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace larder {

// Facts about this machine that the store asks for. Safe from any thread;
// nothing is cached, so a changed platform root is seen at the next call.
class VendDevice {
 public:
  // The operating system's major version as text: the part of VERSION_ID
  // in "<root>/etc/os-release" (else "<root>/usr/lib/os-release") before
  // the first dot, else the kernel release's major number.
  static std::string osMajorVersionString();
  // Bytes free for an unprivileged user on the file system of the platform
  // root; 0 when that cannot be read.
  static std::uint64_t availableDiskSpace();
  // The machine's identifier for the store: "<root>/etc/machine-id" when it
  // holds one, otherwise an identifier made once and kept in
  // "<root>/var/lib/larder-platform/machine-guid" (or, when that cannot be
  // written, in the user's state folder).
  static std::string guid();

  // The major part of a version text ("22.04" -> "22", "\"12\"" -> "12");
  // empty when it does not start with a digit.
  static std::string majorVersionOf(std::string_view version);
};

}  // namespace larder
