#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace larder {

// The head of an HTTP answer. Header names keep the spelling the server
// sent; lookups ignore case, as HTTP does.
struct VendURLResponse {
  long statusCode = 0;
  std::string url;  // after redirects
  std::vector<std::pair<std::string, std::string>> headers;

  [[nodiscard]] std::optional<std::string> valueForHeaderField(std::string_view field) const;
  // The media type without parameters ("application/x-plist"), lower case.
  [[nodiscard]] std::string mimeType() const;
  [[nodiscard]] bool isSuccess() const { return statusCode >= 200 && statusCode < 300; }
};

}  // namespace larder
