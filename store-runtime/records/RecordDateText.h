#pragma once

#include <optional>
#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

// Dates written as text, as a store may send them: ISO 8601 calendar dates
// ("2023-11-14"), optionally with a time ("T08:30:00", fractions of a
// second allowed) and a zone ("Z", "+02:00", "-0500"). Without a zone the
// time is UTC.
class RecordDateText {
 public:
  static std::optional<PlistDate> parse(std::string_view text);
};

}  // namespace larder
