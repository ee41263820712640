#pragma once

#include <optional>
#include <string>

#include "client/ServiceClient.h"
#include "platform/value/PlistValue.h"

namespace larder {

// `larderctl background-scan [--info JSON]`: the software update agent.
// Its timer runs it once a day and at login; it scans for OS updates and
// tells the service what the scan found
// (SoftwareUpdateDidFinishBackgroundScanWithInfo). --info sends the JSON
// object given instead, to drive the service by hand.
class BackgroundScanCommand {
 public:
  static constexpr std::string_view kRequest = "SoftwareUpdateDidFinishBackgroundScanWithInfo";

  explicit BackgroundScanCommand(bool json) : json_(json) {}

  // The report as --info gives it; a usage error (CLI::ValidationError)
  // when it is not a JSON object.
  static PlistDictionary reportFromJson(const std::string& info);

  // Composes the report unless one is given, sends it and prints it.
  int run(ServiceClient& client, const std::optional<PlistDictionary>& given) const;

 private:
  void print(const PlistDictionary& report) const;

  bool json_;
};

}  // namespace larder
