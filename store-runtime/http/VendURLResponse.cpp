#include "store-runtime/http/VendURLResponse.h"

#include <strings.h>
#include <algorithm>
#include <cctype>

namespace larder {

std::optional<std::string> VendURLResponse::valueForHeaderField(std::string_view field) const {
  for (const auto& [name, value] : headers) {
    if (name.size() == field.size() && strncasecmp(name.data(), field.data(), name.size()) == 0) {
      return value;
    }
  }
  return std::nullopt;
}

std::string VendURLResponse::mimeType() const {
  std::string type = valueForHeaderField("Content-Type").value_or("");
  type = type.substr(0, type.find(';'));
  std::erase_if(type, [](unsigned char c) { return std::isspace(c) != 0; });
  std::transform(type.begin(), type.end(), type.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  return type;
}

}  // namespace larder
