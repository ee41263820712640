#include "tools/larderctl/BackgroundScanCommand.h"

#include <CLI/CLI.hpp>
#include <iostream>
#include <nlohmann/json.hpp>

#include "platform/plist/JsonConversion.h"
#include "store-runtime/sysup/SysupBackgroundScanReport.h"
#include "store-runtime/sysup/SysupQuaymartUpdateController.h"
#include "tools/larderctl/ExitStatus.h"
#include "tools/larderctl/ValueText.h"

namespace larder {

PlistDictionary BackgroundScanCommand::reportFromJson(const std::string& info) {
  const nlohmann::json document = nlohmann::json::parse(info, nullptr, false);
  if (document.is_discarded() || !document.is_object()) {
    throw CLI::ValidationError("--info takes a JSON object, not '" + info + "'");
  }
  PlistValue report = JsonConversion::fromJson(document);
  return *report.dictionary();
}

int BackgroundScanCommand::run(ServiceClient& client,
                               const std::optional<PlistDictionary>& given) const {
  // The client is connected before the scan: composing the report takes the
  // logout results out of the state, and they must not be lost to a service
  // that is not there.
  const PlistDictionary report = given
                                     ? *given
                                     : SysupBackgroundScanReport::composeReport(
                                           SysupQuaymartUpdateController::sharedUpdateController());
  client.call(std::string(kRequest), {report});
  print(report);
  return kExitSuccess;
}

void BackgroundScanCommand::print(const PlistDictionary& report) const {
  if (json_) {
    std::cout << JsonConversion::toJson(report).dump(2) << std::endl;
    return;
  }
  for (const auto& [key, value] : report) {
    std::cout << key << ": " << ValueText::of(key, value) << '\n';
  }
  std::cout << std::flush;
}

}  // namespace larder
