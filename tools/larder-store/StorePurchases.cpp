#include "larder-store/StorePurchases.h"

#include <charconv>

#include "larder-store/StoreAnswers.h"
#include "larder-store/StoreRequestSignature.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "store-runtime/core/VendStringHelpers.h"

namespace larder {
namespace {

std::optional<std::uint64_t> positiveNumber(std::string_view text) {
  auto value = unsignedDecimalNumber(text);
  if (value == 0U) return std::nullopt;
  return value;
}

StoreReply failure(int status, std::string_view type, std::string_view message) {
  return {status, StoreAnswers::failure(type, message), std::nullopt};
}

}  // namespace

std::optional<std::string_view> StorePurchases::queryValue(std::string_view query,
                                                           std::string_view key) {
  while (!query.empty()) {
    const auto ampersand = query.find('&');
    const std::string_view pair = query.substr(0, ampersand);
    const auto equals = pair.find('=');
    if (pair.substr(0, equals) == key) {
      return equals == std::string_view::npos ? std::string_view() : pair.substr(equals + 1);
    }
    if (ampersand == std::string_view::npos) break;
    query.remove_prefix(ampersand + 1);
  }
  return std::nullopt;
}

std::optional<std::uint64_t> StorePurchases::itemIdentifierOf(const PlistValue& purchase) {
  const PlistValue& identifier = purchase["itemIdentifier"];
  if ((identifier.isInteger() || identifier.isString()) && identifier.uint64Value() > 0) {
    return identifier.uint64Value();
  }
  const std::string* buyParams = purchase["buyParams"].string();
  if (!buyParams) return std::nullopt;
  for (std::string_view key : {"itemId", "salableWareId"}) {
    const auto value = queryValue(*buyParams, key);
    if (const auto number = value ? positiveNumber(*value) : std::nullopt) return number;
  }
  return std::nullopt;
}

StoreReply StorePurchases::buy(const httplib::Request& request, std::string_view baseURL) const {
  const auto signature = StoreRequestSignature::check(request, catalogue_.accounts());
  const StoreAccount* signer = signature.signer;
  if (signature.outcome == StoreRequestSignature::Outcome::Invalid) {
    TILL_LOG(2, "%@: refusing a purchase with a bad signature", "StorePurchases");
    return failure(401, "invalid-signature", "The request's signature is not valid.");
  }
  StoreReply reply = [&] {
    const auto purchase = PropertyListSerialization::read(request.body);
    const auto identifier =
        purchase && purchase->isDictionary() ? itemIdentifierOf(*purchase) : std::nullopt;
    if (!identifier) {
      return failure(400, "invalid-request", "The purchase names no item.");
    }
    const StoreItem* item = catalogue_.itemWithID(*identifier);
    if (!item) return failure(404, "unknown-item", "This item is not in the store.");
    if (!signer && !item->accountLess) {
      return failure(401, "invalid-signature", "Sign in to buy this item.");
    }
    TILL_LOG(2, "%@: purchase of %llu (%@)", "StorePurchases",
             static_cast<unsigned long long>(item->wareID), item->bundleID);
    return StoreReply{
        200, PlistDictionary{{"downloads", PlistArray{StoreAnswers::download(*item, baseURL)}}},
        std::nullopt};
  }();
  if (signer) reply.signingKey = signer->signingKey;
  return reply;
}

}  // namespace larder
