#include "store-runtime/http/VendURLRequest.h"

#include <strings.h>
#include <algorithm>

namespace larder {
namespace {

bool sameHeaderName(std::string_view a, std::string_view b) {
  return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

}  // namespace

void VendURLRequest::setValue(std::string_view value, std::string_view headerField) {
  std::erase_if(headers_,
                [&](const auto& header) { return sameHeaderName(header.first, headerField); });
  if (!value.empty()) headers_.emplace_back(std::string(headerField), std::string(value));
}

std::optional<std::string> VendURLRequest::valueForHeaderField(std::string_view field) const {
  auto found = std::find_if(headers_.begin(), headers_.end(), [&](const auto& header) {
    return sameHeaderName(header.first, field);
  });
  if (found == headers_.end()) return std::nullopt;
  return found->second;
}

PlistDictionary VendURLRequest::toDictionary() const {
  PlistDictionary headers;
  for (const auto& [name, value] : headers_) headers[name] = value;
  PlistDictionary dictionary{
      {"url", url_},
      {"method", method_},
      {"cachePolicy", cachePolicy_},
      {"headers", std::move(headers)},
      {"timeoutInterval", timeoutInterval_},
  };
  if (!body_.empty()) dictionary["body"] = body_;
  return dictionary;
}

VendURLRequest VendURLRequest::fromDictionary(const PlistDictionary& dictionary) {
  const PlistValue wrapped(dictionary);
  VendURLRequest request;
  if (const std::string* url = wrapped["url"].string()) request.url_ = *url;
  if (const std::string* method = wrapped["method"].string()) request.method_ = *method;
  if (const PlistData* body = wrapped["body"].data()) request.body_ = *body;
  if (wrapped["cachePolicy"].isInteger())
    request.cachePolicy_ = wrapped["cachePolicy"].int64Value();
  if (wrapped["timeoutInterval"].isNumber() && wrapped["timeoutInterval"].doubleValue() > 0) {
    request.timeoutInterval_ = wrapped["timeoutInterval"].doubleValue();
  }
  if (const PlistDictionary* headers = wrapped["headers"].dictionary()) {
    for (const auto& [name, value] : *headers) {
      if (const std::string* text = value.string()) request.setValue(*text, name);
    }
  }
  return request;
}

}  // namespace larder
