#pragma once

#include <cstdint>
#include <optional>

namespace larder {

// What a document's top-level code asks for: which response parser reads
// its value, and so which kind of result the document gives. The parser
// dispatches on it, and whoever checks a result against its code reads the
// same list.
enum class DAAPResponseKind : std::uint8_t {
  ListingHeader,      // a dictionary
  ListingItem,        // an item
  Speakers,           // an array
  ListingCollection,  // an array
  ControlPrompts,     // a dictionary
  Properties,         // a dictionary
  ContentCodes,       // an array
  Error,              // a dictionary, or nothing
  Login,              // a session number, or nothing
  ServerInfo,         // a dictionary
  Acknowledgement,    // nothing: the code is known and carries no result
};

// The kind of response `code` names; nullopt for a code that names none.
std::optional<DAAPResponseKind> daapResponseKind(std::uint32_t code);

}  // namespace larder
