#include "tools/larderctl/DialogCommand.h"

#include <iostream>

#include "platform/plist/JsonConversion.h"

namespace larder {

int DialogCommand::run(const DialogCommandOptions& options, std::uint64_t timeoutMicroseconds) {
  PlistDictionary dialog{{"message", options.message}};
  if (options.explanation) dialog["explanation"] = *options.explanation;
  if (options.okButton) dialog["okButtonString"] = *options.okButton;
  if (options.cancelButton) dialog["cancelButtonString"] = *options.cancelButton;
  if (options.otherButton) dialog["otherButtonString"] = *options.otherButton;
  PlistArray reply = client_.callDialogAgents("DisplayDialog", {dialog}, timeoutMicroseconds);
  const std::int64_t exitCode = reply.at(0).int64Value();
  if (json_) {
    nlohmann::json answer{{"exitCode", exitCode}, {"values", JsonConversion::toJson(reply.at(1))}};
    std::cout << answer.dump() << std::endl;
  } else {
    std::cout << exitCode << std::endl;
  }
  return 0;
}

}  // namespace larder
