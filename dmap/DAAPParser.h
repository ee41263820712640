#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "dmap/DAAPItem.h"
#include "dmap/DAAPReceiver.h"
#include "dmap/DAAPTagReader.h"
#include "dmap/DAAPTagTables.h"
#include "dmap/DAAPValue.h"

namespace larder {

// Reads DMAP, the tagged binary stream of the cloud library service. A
// document is one top-level tag whose code picks the parse operation; each
// operation walks one container and gives every tag it knows its key.
//
// The input comes from the network, so the parser trusts no length it is
// given: every value is a span that lies inside its container and inside
// the document, nesting is bounded, allocations are bounded by the size
// of the document, and nothing throws. A tag that cannot be read is
// logged and skipped; at worst a document gives no result. The parser
// holds no state, so any thread may use it.
class DAAPParser {
 public:
  using Bytes = std::span<const std::uint8_t>;

  // Listings inside listing items (`cmvl`) nest at most this deep; a deeper
  // one is logged and skipped.
  static constexpr int kMaxListingDepth = 16;
  // Largest document taken: its length must fit the wire's signed 32 bits.
  static constexpr std::size_t kMaxDocumentSize = 0x7fffffff;

  static DAAPParser& sharedInstance();

  // The parsed document, or nothing.
  static DAAPValue decodeData(Bytes data);
  static DAAPValue decodeHexString(std::string_view hexadecimal);
  static std::string_view typeForDRCPValueType(std::uint32_t type);

  // Frame (the value of the top-level tag and its code).
  [[nodiscard]] DAAPValue processResponseCode(std::uint32_t code, Bytes bytes) const;
  void unknownCode(std::uint32_t code, Bytes bytes) const;

  // Decoders of one value.
  [[nodiscard]] std::optional<std::string> parseUTF8String(Bytes bytes) const;
  [[nodiscard]] std::optional<std::string> parseUnicodeCharacter(Bytes bytes) const;
  [[nodiscard]] DAAPValue processXMLContent(Bytes bytes) const;
  // Eight bytes big-endian. A shorter value is read as a big-endian number
  // of its own width, a longer one by its first eight bytes.
  [[nodiscard]] std::uint64_t SwapInt64BigToHost(
      Bytes bytes) const;  // NOLINT(readability-identifier-naming)

  [[nodiscard]] DAAPArray processFlavors(Bytes bytes) const;
  [[nodiscard]] DAAPDictionary processFlavor(Bytes bytes) const;
  void parseDict(Bytes bytes, const DAAPReceiver& receiver) const;

  // Typed setters: check the size, then store under `key`, or log and
  // store nothing.
  void setBool(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const;
  void setSInt8(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const;
  void setUInt8(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const;
  void setSInt16(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const;
  void setUInt16(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const;
  void setDate(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const;
  void setUInt32(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const;
  void setFloat32(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const;
  void setUInt64(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const;
  void setString(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const;

  // Response parsers, one per container kind.
  [[nodiscard]] DAAPDictionary parseServerInfo(Bytes bytes) const;
  [[nodiscard]] DAAPArray parseContentCodes(Bytes bytes) const;
  [[nodiscard]] DAAPDictionary parseContentCollectionDict(Bytes bytes) const;
  [[nodiscard]] std::optional<std::int32_t> parseLogin(Bytes bytes) const;
  [[nodiscard]] std::optional<DAAPDictionary> parseError(Bytes bytes) const;
  // `depth` counts the listings around this one, for the nesting bound.
  [[nodiscard]] DAAPItemRef parseListingItem(Bytes bytes, int depth = 0) const;
  [[nodiscard]] DAAPArray parseListingCollection(Bytes bytes, std::size_t capacity,
                                                 int depth = 0) const;
  [[nodiscard]] DAAPArray parseBrowseResults(Bytes bytes) const;
  [[nodiscard]] DAAPDictionary parseListingHeader(Bytes bytes) const;
  [[nodiscard]] DAAPArray parseDeletedIDsList(Bytes bytes) const;
  [[nodiscard]] DAAPDictionary parseControlPromptCollection(Bytes bytes) const;
  [[nodiscard]] DAAPDictionary parseControlPromptResponse(Bytes bytes) const;
  [[nodiscard]] DAAPArray parseGetSpeakersResponse(Bytes bytes) const;
  [[nodiscard]] DAAPDictionary parseDACPPropertyResponse(Bytes bytes) const;
  [[nodiscard]] DAAPArray parseMACAddressListing(Bytes bytes) const;

 private:
  DAAPParser() = default;

  void setTyped(DAAPValueKind kind, Bytes bytes, const DAAPReceiver& receiver,
                const DAAPKey& key) const;
  // Stores a plain tag of `table`; false when the table doesn't know it.
  bool setFromTable(std::span<const DAAPTagEntry> table, std::uint32_t code, Bytes bytes,
                    const DAAPReceiver& receiver) const;
  // Walks a container whose tags are all plain ones of `table`.
  void walkPlainTags(Bytes bytes, std::span<const DAAPTagEntry> table,
                     const DAAPReceiver& receiver) const;
  void checkStatus(Bytes bytes) const;

  void handleListingItemTag(const DAAPTag& tag, DAAPItem& item, std::uint16_t& valueType,
                            int depth) const;
  bool handleListingItemNumbers(const DAAPTag& tag, DAAPItem& item) const;
  bool handleListingItemExtensions(const DAAPTag& tag, DAAPItem& item) const;
  bool handleListingItemControl(const DAAPTag& tag, DAAPItem& item, std::uint16_t& valueType,
                                int depth) const;
  void setControlValue(Bytes bytes, DAAPItem& item, std::uint16_t valueType) const;

  bool handlePropertyIdentifiers(const DAAPTag& tag, DAAPDictionary& result) const;
  bool handlePropertyQueue(const DAAPTag& tag, DAAPDictionary& result) const;
  void handleSecondScreen(Bytes bytes, DAAPDictionary& result) const;
};

}  // namespace larder
