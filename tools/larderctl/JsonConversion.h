#pragma once

#include <nlohmann/json.hpp>

#include "platform/PlistValue.h"

namespace larder {

// Property lists as JSON for scripts: data as base64 strings, dates as
// seconds since 1970. And back, for arguments given on the command line.
class JsonConversion {
 public:
  static nlohmann::json toJson(const PlistValue& value);
  static PlistValue fromJson(const nlohmann::json& json);
};

}  // namespace larder
