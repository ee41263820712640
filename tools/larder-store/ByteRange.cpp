#include "larder-store/ByteRange.h"
#include "store-runtime/core/VendStringHelpers.h"

#include <algorithm>
#include <charconv>
#include <optional>

namespace larder {
namespace {

std::string_view trimmed(std::string_view text) {
  while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) text.remove_prefix(1);
  while (!text.empty() && (text.back() == ' ' || text.back() == '\t')) text.remove_suffix(1);
  return text;
}

ByteRange whole(std::uint64_t size) {
  return {ByteRange::Kind::Whole, 0, size};
}

ByteRange unsatisfiable() {
  return {ByteRange::Kind::Unsatisfiable, 0, 0};
}

ByteRange partial(std::uint64_t first, std::uint64_t last) {
  return {ByteRange::Kind::Partial, first, last - first + 1};
}

// "-n": the last n bytes.
ByteRange suffix(std::string_view count, std::uint64_t size) {
  const auto bytes = unsignedDecimalNumber(count);
  if (!bytes) return whole(size);
  if (*bytes == 0 || size == 0) return unsatisfiable();
  return partial(size - std::min(*bytes, size), size - 1);
}

}  // namespace

ByteRange ByteRange::select(std::string_view header, std::uint64_t size) {
  header = trimmed(header);
  constexpr std::string_view kUnit = "bytes=";
  if (!header.starts_with(kUnit)) return whole(size);
  const std::string_view ranges = trimmed(header.substr(kUnit.size()));
  const auto dash = ranges.find('-');
  if (ranges.find(',') != std::string_view::npos || dash == std::string_view::npos) {
    return whole(size);
  }
  if (dash == 0) return suffix(ranges.substr(1), size);
  const auto first = unsignedDecimalNumber(ranges.substr(0, dash));
  const std::string_view lastText = ranges.substr(dash + 1);
  const auto last =
      lastText.empty() ? std::optional<std::uint64_t>(UINT64_MAX) : unsignedDecimalNumber(lastText);
  if (!first || !last || *last < *first) return whole(size);
  if (*first >= size) return unsatisfiable();
  return partial(*first, std::min(*last, size - 1));
}

std::string ByteRange::contentRange(std::uint64_t size) const {
  if (kind == Kind::Unsatisfiable) return "bytes */" + std::to_string(size);
  return "bytes " + std::to_string(first) + "-" + std::to_string(first + length - 1) + "/" +
         std::to_string(size);
}

}  // namespace larder
