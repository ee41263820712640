#pragma once

#include <string>
#include <vector>

#include "client/ServiceRequests.h"
#include "platform/value/PlistValue.h"

namespace larder {

// The words of `larderctl call METHOD ARGS...` read by the request's
// signature: scalars as written, containers as JSON. A word that does not
// fit its type is a usage error (CLI::ValidationError) that names the
// argument, its type and the word.
class CallArguments {
 public:
  static PlistArray parse(const RequestSignature& request, const std::vector<std::string>& words);
};

}  // namespace larder
