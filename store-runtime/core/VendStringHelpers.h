#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace larder {

// "~" and "~/..." against the home folder of the process's user as the
// user database has it, not $HOME (which a confined or test environment
// may point elsewhere); "~name/..." against that user's home. Anything
// else, and a "~name" of an unknown user, is returned unchanged.
std::string stringByExpandingTildeInPathOutsideOfSandbox(std::string_view path);

// `url` with `text` added to its query: after "?" when the URL has no
// query yet, after "&" when it has one (no separator is doubled), and in
// front of a "#fragment", which stays last. A leading "?" or "&" of `text`
// is dropped; empty text leaves the URL as it is.
std::string urlByAddingStringToQueryString(std::string_view url, std::string_view text);

// `text` as one name or value of a URL query: every byte but letters,
// digits and "-._~" percent-encoded.
std::string percentEncodedQueryComponent(std::string_view text);

// Bytes as lower-case hexadecimal, two digits a byte: how digests and
// signatures are written.
std::string hexString(std::span<const std::uint8_t> bytes);

// The value of one hexadecimal digit of either case, or -1.
int hexDigitValue(char digit);

// The whole text as an unsigned decimal number: no sign, no spaces, no
// trailing characters, no overflow; nullopt otherwise.
std::optional<std::uint64_t> unsignedDecimalNumber(std::string_view text);

}  // namespace larder
