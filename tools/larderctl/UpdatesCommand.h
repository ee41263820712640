#pragma once

#include <cstdint>

#include "client/ServiceClient.h"
#include "platform/value/PlistValue.h"

namespace larder {

// `larderctl updates [--check]`: the updates the service knows of for the
// software installed, and, with --check, after asking the store first.
class UpdatesCommand {
 public:
  // A check waits for the store, whose requests may take a minute to fail.
  static constexpr std::uint64_t kCheckTimeoutMicroseconds = 180'000'000ULL;

  UpdatesCommand(ServiceClient& client, bool json) : client_(client), json_(json) {}

  // 0 when there are updates; 3 (nothing to do) when there are none; 1
  // when the check failed (what the service knew is still printed).
  int run(bool check);

 private:
  void printTable(const PlistArray& updates, bool incompatible) const;
  void printJson(const PlistValue& success, const PlistValue& available,
                 const PlistValue& incompatible, const PlistValue& error) const;

  ServiceClient& client_;
  bool json_;
};

}  // namespace larder
