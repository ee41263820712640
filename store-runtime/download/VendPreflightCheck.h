#pragma once

#include <chrono>
#include <cstdint>
#include <string>

#include "platform/value/PlistValue.h"

namespace larder {

// Asks the store whether an item may be installed on this system: a GET of
// the item's preflight URL, answered with { allowed: bool,
// minimumSystemVersion: string }. The item may be installed when the store
// allows it and the system is at least the minimum version.
class VendPreflightCheck {
 public:
  struct Settings {
    double requestTimeout = 60;
    std::chrono::milliseconds connectTimeout{10000};
  };
  struct Answer {
    bool allowed = false;
    // Null when allowed; otherwise the error in its wire form (domain,
    // code, description), whose code callers record.
    PlistValue object;
  };

  static Answer run(std::uint64_t itemIdentifier, const std::string& url,
                    const PlistValue& systemVersionInfo, const Settings& settings);

  // The version to compare with: a string given as is, the "SystemVersion"
  // or "ProductVersion" string of a dictionary, else this machine's
  // operating-system major version (then `majorOnly` is set). Empty when
  // none is known.
  static std::string systemVersionFrom(const PlistValue& systemVersionInfo, bool& majorOnly);
};

}  // namespace larder
