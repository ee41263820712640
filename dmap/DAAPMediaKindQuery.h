#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace larder {

// The query text that restricts a cloud library request to some extended
// media kinds: "('com.orvane.sonorel.extended\-media\-kind:2',...)". The
// client writes it into the revision request's form body and into the
// items request (`mque`); the reference store reads it back. The hyphens
// of the key are escaped because the server reads the text as a query
// expression, in which a bare hyphen means something else.
class DAAPMediaKindQuery {
 public:
  static constexpr std::string_view kMediaKindKey = "com.orvane.sonorel.extended-media-kind";

  // Nothing for no kinds; otherwise one quoted term per kind, in order.
  static std::optional<std::string> text(std::span<const std::int64_t> kinds);

  // The kinds of a query text as `text` writes it. Nothing for text of any
  // other form (terms of another key, missing quotes or parentheses,
  // numbers that are not decimal or do not fit). At most `kMaxTerms` terms
  // are read, so that a hostile query costs little.
  static std::optional<std::vector<std::int64_t>> parse(std::string_view query);

  static constexpr std::size_t kMaxTerms = 4096;

 private:
  static std::string escapedKey();
};

}  // namespace larder
