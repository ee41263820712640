#pragma once

#include <span>
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

// The method of `methods` named `member`, or null.
inline const BusMethod* findBusMethod(std::span<const BusMethod> methods, std::string_view member) {
  for (const BusMethod& method : methods) {
    if (method.member == member) return &method;
  }
  return nullptr;
}

}  // namespace larder
