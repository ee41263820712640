#pragma once

#include <optional>
#include <span>
#include <string_view>

namespace larder {

// One text of a string table. Format arguments are written "%@", whatever
// their type, in the order the caller passes them.
struct LocalizedStringEntry {
  std::string_view key;
  std::string_view text;
};

// The English texts of the store client framework, sorted by key.
std::span<const LocalizedStringEntry> tradelineStringTable();
// The book client's wording where it differs from the table above, sorted
// by key.
std::span<const LocalizedStringEntry> bookClientStringOverrides();

// The text of `key` in a sorted table.
std::optional<std::string_view> findLocalizedText(std::span<const LocalizedStringEntry> table,
                                                  std::string_view key);

}  // namespace larder
