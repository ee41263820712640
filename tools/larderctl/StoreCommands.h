#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "client/ServiceClient.h"

namespace larder {

// `larderctl signin|signout|account|purchase|downloads`: the store
// runtime of the service, for people and scripts. Each prints a line of
// text, or JSON with --json, and returns the process's exit status.
class StoreCommands {
 public:
  // A purchase waits for the store and, with a sign-in dialog, for a person.
  static constexpr std::uint64_t kPurchaseTimeoutMicroseconds = 600'000'000ULL;

  StoreCommands(ServiceClient& client, bool json) : client_(client), json_(json) {}

  // "<item>  <bundle identifier>  <version>  <title>" of a download record.
  static std::string describeDownload(const PlistValue& download);
  // Prints the service's error for `what` (as JSON with `json`) and gives
  // the failure exit status.
  static int reportFailure(std::string_view what, const PlistValue& error, bool json);

  // Without a password, reads it from the first line of standard input.
  int signIn(const std::string& accountName, std::optional<std::string> password);
  int signOut();
  int account();
  // With `wait`, follows the downloads until the service says how each
  // ended, with a progress bar on a terminal; 1 when one of them was not
  // installed.
  int purchase(std::uint64_t itemIdentifier, const std::string& buyParameters, bool wait);
  int downloads(std::int64_t typeMask);

 private:
  int reportFailure(std::string_view what, const PlistValue& error) const {
    return reportFailure(what, error, json_);
  }

  ServiceClient& client_;
  bool json_;
};

}  // namespace larder
