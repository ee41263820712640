#pragma once

#include <initializer_list>
#include <optional>
#include <string>
#include <string_view>

#include "store-runtime/dialogs/LocalizedStringBundle.h"

namespace larder {

class VendStoreClient;

// The text of `key` in `bundle`, as the store client words it (the book
// client has wording of its own for a few texts). A key without text gives
// `defaultValue`, and when that is empty the key itself. Safe from any
// thread.
std::string LedgerLocalizedStringFromTableInBundle(std::string_view key,
                                                   std::optional<std::string_view> table,
                                                   const LocalizedStringBundle& bundle,
                                                   std::string_view defaultValue,
                                                   const VendStoreClient* storeClient);

// The usual call: no table, no default, the store client framework.
std::string LedgerLocalizedString(std::string_view key, const VendStoreClient* storeClient);

// A localised format with its arguments put in: each "%@" takes the next
// argument, "%%" is a percent sign. Missing arguments leave nothing; extra
// ones are ignored, so a translation that drops a placeholder still reads.
std::string LedgerLocalizedFormat(std::string_view format,
                                  std::initializer_list<std::string_view> arguments);

// The text of `key` with its arguments put in.
std::string LedgerLocalizedStringWithArguments(std::string_view key,
                                               const VendStoreClient* storeClient,
                                               std::initializer_list<std::string_view> arguments);

}  // namespace larder
