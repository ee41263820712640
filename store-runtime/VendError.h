#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/PlistValue.h"

namespace larder {

inline constexpr std::string_view VendErrorDomain = "VendErrorDomain";

// A failure as it travels through completion handlers and over the bus:
// domain, code and a description for people. Code -128 means cancelled.
struct VendError {
  static constexpr std::int64_t kCancelledCode = -128;

  std::string domain{VendErrorDomain};
  std::int64_t code = 0;
  std::string description;
  PlistDictionary userInfo;

  [[nodiscard]] bool isCancellation() const { return code == kCancelledCode; }
  [[nodiscard]] std::string descriptionText() const;  // for log lines

  // The wire form: { domain, code, description } plus user info entries.
  [[nodiscard]] PlistDictionary toDictionary() const;
  static std::optional<VendError> fromDictionary(const PlistDictionary& dictionary);

  friend bool operator==(const VendError&, const VendError&) = default;
};

using OptionalError = std::optional<VendError>;

}  // namespace larder
