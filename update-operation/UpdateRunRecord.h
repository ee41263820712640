#pragma once

#include <chrono>
#include <cstdint>
#include <string>
#include <vector>

#include "platform/value/PlistValue.h"
#include "store-runtime/records/LedgerUpdate.h"
#include "store-runtime/records/SysupQuaymartUpdate.h"

namespace larder {

// The record of one run for the message trace log: what the run was asked
// to do, what it found and chose, and how it ended. It names only the
// vendor's own software; other software shows up in the counts alone.
class UpdateRunRecord {
 public:
  using Clock = std::chrono::system_clock;

  UpdateRunRecord(bool userInitiated, bool nowIsLater, bool isTimeToAutoUpdate, bool isTimeToStage);

  void setAvailable(const std::vector<LedgerUpdateRef>& appUpdates,
                    const std::vector<SysupQuaymartUpdate>& osUpdates);
  void setToInstall(const std::vector<LedgerUpdateRef>& appUpdates,
                    const std::vector<SysupQuaymartUpdate>& osUpdates,
                    const std::vector<std::string>& appUpdatesLater,
                    const std::vector<SysupQuaymartUpdate>& osUpdatesLater);
  void finish(bool willRestart, const std::vector<SysupQuaymartUpdate>& osUpdatesOnRestart,
              Clock::time_point startDate, bool cancelled, std::int64_t thermalEmergencies);

  [[nodiscard]] const PlistDictionary& dictionary() const { return record_; }

  // The vendor's own bundle identifiers (of updates, or given as such) and
  // product keys, joined with ", ".
  static std::string bundleIDsString(const std::vector<LedgerUpdateRef>& updates);
  static std::string bundleIDsString(const std::vector<std::string>& bundleIdentifiers);
  static std::string productKeysString(const std::vector<SysupQuaymartUpdate>& updates);
  // True for identifiers of the vendor's own software, which traces may name.
  static bool isVendorIdentifier(std::string_view identifier);

 private:
  template <typename List>
  void setList(std::string_view key, const std::string& text, const List& list);

  PlistDictionary record_;
};

}  // namespace larder
