// DMAP documents as they arrive from the network: any bytes at all. The
// parser must neither crash nor read outside the input, and whatever it
// gives back must keep its promises: the kind of result its top-level code
// names, and every listing item frozen.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <optional>
#include <span>

#include "dmap/DAAPItem.h"
#include "dmap/DAAPParser.h"
#include "dmap/DAAPResponseKind.h"

namespace {

using larder::DAAPArray;
using larder::DAAPDictionary;
using larder::DAAPItemRef;
using larder::DAAPResponseKind;
using larder::DAAPValue;

[[noreturn]] void failWith(const char* message) {
  std::fprintf(stderr, "%s\n", message);
  std::abort();
}

void checkTree(const DAAPValue& value, int depth);

void checkItem(const DAAPItemRef& item, int depth) {
  if (!item->isFrozen()) failWith("a parsed item is not frozen");
  const DAAPDictionary* info = item->additionalInfo();
  if (!info) failWith("a frozen item has no info dictionary");
  for (const auto& [key, element] : *info) checkTree(element, depth + 1);
  (void)item->dictionaryRepresentation();
  (void)item->description();
}

void checkTree(const DAAPValue& value, int depth) {
  // Listings nest at most kMaxListingDepth deep; each level adds an item, an
  // array and an info dictionary, and an embedded property list a few more.
  if (depth > 4 * larder::DAAPParser::kMaxListingDepth + 64) failWith("result nested too deep");
  if (DAAPItemRef item = value.item()) return checkItem(item, depth);
  if (const DAAPArray* array = value.array()) {
    for (const DAAPValue& element : *array) checkTree(element, depth + 1);
  }
  if (const DAAPDictionary* dictionary = value.dictionary()) {
    for (const auto& [key, element] : *dictionary) checkTree(element, depth + 1);
  }
}

enum class Promise { Dictionary, Item, Array, NumberOrNothing, DictionaryOrNothing, Nothing };

Promise promiseOf(std::uint32_t code) {
  const std::optional<DAAPResponseKind> kind = larder::daapResponseKind(code);
  if (!kind) return Promise::Nothing;
  switch (*kind) {
    case DAAPResponseKind::ListingItem:
      return Promise::Item;
    case DAAPResponseKind::Speakers:
    case DAAPResponseKind::ListingCollection:
    case DAAPResponseKind::ContentCodes:
      return Promise::Array;
    case DAAPResponseKind::Login:
      return Promise::NumberOrNothing;
    case DAAPResponseKind::Error:
      return Promise::DictionaryOrNothing;
    case DAAPResponseKind::ListingHeader:
    case DAAPResponseKind::ControlPrompts:
    case DAAPResponseKind::Properties:
    case DAAPResponseKind::ServerInfo:
      return Promise::Dictionary;
    case DAAPResponseKind::Acknowledgement:
      return Promise::Nothing;
  }
  return Promise::Nothing;
}

bool keeps(Promise promise, const DAAPValue& value) {
  switch (promise) {
    case Promise::Dictionary:
      return value.isDictionary();
    case Promise::Item:
      return value.isItem();
    case Promise::Array:
      return value.isArray();
    case Promise::NumberOrNothing:
      return value.isNull() || value.isInteger();
    case Promise::DictionaryOrNothing:
      return value.isNull() || value.isDictionary();
    case Promise::Nothing:
      return value.isNull();
  }
  return false;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::span<const std::uint8_t> bytes(data, size);
  const DAAPValue value = larder::DAAPParser::decodeData(bytes);
  if (size < 8) {
    if (!value.isNull()) failWith("a document under 8 bytes gave a result");
    return 0;
  }
  const std::uint32_t code = (std::uint32_t{data[0]} << 24) | (std::uint32_t{data[1]} << 16) |
                             (std::uint32_t{data[2]} << 8) | data[3];
  const std::uint32_t declared = (std::uint32_t{data[4]} << 24) | (std::uint32_t{data[5]} << 16) |
                                 (std::uint32_t{data[6]} << 8) | data[7];
  if (declared > size - 8) {
    if (!value.isNull()) failWith("a truncated document gave a result");
    return 0;
  }
  if (!keeps(promiseOf(code), value)) failWith("result of the wrong kind for its code");
  checkTree(value, 0);
  (void)value.toPlist();
  (void)value.description();
  return 0;
}
