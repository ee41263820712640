#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"

namespace larder {

inline constexpr std::string_view VendErrorDomain = "VendErrorDomain";

// A failure as it travels through completion handlers and over the bus:
// domain, code and a description for people. Code -128 means cancelled.
struct VendError {
  static constexpr std::int64_t kCancelledCode = -128;
  static constexpr std::int64_t kNotAuthorizedCode = 4;
  static constexpr std::int64_t kAlreadyInstalledCode = 7;
  static constexpr std::int64_t kNotEnoughDiskSpaceCode = 11;
  static constexpr std::int64_t kNoUniqueTaggedUpdateCode = 27;
  static constexpr std::int64_t kURLBagKeyMissingCode = 30;

  // User info keys that keep the two texts an error was made from.
  static constexpr std::string_view kTitleKey = "VendErrorTitle";
  static constexpr std::string_view kMessageKey = "VendErrorMessage";

  std::string domain{VendErrorDomain};
  std::int64_t code = 0;
  std::string description;
  PlistDictionary userInfo;

  // An error of VendErrorDomain from a code, a title and a message, each
  // text optional. The description is the message, else the title, else
  // empty; both texts are kept in the user info.
  static VendError make(std::int64_t code, std::optional<std::string> title = std::nullopt,
                        std::optional<std::string> message = std::nullopt);
  // An error of any domain from a code and a message, without title.
  static VendError withDomain(std::string domain, std::int64_t code,
                              std::optional<std::string> message = std::nullopt);

  // The errors of VendErrorDomain that the service makes, with their texts.
  static VendError cancelledByUser();       // -128
  static VendError notAuthorized();         // 4
  static VendError alreadyInstalled();      // 7, "Skipping download"
  static VendError notEnoughDiskSpace();    // 11
  static VendError noUniqueTaggedUpdate();  // 27, no texts
  static VendError urlBagKeyMissing();      // 30

  [[nodiscard]] std::optional<std::string> title() const;
  [[nodiscard]] std::optional<std::string> message() const;

  [[nodiscard]] bool isCancellation() const { return code == kCancelledCode; }
  [[nodiscard]] std::string descriptionText() const;  // for log lines

  // The wire form: { domain, code, description } plus user info entries.
  [[nodiscard]] PlistDictionary toDictionary() const;
  static std::optional<VendError> fromDictionary(const PlistDictionary& dictionary);

  friend bool operator==(const VendError&, const VendError&) = default;
};

using OptionalError = std::optional<VendError>;

}  // namespace larder
