#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace larder {

// Plain words for the codes with which the update machinery holds an update
// back. The service's own reason texts are terse and written for its log;
// these say what the user can do about it.
class UpdateExplanation {
 public:
  enum class Kind { kApp, kOS };

  // "held back: <words> (code N)", or "not yet: <words> (code N)" for the
  // codes that only mean "wait", or "no objection" for 0. `reason` is the
  // text the service recorded; it is quoted where the code alone says too
  // little (a purchase error, a preference-made code).
  static std::string abortCode(std::int64_t code, const std::optional<std::string>& reason,
                               Kind kind);
};

}  // namespace larder
