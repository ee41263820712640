#include "dmap/DAAPMediaKindQuery.h"

#include <charconv>

namespace larder {
namespace {

// Reads one "'<key>:<number>'" term from the front of `rest`.
std::optional<std::int64_t> takeTerm(std::string_view& rest, std::string_view key) {
  if (!rest.starts_with('\'')) return std::nullopt;
  rest.remove_prefix(1);
  if (!rest.starts_with(key)) return std::nullopt;
  rest.remove_prefix(key.size());
  if (!rest.starts_with(':')) return std::nullopt;
  rest.remove_prefix(1);
  const auto quote = rest.find('\'');
  if (quote == std::string_view::npos || quote == 0) return std::nullopt;
  const std::string_view digits = rest.substr(0, quote);
  std::int64_t kind = 0;
  const auto [end, error] = std::from_chars(digits.data(), digits.data() + digits.size(), kind);
  if (error != std::errc() || end != digits.data() + digits.size()) return std::nullopt;
  rest.remove_prefix(quote + 1);
  return kind;
}

}  // namespace

std::string DAAPMediaKindQuery::escapedKey() {
  std::string escaped;
  for (const char c : kMediaKindKey) {
    if (c == '-') escaped += '\\';
    escaped += c;
  }
  return escaped;
}

std::optional<std::string> DAAPMediaKindQuery::text(std::span<const std::int64_t> kinds) {
  if (kinds.empty()) return std::nullopt;
  const std::string key = escapedKey();
  std::string query = "(";
  for (std::size_t index = 0; index < kinds.size(); ++index) {
    if (index > 0) query += ',';
    query += '\'';
    query += key;
    query += ':';
    query += std::to_string(kinds[index]);
    query += '\'';
  }
  query += ')';
  return query;
}

std::optional<std::vector<std::int64_t>> DAAPMediaKindQuery::parse(std::string_view query) {
  if (!query.starts_with('(') || !query.ends_with(')')) return std::nullopt;
  std::string_view rest = query.substr(1, query.size() - 2);
  const std::string key = escapedKey();
  std::vector<std::int64_t> kinds;
  while (kinds.size() < kMaxTerms) {
    const auto kind = takeTerm(rest, key);
    if (!kind) return std::nullopt;
    kinds.push_back(*kind);
    if (rest.empty()) return kinds;
    if (!rest.starts_with(',')) return std::nullopt;
    rest.remove_prefix(1);
  }
  return std::nullopt;
}

}  // namespace larder
