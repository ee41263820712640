#pragma once

#include <cstddef>
#include <cstdint>

#include "dmap/DAAPBuffer.h"

namespace larder {

// Writes a container whose size is not known ahead: the header goes out
// at once with size 0, and the size is mended when the scope ends, so that
// scopes nest like the containers they write. For documents whose parts
// are counted as they are written (the reference store's answers); a
// client that knows its sizes writes them directly.
class DAAPContainerScope {
 public:
  DAAPContainerScope(DAAPBuffer& buffer, std::uint32_t code)
      : buffer_(buffer), sizeOffset_(buffer.appendHeader(code, 0)), start_(buffer.length()) {}
  ~DAAPContainerScope() {
    buffer_.mendSize(sizeOffset_, static_cast<std::uint32_t>(buffer_.length() - start_));
  }
  DAAPContainerScope(const DAAPContainerScope&) = delete;
  DAAPContainerScope& operator=(const DAAPContainerScope&) = delete;

 private:
  DAAPBuffer& buffer_;
  std::size_t sizeOffset_;
  std::size_t start_;
};

}  // namespace larder
