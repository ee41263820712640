#pragma once

#include <string>
#include <string_view>

namespace larder {

// Starts the store application with a "quaymart://" URL. Every launch is
// recorded in "<root>/var/lib/larder-platform/store-app.plist" ("launches":
// the latest launches, each { url, date, launched }), and when the variable
// LARDER_STORE_APP names an executable, that program is started with the
// URL as its one argument. The program runs on its own; the service does
// not wait for it.
class LedgerQuaymartLauncher {
 public:
  static constexpr std::size_t kRecordedLaunches = 50;

  static LedgerQuaymartLauncher& sharedInstance();

  // True when the launch was recorded and, if a store application is
  // configured, started.
  bool launchQuaymartWithURL(std::string_view url);

  static std::string stateFilePath();

 private:
  LedgerQuaymartLauncher() = default;
};

}  // namespace larder
