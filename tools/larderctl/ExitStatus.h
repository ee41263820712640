#pragma once

namespace larder {

// larderctl's exit statuses (docs/cli.md): scripts test these.
enum ExitStatus : int {
  kExitSuccess = 0,
  // The operation was tried and failed, or the service could not be reached.
  kExitFailure = 1,
  // The command line was wrong; nothing was tried.
  kExitUsage = 2,
  // Nothing to do: `updates` found none, `prefs delete` found no such key.
  kExitNothingToDo = 3,
};

}  // namespace larder
