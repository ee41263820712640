#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace larder {

// The part of an asset a request's Range header asks for. One range is
// served as asked; several ranges, or a header that cannot be read, are
// ignored in favour of the whole asset, as HTTP allows.
struct ByteRange {
  enum class Kind { Whole, Partial, Unsatisfiable };

  Kind kind = Kind::Whole;
  std::uint64_t first = 0;
  std::uint64_t length = 0;

  // `header` is the Range header's value, empty when there is none.
  static ByteRange select(std::string_view header, std::uint64_t size);

  // "bytes first-last/size" for a partial answer, "bytes */size" for an
  // unsatisfiable one.
  [[nodiscard]] std::string contentRange(std::uint64_t size) const;
};

}  // namespace larder
