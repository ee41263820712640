#pragma once

#include <cstddef>
#include <map>
#include <string>
#include <vector>

#include "platform/system/Mutex.h"

namespace larder {

// Bundle identifiers whose applications may not start while their bundles
// are being replaced. Locks nest: each lock is undone by one unlock, and an
// identifier stays locked until its last lock is undone. The locked set is
// kept in "<root>/var/lib/larder-platform/locked-applications.plist", an
// array of identifiers, which the launch check reads; the file is changed
// by read-modify-write under its own file lock and atomic rename, so other
// processes' entries survive.
class VendApplicationLocks {
 public:
  static constexpr std::string_view kStateFileName = "locked-applications.plist";

  void lock(const std::string& bundleIdentifier);
  // An unlock without a lock is ignored (and logged).
  void unlock(const std::string& bundleIdentifier);

  [[nodiscard]] std::size_t lockCount(const std::string& bundleIdentifier) const;
  // The identifiers in the file, in its order; empty when there is none.
  static std::vector<std::string> persistedIdentifiers();

 private:
  mutable Mutex mutex_;
  std::map<std::string, std::size_t, std::less<>> counts_ GUARDED_BY(mutex_);
};

}  // namespace larder
