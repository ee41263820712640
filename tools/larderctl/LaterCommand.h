#pragma once

#include <optional>
#include <string>

#include "client/ServiceClient.h"

namespace larder {

// What `larderctl later` is asked to do: put the available updates off to a
// moment, list what waits, or cancel it.
struct LaterOptions {
  std::optional<std::string> when;  // tonight, hour or tomorrow
  bool list = false;
  bool cancel = false;
};

// `larderctl later tonight|hour|tomorrow`, `later --list`, `later --cancel`:
// Do It Later as the store application's menu offers it.
class LaterCommand {
 public:
  LaterCommand(ServiceClient& client, bool json) : client_(client), json_(json) {}

  // 0 done; 3 when --list finds nothing waiting.
  int run(const LaterOptions& options);

  // The mode of a moment's name: tonight 1, hour 2, tomorrow 3.
  static std::int64_t modeOf(const std::string& when);

 private:
  int list();

  ServiceClient& client_;
  bool json_;
};

}  // namespace larder
