#pragma once

#include <nlohmann/json.hpp>

#include "platform/value/PlistValue.h"

namespace larder {

// Property lists as JSON for scripts and logs: data as base64 strings,
// dates as seconds since 1970 or as ISO 8601 text. And back, for arguments
// given on the command line.
class JsonConversion {
 public:
  enum class DateStyle { SecondsSince1970, ISO8601 };

  static nlohmann::json toJson(const PlistValue& value,
                               DateStyle dates = DateStyle::SecondsSince1970);
  static std::string isoDate(PlistDate date);
  static PlistValue fromJson(const nlohmann::json& json);
};

}  // namespace larder
