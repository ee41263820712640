#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>

#include "platform/value/PlistValue.h"

namespace larder {

// A gzip-format (RFC 1952) compressed copy of `data`; nullopt when the
// compressor fails. Empty input gives a valid, empty gzip stream.
std::optional<PlistData> VendCopyGzippedDataForData(std::span<const std::uint8_t> data);

// The inverse, for bodies that arrive compressed. nullopt for anything that
// is not exactly one complete gzip stream (damaged, truncated, trailing
// bytes) and for output larger than `maxOutputBytes`, so that a small hostile
// body cannot make us allocate without bound.
std::optional<PlistData> VendCopyGunzippedDataForData(std::span<const std::uint8_t> data,
                                                      std::size_t maxOutputBytes = 64u << 20u);

}  // namespace larder
