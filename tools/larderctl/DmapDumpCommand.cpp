#include "tools/larderctl/DmapDumpCommand.h"

#include <iostream>
#include <iterator>
#include <optional>

#include "dmap/DAAPParser.h"
#include "platform/plist/JsonConversion.h"
#include "platform/system/FileIO.h"

namespace larder {
namespace {

Result<PlistData> readDocument(const std::string& path) {
  if (path != "-") return FileIO::read(path, DAAPParser::kMaxDocumentSize);
  PlistData bytes{std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>()};
  return bytes;
}

}  // namespace

nlohmann::json DmapDumpCommand::toJson(const DAAPValue& value) const {
  return JsonConversion::toJson(value.toPlist(), json_ ? JsonConversion::DateStyle::SecondsSince1970
                                                       : JsonConversion::DateStyle::ISO8601);
}

int DmapDumpCommand::run(const std::string& path) const {
  const Result<PlistData> document = readDocument(path);
  if (!document) {
    std::cerr << "larderctl: cannot read " << path << ": " << document.error().description
              << std::endl;
    return 1;
  }
  const DAAPValue value = DAAPParser::decodeData(*document);
  if (value.isNull()) {
    std::cerr << "larderctl: " << path << " is not a DMAP document that larder reads" << std::endl;
    return 1;
  }
  // Text off the wire is checked UTF-8, but keys of embedded property lists
  // are not; a bad byte must not end the dump.
  const auto replace = nlohmann::json::error_handler_t::replace;
  std::cout << (json_ ? toJson(value).dump(-1, ' ', false, replace)
                      : toJson(value).dump(2, ' ', false, replace))
            << std::endl;
  return 0;
}

}  // namespace larder
