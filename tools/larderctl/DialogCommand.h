#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "client/ServiceClient.h"

namespace larder {

struct DialogCommandOptions {
  std::string message;
  std::optional<std::string> explanation;
  std::optional<std::string> okButton;
  std::optional<std::string> cancelButton;
  std::optional<std::string> otherButton;
};

// `larderctl dialog`: shows a dialog through the service's dialog agents
// and prints the exit code (1 OK, 0 cancel or nobody to ask, 2 other), or
// with --json the whole answer.
class DialogCommand {
 public:
  // How long a person may take over the dialog unless --timeout says
  // otherwise: as long as the service waits for its agent.
  static constexpr std::uint64_t kDefaultTimeoutMicroseconds = 3'600'000'000ULL + 60'000'000ULL;

  DialogCommand(ServiceClient& client, bool json) : client_(client), json_(json) {}

  int run(const DialogCommandOptions& options, std::uint64_t timeoutMicroseconds);

 private:
  ServiceClient& client_;
  bool json_;
};

}  // namespace larder
