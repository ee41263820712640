#pragma once

#include <optional>
#include <span>
#include <string_view>

#include "platform/error/VendError.h"
#include "platform/value/PlistValue.h"
#include "store-runtime/http/VendURLResponse.h"

namespace larder {

// How the runtime reads what a store sends back: property lists in XML or
// binary form, failures as HTTP statuses with an optional
// { failureType, customerMessage } dictionary.
class VendStoreAnswer {
 public:
  static constexpr std::string_view kErrorDomain = "VendStoreErrorDomain";
  enum Code : std::int64_t {
    kNotPropertyList = -1,
    kWrongShape = -2,
    kNoStore = -3,
    kBadSignature = -4,
    kNotSignedIn = -5,
    // A purchase answer that delivers another item than the one bought.
    kWrongItem = -6,
  };

  // The parsed answer, or an error that says why there is none.
  static std::optional<PlistValue> propertyList(std::span<const std::uint8_t> body,
                                                OptionalError* error);
  // A dictionary answer, or an error of code kWrongShape.
  static std::optional<PlistDictionary> dictionary(std::span<const std::uint8_t> body,
                                                   OptionalError* error);
  // The error of a failed HTTP answer: code = status, description from
  // the store's customer message when it sent one.
  static VendError failure(const VendURLResponse& response, std::span<const std::uint8_t> body);
  // An error of the store domain.
  static VendError error(std::int64_t code, std::string description);
};

}  // namespace larder
