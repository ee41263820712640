#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "client/ServiceClient.h"
#include "platform/system/Mutex.h"
#include "platform/value/PlistValue.h"
#include "tools/larderctl/InstallOptions.h"

namespace larder {

// `larderctl install`: the user's own start of updates, the way the store
// application starts them. The updates are picked here from what the
// service lists (AvailableUpdates, and UpdatesForTags without tags for the
// OS updates): the items and product keys named, or with --all everything
// available, or with --critical the critical OS updates alone. They go
// through StartAppUpdatesAndOSUpdatesWithDelegate, so the rights, power and
// disk checks stand in front of them as in front of any user-started
// install. With --tags the service installs the OS update that carries the
// tags, or makes the fallback purchase.
//
// A progress bar follows each app update's download; one line tells how
// each update ended, and the exit status is 1 when any failed.
class InstallCommand {
 public:
  static constexpr const char* kDelegatePath = "/com/orvane/larderctl/UpdateDelegate";
  // A run waits for quit dialogs, downloads and installs.
  static constexpr std::uint64_t kRunTimeoutMicroseconds = 3600ULL * 1'000'000ULL;

  // `runner` makes the start and hears the delegate, on a connection of
  // its own, while `client` follows the downloads: a connection is used by
  // one thread at a time.
  InstallCommand(ServiceClient& client, ServiceClient& runner, bool json);

  int run(const InstallOptions& options);
  // `larderctl cancel KEY...`: cancels the OS update installs of these keys.
  int cancel(const std::vector<std::string>& productKeys);

 private:
  struct Choice {
    PlistArray apps;
    PlistArray osUpdates;
    std::vector<std::string> missing;
  };
  // What the delegate hears, by item identifier.
  struct Inbox {
    Mutex mutex;
    std::map<std::uint64_t, PlistArray> finished GUARDED_BY(mutex);
  };

  [[nodiscard]] Choice choose(const InstallOptions& options) const;
  int startUpdates(const Choice& choice);
  int installByTags(const InstallOptions& options);
  bool reportApp(const PlistValue& update, const PlistValue& runError) const;
  bool reportOS(const PlistValue& update, bool success, const PlistValue& runError) const;

  ServiceClient& client_;
  ServiceClient& runner_;
  bool json_;
  std::shared_ptr<Inbox> inbox_ = std::make_shared<Inbox>();
};

}  // namespace larder
