#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/value/PlistValue.h"
#include "store-runtime/core/VendStoreClient.h"

namespace larder {

// The launcher bar: icons of products being installed, placeholders for
// applications still downloading, and progress messages. This platform has
// no launcher bar the service can talk to, so everything is recorded in
// "<root>/var/lib/larder-platform/dock.plist":
//
//   icons         dictionary "<client>/<identifier>" -> { identifier, url,
//                 storeClient, date, location (when a copy was made) }
//   placeholders  dictionary name -> { identifier, iconData, date }
//   messages      dictionary product key (else title) -> { productKey,
//                 title, status, date }: the last message of each update
//
// An icon URL is not fetched; a "file://" URL or an absolute path is
// copied to LedgerIconLocationForIdentifier, so that the placeholder code
// finds it there.
class LedgerDockMessaging {
 public:
  static LedgerDockMessaging& sharedInstance();

  void loadIconForProductID(std::uint64_t productID, std::string_view url,
                            const VendStoreClient& storeClient);
  void loadIconForIdentifier(std::string_view identifier, std::string_view url,
                             const VendStoreClient& storeClient);
  void createPlaceholderWithName(std::string_view name, std::int64_t identifier,
                                 const PlistData& iconData);
  void removePlaceholderWithName(std::string_view name);
  // `update` and `status` are the wire dictionaries of the OS update and of
  // its software update status.
  void sendMessageForUpdate(const PlistDictionary& update, const PlistDictionary& status);

  static std::string stateFilePath();

 private:
  LedgerDockMessaging() = default;
};

}  // namespace larder
