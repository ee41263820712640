#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/value/PlistValue.h"

namespace larder {

// Decodes the "bplist00" binary property-list format.
//
// Input is untrusted: every offset, length and object reference is checked
// against the file before it is followed, containers that contain
// themselves are refused, and the limits bound nesting depth, the number of
// values produced and the string and data bytes produced. An object
// referenced from several places (a shared key string, say) is decoded into
// a copy at each place; the limits count every copy, so a small file whose
// references fan out cannot expand without bound.
//
// Text comes out as well-formed UTF-8: UTF-16 strings with unpaired
// surrogates get U+FFFD in their place, and bytes above 0x7F in 8-bit
// strings are read as Latin-1.
class BinaryPlistReader {
 public:
  static Result<PlistValue> read(std::span<const std::uint8_t> bytes,
                                 const PlistReadLimits& limits);
};

}  // namespace larder
