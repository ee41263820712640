#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/error/Result.h"
#include "platform/value/PlistValue.h"

namespace larder {

class DAAPBuffer;

// One item of the cloud library: an entry of a revision's "items" in
// library.plist, written as one `mlit` listing item.
//   id (cloud id, > 0) and name are required;
//   token (purchased token, default the revision that lists the entry),
//   media-kind, pre-order, and the text, number and date fields of
//   docs/store.md are optional.
struct StoreLibraryItem {
  std::uint64_t cloudID = 0;
  std::uint32_t token = 0;
  std::optional<std::int64_t> mediaKind;
  bool preorder = false;
  // The entry's fields that go on the wire, checked.
  PlistDictionary fields;

  // An error of kErrorDomain says what is malformed.
  static constexpr std::string_view kErrorDomain = "StoreLibraryItem";
  static Result<StoreLibraryItem> fromDictionary(const PlistValue& entry, std::uint32_t revision);

  // Appends the item as one `mlit` container.
  void writeTo(DAAPBuffer& buffer) const;

 private:
  void writeFlavor(DAAPBuffer& buffer) const;
};

}  // namespace larder
