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

// A localized text with its "%@" placeholders filled in order. Arguments
// are taken as they are (a name holding "%@" is not filled again); a
// placeholder without an argument is left empty, so that a wording with one
// placeholder more than its caller knows of shows no stray "%@".
std::string LedgerFormatLocalizedString(std::string_view format,
                                        std::initializer_list<std::string_view> arguments);

}  // namespace larder
