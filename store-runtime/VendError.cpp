#include "store-runtime/VendError.h"

namespace larder {

std::string VendError::descriptionText() const {
  return "Error Domain=" + domain + " Code=" + std::to_string(code) + " \"" + description + "\"";
}

PlistDictionary VendError::toDictionary() const {
  PlistDictionary dictionary = userInfo;
  dictionary["domain"] = domain;
  dictionary["code"] = code;
  dictionary["description"] = description;
  return dictionary;
}

std::optional<VendError> VendError::fromDictionary(const PlistDictionary& dictionary) {
  if (dictionary.empty()) return std::nullopt;
  VendError error;
  PlistValue wrapped(dictionary);
  if (const std::string* domain = wrapped["domain"].string()) error.domain = *domain;
  error.code = wrapped["code"].int64Value();
  if (const std::string* text = wrapped["description"].string()) error.description = *text;
  for (const auto& [key, value] : dictionary) {
    if (key != "domain" && key != "code" && key != "description") error.userInfo[key] = value;
  }
  return error;
}

}  // namespace larder
