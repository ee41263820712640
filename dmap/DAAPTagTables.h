#pragma once

#include <cstdint>
#include <span>
#include <string_view>

namespace larder {

// How a plain tag's value is read, by the setter of that name.
enum class DAAPValueKind : std::uint8_t {
  Bool,
  SInt8,
  UInt8,
  SInt16,
  UInt16,
  UInt32,
  Float32,
  UInt64,
  Date,
  String,
};

// A tag that needs nothing but its setter: code, how to read it, key.
struct DAAPTagEntry {
  std::uint32_t code = 0;
  DAAPValueKind kind = DAAPValueKind::UInt32;
  std::string_view key;
};

// The compiled-in vocabulary of the response parsers: for each container
// that has plain tags, the code-to-key table. Tags with handling of their
// own stay in the parser; these tables hold only what a typed setter
// stores as it stands. Each table is sorted by code at compile time.
class DAAPTagTables {
 public:
  static std::span<const DAAPTagEntry> listingHeader();
  static std::span<const DAAPTagEntry> listingItem();
  static std::span<const DAAPTagEntry> serverInfo();
  static std::span<const DAAPTagEntry> error();
  static std::span<const DAAPTagEntry> contentCollection();
  static std::span<const DAAPTagEntry> controlPromptCollection();
  static std::span<const DAAPTagEntry> dacpProperty();
  static std::span<const DAAPTagEntry> flavor();

  // The entry of `code`, or null.
  static const DAAPTagEntry* find(std::span<const DAAPTagEntry> table, std::uint32_t code);
};

}  // namespace larder
