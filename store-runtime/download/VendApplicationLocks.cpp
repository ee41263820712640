#include "store-runtime/download/VendApplicationLocks.h"

#include <algorithm>

#include "platform/log/TillLogManager.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/host/PlatformStateFile.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "VendApplicationLocks";

PlistArray storedArray(PlistValue& value) {
  if (PlistArray* items = value.array()) return std::move(*items);
  return {};
}

void persist(const std::string& bundleIdentifier, bool locked) {
  const bool written = PlatformStateFile::named(VendApplicationLocks::kStateFileName)
                           .updateValue([&](PlistValue& value) {
                             PlistArray items = storedArray(value);
                             std::erase_if(items, [&](const PlistValue& item) {
                               const std::string* text = item.string();
                               return !text || *text == bundleIdentifier;
                             });
                             if (locked) items.emplace_back(bundleIdentifier);
                             value = PlistValue(std::move(items));
                           });
  if (!written) {
    TILL_LOG(1, "%@: Could not record that %@ is %@", kSpeaker, bundleIdentifier,
             locked ? "locked" : "unlocked");
  }
}

}  // namespace

void VendApplicationLocks::lock(const std::string& bundleIdentifier) {
  MutexLock lock(mutex_);
  const std::size_t count = ++counts_[bundleIdentifier];
  TILL_LOG(2, "%@: Locked applications of %@ (%lu)", kSpeaker, bundleIdentifier, count);
  // The file is written under the lock, so that a lock and an unlock of the
  // same identifier reach it in the order they were made.
  if (count == 1) persist(bundleIdentifier, true);
}

void VendApplicationLocks::unlock(const std::string& bundleIdentifier) {
  MutexLock lock(mutex_);
  const auto found = counts_.find(bundleIdentifier);
  if (found == counts_.end()) {
    TILL_LOG(1, "%@: Ignoring unlock of %@, which is not locked", kSpeaker, bundleIdentifier);
    return;
  }
  const std::size_t count = --found->second;
  TILL_LOG(2, "%@: Unlocked applications of %@ (%lu)", kSpeaker, bundleIdentifier, count);
  if (count > 0) return;
  counts_.erase(found);
  persist(bundleIdentifier, false);
}

std::size_t VendApplicationLocks::lockCount(const std::string& bundleIdentifier) const {
  MutexLock lock(mutex_);
  const auto found = counts_.find(bundleIdentifier);
  return found == counts_.end() ? 0 : found->second;
}

std::vector<std::string> VendApplicationLocks::persistedIdentifiers() {
  std::vector<std::string> identifiers;
  PlistValue stored = PlatformStateFile::named(kStateFileName).read();
  for (const PlistValue& item : storedArray(stored)) {
    if (const std::string* text = item.string()) identifiers.push_back(*text);
  }
  return identifiers;
}

}  // namespace larder
