#pragma once

#include <istream>
#include <string>

#include <nlohmann/json.hpp>

#include "dmap/DAAPValue.h"

namespace larder {

// `larderctl dmap-dump FILE`: decodes a DMAP document, a file or standard
// input ("-"), and prints what the parser makes of it as JSON: indented
// for people, one line with --json. Listing items print as their
// dictionaries, data as base64, dates as ISO 8601 text (seconds since 1970
// with --json). Needs no service.
class DmapDumpCommand {
 public:
  explicit DmapDumpCommand(bool json) : json_(json) {}

  // 0 when the document decoded; 1, with a line on standard error, when
  // the file cannot be read or gives nothing.
  int run(const std::string& path) const;

  [[nodiscard]] nlohmann::json toJson(const DAAPValue& value) const;

 private:
  bool json_;
};

}  // namespace larder
