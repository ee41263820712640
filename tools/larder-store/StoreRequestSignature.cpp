#include "larder-store/StoreRequestSignature.h"

#include <span>

#include "store-runtime/core/VendStringHelpers.h"
#include "store-runtime/http/VendRequestSigner.h"

namespace larder {

StoreRequestSignature::Check StoreRequestSignature::check(const httplib::Request& request,
                                                          const StoreAccounts& accounts) {
  const std::string accountHeader(VendRequestSigner::kAccountHeader);
  const std::string signatureHeader(VendRequestSigner::kSignatureHeader);
  if (!request.has_header(accountHeader) && !request.has_header(signatureHeader)) {
    return {Outcome::Absent, nullptr};
  }
  const auto accountID = unsignedDecimalNumber(request.get_header_value(accountHeader));
  const StoreAccount* account =
      accountID && *accountID != 0 ? accounts.accountWithID(*accountID) : nullptr;
  if (!account) return {Outcome::Invalid, nullptr};
  const VendRequestSigner verifier(account->signingKey);
  const std::span<const std::uint8_t> body(
      reinterpret_cast<const std::uint8_t*>(request.body.data()), request.body.size());
  const std::string expected = verifier.requestSignature(request.method, request.target, body);
  if (!VendRequestSigner::signaturesMatch(request.get_header_value(signatureHeader), expected)) {
    return {Outcome::Invalid, nullptr};
  }
  return {Outcome::Valid, account};
}

}  // namespace larder
