#pragma once

#include <string>
#include <string_view>

#include "larder-store/StoreItem.h"
#include "platform/value/PlistValue.h"

namespace larder {

// The property lists the store answers with. URLs are absolute, made from
// `baseURL` ("http://host:port"), which the server takes from the host the
// client asked, so that the answers hold whatever port the store runs on.
class StoreAnswers {
 public:
  static constexpr std::string_view kBagPath = "/bag.plist";
  static constexpr std::string_view kAuthenticatePath = "/authenticate";
  static constexpr std::string_view kBuyProductPath = "/buy-product";
  static constexpr std::string_view kItemLookupPath = "/lookup";
  static constexpr std::string_view kAssetsPrefix = "/assets/";
  static constexpr std::string_view kPreflightPrefix = "/preflight/";
  static constexpr std::string_view kUpdateCheckPath = "/available-software-updates";
  static constexpr std::string_view kOrvaneIDLookupPath = "/orvane-id-lookup";
  static constexpr std::string_view kInvitationsPrefix = "/invitations/";
  static constexpr std::string_view kRequestsPath = "/_larder/requests";
  static constexpr std::string_view kSignedRequestsPath = "/_larder/signed-requests";

  // The store's own entries and then `extras`, which win; an extra string
  // that begins with "/" is a path on this store and becomes absolute.
  static PlistDictionary bag(std::string_view baseURL, const PlistDictionary& extras);
  // One download of a purchase answer.
  static PlistDictionary download(const StoreItem& item, std::string_view baseURL);
  // One entry of "results" of an item lookup.
  static PlistDictionary lookupResult(const StoreItem& item);
  static PlistDictionary preflight(const StoreItem& item);
  static PlistDictionary failure(std::string_view failureType, std::string_view customerMessage);

  static std::string assetURL(std::string_view baseURL, const StoreItem& item,
                              std::string_view fileName);
  // `text` with the characters that mean something in a regular expression
  // escaped.
  static std::string regexEscaped(std::string_view text);
};

}  // namespace larder
