#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "client/ServiceClient.h"
#include "platform/value/PlistValue.h"

namespace larder {

// What `larderctl os-updates` is asked to do, in this order: scan, hide,
// unhide, then list.
struct OSUpdatesOptions {
  bool scan = false;
  std::vector<std::string> hide;
  bool unhideAll = false;
};

// `larderctl os-updates`: the OS updates the system offers, a scan with its
// progress, hiding and unhiding.
class OSUpdatesCommand {
 public:
  static constexpr const char* kScanObserverPath = "/com/orvane/larderctl/OSUpdateScanObserver";
  // A scan may take as long as the system's servers take to answer.
  static constexpr std::uint64_t kScanTimeoutMicroseconds = 600'000'000ULL;

  OSUpdatesCommand(ServiceClient& client, bool json) : client_(client), json_(json) {}

  // 0 when OS updates are available; 3 when none are; 1 when a scan
  // failed or a hide or unhide was refused.
  int run(const OSUpdatesOptions& options);

 private:
  // Waits for the end of a scan, showing its progress; the scan's error, if any.
  PlistValue scan();
  bool changeHidden(const std::string& member, const PlistArray& arguments,
                    const std::string& what);
  void print(const PlistArray& updates) const;

  ServiceClient& client_;
  bool json_;
};

}  // namespace larder
