#include "store-runtime/http/VendStoreAnswer.h"

#include "platform/plist/PropertyListSerialization.h"

namespace larder {

VendError VendStoreAnswer::error(std::int64_t code, std::string description) {
  VendError error;
  error.domain = std::string(kErrorDomain);
  error.code = code;
  error.description = std::move(description);
  return error;
}

std::optional<PlistValue> VendStoreAnswer::propertyList(std::span<const std::uint8_t> body,
                                                        OptionalError* error) {
  auto parsed = PropertyListSerialization::read(body);
  if (!parsed && error) {
    *error =
        VendStoreAnswer::error(kNotPropertyList, "The store's answer is not a property list (" +
                                                     parsed.errorDescription() + ")");
  }
  return parsed;
}

std::optional<PlistDictionary> VendStoreAnswer::dictionary(std::span<const std::uint8_t> body,
                                                           OptionalError* error) {
  auto parsed = propertyList(body, error);
  if (!parsed) return std::nullopt;
  if (const PlistDictionary* dictionary = parsed->dictionary()) return *dictionary;
  if (error) *error = VendStoreAnswer::error(kWrongShape, "The store's answer is not a dictionary");
  return std::nullopt;
}

VendError VendStoreAnswer::failure(const VendURLResponse& response,
                                   std::span<const std::uint8_t> body) {
  VendError failure = error(
      response.statusCode, "The store answered with status " + std::to_string(response.statusCode));
  const auto parsed = PropertyListSerialization::read(body);
  if (!parsed) return failure;
  if (const std::string* type = (*parsed)["failureType"].string()) {
    failure.userInfo["failureType"] = *type;
    failure.description += " (" + *type + ")";
  }
  if (const std::string* message = (*parsed)["customerMessage"].string())
    failure.description = *message;
  return failure;
}

}  // namespace larder
