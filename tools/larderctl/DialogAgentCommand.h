#pragma once

#include <cstddef>
#include <string>

#include "client/ServiceClient.h"

namespace larder {

struct DialogAgentOptions {
  // "ok", "cancel" or "other" answers every dialog so; empty asks the
  // person at the terminal.
  std::string answer;
  // The answer of sign-in dialogs when `answer` is set.
  std::string accountName;
  std::string password;
  // Stop after this many dialogs; 0 runs until interrupted.
  std::size_t count = 0;
  // Seconds a fixed answer waits before it is given.
  double delaySeconds = 0;
  bool json = false;
};

// `larderctl agent`: registers a dialog agent with the service and answers
// its dialogs, one line on standard output per dialog answered or taken
// down by the service, until interrupted or `count` dialogs are done. At
// the end of input, the dialog on screen and all later ones are answered
// with cancel.
class DialogAgentCommand {
 public:
  static constexpr const char* kObjectPath = "/com/orvane/larderctl/DialogAgent";

  // SIGINT and SIGTERM end the agent in good order; they must be blocked
  // before the bus connection starts its thread.
  static void blockTerminationSignals();

  DialogAgentCommand(ServiceClient& client, DialogAgentOptions options);
  ~DialogAgentCommand();
  DialogAgentCommand(const DialogAgentCommand&) = delete;
  DialogAgentCommand& operator=(const DialogAgentCommand&) = delete;

  int run();

 private:
  class Session;

  ServiceClient& client_;
  DialogAgentOptions options_;
};

}  // namespace larder
