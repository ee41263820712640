#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string_view>

#include "platform/error/Result.h"
#include "platform/system/Mutex.h"

namespace larder {

class FileDescriptor;

// Keeps the machine from sleeping while something that must not be cut
// short runs (an install, a take-down of applications). On the real machine
// ("/" as platform root, logind on the system bus) an assertion is a logind
// inhibitor lock held until release. Anywhere else, or when logind does not
// answer, it is a record in "<root>/var/lib/larder-platform/power-assertions.plist":
//   assertions   dictionary identifier (decimal text) -> { type, name, date }
// so that a caller never fails for want of logind.
class LedgerPowerAssertion {
 public:
  static constexpr std::string_view kFileName = "power-assertions.plist";
  static constexpr std::string_view kErrorDomain = "LedgerPowerAssertion";
  // An identifier that no assertion of this process has.
  static constexpr std::int64_t kNotFoundCode = 2;
  // The record could not be written.
  static constexpr std::int64_t kStoreFailedCode = 3;

  // A non-zero identifier, or the error whose code says why not.
  static Result<std::uint32_t> create(std::string_view type, std::string_view name);
  // 0, or the code of the error.
  static std::int64_t release(std::uint32_t identifier);

 private:
  static LedgerPowerAssertion& shared();
  LedgerPowerAssertion();
  ~LedgerPowerAssertion();

  Result<std::uint32_t> createAssertion(std::string_view type, std::string_view name);
  std::int64_t releaseAssertion(std::uint32_t identifier);

  Mutex mutex_;
  // The inhibitor locks this process holds, by identifier.
  std::map<std::uint32_t, std::unique_ptr<FileDescriptor>> locks_ GUARDED_BY(mutex_);
  std::uint32_t nextLockIdentifier_ GUARDED_BY(mutex_) = 1;
};

}  // namespace larder
