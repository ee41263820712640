#include "store-runtime/dialogs/LedgerLocalizedString.h"

#include "store-runtime/core/VendStoreClient.h"

namespace larder {

std::string LedgerLocalizedStringFromTableInBundle(std::string_view key,
                                                   std::optional<std::string_view> table,
                                                   const LocalizedStringBundle& bundle,
                                                   std::string_view defaultValue,
                                                   const VendStoreClient* storeClient) {
  std::optional<std::int64_t> clientType;
  if (storeClient) clientType = storeClient->clientType();
  if (std::optional<std::string> text = bundle.textForKey(key, table, clientType)) return *text;
  return std::string(defaultValue.empty() ? key : defaultValue);
}

std::string LedgerLocalizedString(std::string_view key, const VendStoreClient* storeClient) {
  return LedgerLocalizedStringFromTableInBundle(
      key, std::nullopt, LocalizedStringBundle::tradelineFramework(), "", storeClient);
}

std::string LedgerFormatLocalizedString(std::string_view format,
                                        std::initializer_list<std::string_view> arguments) {
  constexpr std::string_view kPlaceholder = "%@";
  std::string text;
  text.reserve(format.size());
  const std::string_view* next = arguments.begin();
  std::size_t start = 0;
  for (std::size_t found = format.find(kPlaceholder); found != std::string_view::npos;
       found = format.find(kPlaceholder, start)) {
    text += format.substr(start, found - start);
    if (next != arguments.end()) text += *next++;
    start = found + kPlaceholder.size();
  }
  text += format.substr(start);
  return text;
}

}  // namespace larder
