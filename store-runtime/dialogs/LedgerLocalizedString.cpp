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

std::string LedgerLocalizedFormat(std::string_view format,
                                  std::initializer_list<std::string_view> arguments) {
  std::string text;
  text.reserve(format.size());
  const std::string_view* next = arguments.begin();
  for (std::size_t i = 0; i < format.size(); ++i) {
    if (format[i] != '%' || i + 1 == format.size()) {
      text += format[i];
    } else if (format[i + 1] == '@') {
      if (next != arguments.end()) text += *next++;
      ++i;
    } else if (format[i + 1] == '%') {
      text += '%';
      ++i;
    } else {
      text += format[i];
    }
  }
  return text;
}

std::string LedgerLocalizedStringWithArguments(std::string_view key,
                                               const VendStoreClient* storeClient,
                                               std::initializer_list<std::string_view> arguments) {
  return LedgerLocalizedFormat(LedgerLocalizedString(key, storeClient), arguments);
}

}  // namespace larder
