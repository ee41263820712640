#pragma once

#include <optional>
#include <string>

#include "client/ServiceClient.h"
#include "platform/value/PlistValue.h"

namespace larder {

// `larderctl why ITEM|KEY`: why an update was not installed, in words. It
// joins what the service knows of the update now (the updates it lists,
// with the code the last decision left on each), the audit of the last
// background run, and the installed-updates journal, so that an update
// that went in is answered too.
class WhyCommand {
 public:
  WhyCommand(ServiceClient& client, bool json) : client_(client), json_(json) {}

  // 0 when the update is known and explained; 3 when nothing is known of it.
  int run(const std::string& target);

  // What is known of one update, gathered before it is put into words.
  struct Facts {
    std::string name;  // "Notes (7101)", "SEC-1"
    bool osUpdate = false;
    // The update as the service lists it now; null when it is not offered.
    const PlistValue* listed = nullptr;
    // Its entry in the last background run's audit; null when the run did
    // not decide on it.
    const PlistValue* audited = nullptr;
    PlistValue runDate;
    // Its newest entry in the installed-updates journal.
    const PlistValue* journaled = nullptr;
  };
  // The lines that answer: the first says what became of it, the others
  // where that comes from.
  static std::vector<std::string> explain(const Facts& facts);

 private:
  ServiceClient& client_;
  bool json_;
};

}  // namespace larder
