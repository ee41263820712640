#pragma once

#include <cstdint>

#include "platform/value/PlistValue.h"

namespace larder {

// Seconds between 1970-01-01 and 2001-01-01, the epoch of property-list dates.
inline constexpr double kPlistDateEpochOffset = 978307200.0;

// Encodes values in the "bplist00" binary property-list format.
//
// Encoding is linear in the size of the value: objects are numbered in one
// breadth-first pass and written in a second, and equal strings, integers
// and booleans are stored once (dictionary keys repeat across records, so
// this keeps catalogues small). Null values inside containers are skipped;
// a null root is written as an empty dictionary.
class BinaryPlistWriter {
 public:
  static PlistData write(const PlistValue& root);
};

}  // namespace larder
