#pragma once

#include <optional>
#include <string>

#include "client/ServiceClient.h"
#include "platform/value/PlistValue.h"

namespace larder {

// `larderctl history [--since DAYS]`: what was installed in the last 30
// days, as the service's installed-updates journal reports it to the store
// application. The service leaves out the OS updates that still wait for a
// logout, so the pending column shows only what the service reports.
class HistoryCommand {
 public:
  HistoryCommand(ServiceClient& client, bool json) : client_(client), json_(json) {}

  // 0 when something was installed in the time asked; 3 when nothing was.
  int run(std::optional<double> sinceDays);

  // The entries installed at or after `now` minus `sinceDays` days (all of
  // them without a bound; an entry without a date only then), newest first.
  // Dates come as seconds since 1970, as the bus carries them, or as dates.
  static PlistArray newestFirst(const PlistArray& journal, std::optional<double> sinceDays,
                                double now);
  // The table of `entries` in their order: title, version, local date to
  // the minute, app or OS, pending.
  static std::string table(const PlistArray& entries);

 private:
  ServiceClient& client_;
  bool json_;
};

}  // namespace larder
