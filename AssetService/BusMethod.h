#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace larder {

// One method of an interface the service exports beside its request
// table, as the bus describes it.
struct BusMethod {
  std::string_view member;
  std::string_view inSignature;
  std::vector<std::string> inNames;
  std::string_view outSignature;
  std::vector<std::string> outNames;
  // Sent without waiting for an answer.
  bool noReply = false;
};

}  // namespace larder
