#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"
#include "store-runtime/http/VendURLRequest.h"
#include "store-runtime/http/VendURLResponse.h"

namespace larder {

// The store's signatures, shared by the service and the reference store:
// HMAC-SHA256 under the key that the store gave the account at sign-in.
//   request: over  METHOD "\n" PATH-AND-QUERY "\n" BODY
//   answer:  over  STATUS "\n" BODY
// carried as lower-case hex in "X-Larder-Signature", with the account in
// "X-Larder-Account-ID".
class VendRequestSigner {
 public:
  static constexpr std::string_view kSignatureHeader = "X-Larder-Signature";
  static constexpr std::string_view kAccountHeader = "X-Larder-Account-ID";

  explicit VendRequestSigner(PlistData key) : key_(std::move(key)) {}

  [[nodiscard]] std::string requestSignature(std::string_view method, std::string_view pathAndQuery,
                                             std::span<const std::uint8_t> body) const;
  [[nodiscard]] std::string answerSignature(long statusCode,
                                            std::span<const std::uint8_t> body) const;

  // Adds both headers to the request.
  void sign(VendURLRequest& request, std::uint64_t accountID) const;
  // The body when the answer carries this key's signature over it.
  [[nodiscard]] std::optional<PlistData> verifiedBody(const VendURLResponse& response,
                                                      std::span<const std::uint8_t> body) const;
  // Constant-time comparison of two hex signatures.
  static bool signaturesMatch(std::string_view a, std::string_view b);

  // "/path?query" of an absolute URL ("/" when the URL has no path).
  static std::string pathAndQuery(std::string_view url);

 private:
  [[nodiscard]] std::string hmac(std::span<const std::uint8_t> message) const;

  PlistData key_;
};

}  // namespace larder
