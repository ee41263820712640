#pragma once

#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

// A record's field as a person reads it: dates in local time, enumerations
// by name with their number, text as it is. Dates travel on the bus as
// seconds since 1970, so a field is a date by its name: every date field
// of the records ends in "Date".
class ValueText {
 public:
  static std::string of(std::string_view key, const PlistValue& value);
  // "2026-01-15 11:00:00 CET"
  static std::string localTime(double secondsSince1970);
  // The text of a field for a table cell; `fallback` when it is no text or empty.
  static std::string textOr(const PlistValue& value, const char* fallback = "-");
};

}  // namespace larder
