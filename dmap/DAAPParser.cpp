#include "dmap/DAAPParser.h"

#include <algorithm>
#include <chrono>

#include "dmap/DAAPBytes.h"
#include "dmap/DAAPCode.h"
#include "dmap/DAAPDocumentBudget.h"
#include "dmap/DAAPResponseKind.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/PropertyListSerialization.h"
#include "platform/plist/Utf8.h"
#include "store-runtime/core/VendStringHelpers.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "DAAPParser";
constexpr std::uint32_t kStatusOK = 200;
constexpr std::size_t kHeadersCapacity = 30;
// An unknown tag's value is shown as text up to this many bytes: enough to
// recognise it, not enough for one tag to flood the log.
constexpr std::size_t kMaxLoggedValueBytes = 256;
constexpr std::string_view kBogusDateKey = "daap.songdatereleased";

using Bytes = DAAPParser::Bytes;

DAAPKey key(std::string_view literal) {
  return DAAPKey::literal(literal);
}

std::optional<std::string> decodedUTF8(Bytes bytes) {
  const std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
  if (!isWellFormedUtf8(text)) return std::nullopt;
  return std::string(text);
}

// The value of an unknown tag as log text: up to its first zero byte, and
// printable ASCII only, so that network bytes can't break the line.
std::string loggedValueText(Bytes bytes) {
  std::string text;
  for (const std::uint8_t byte : bytes.first(std::min(bytes.size(), kMaxLoggedValueBytes))) {
    if (byte == 0) break;
    text += byte >= 0x20 && byte < 0x7f ? static_cast<char>(byte) : '.';
  }
  return text;
}

// The first four bytes as a code; missing bytes count as zero.
std::uint32_t leadingCode(Bytes bytes) {
  const std::size_t width = std::min<std::size_t>(bytes.size(), 4);
  return static_cast<std::uint32_t>(DAAPBytes::bigEndianUnchecked(bytes.data(), width)
                                    << (8 * (4 - width)));
}

// Four bytes to a group, as a data value is shown.
std::string hexDescription(const PlistData& data) {
  const std::span<const std::uint8_t> bytes(data);
  std::string text = "<";
  for (std::size_t index = 0; index < bytes.size(); index += 4) {
    if (index > 0) text += ' ';
    text += hexString(bytes.subspan(index, std::min<std::size_t>(4, bytes.size() - index)));
  }
  return text + ">";
}

// A pair read as base 16 up to its first non-digit, as the C library reads
// numbers: "4z" is 4, "zz" is 0.
std::uint8_t hexPairValue(char high, char low) {
  const int first = hexDigitValue(high);
  if (first < 0) return 0;
  const int second = hexDigitValue(low);
  return static_cast<std::uint8_t>(second < 0 ? first : first * 16 + second);
}

// Text read as a signed 64-bit number the way a string's `longLongValue`
// reads it: leading blanks, a sign, digits, saturating; no digits is 0.
std::int64_t leadingInteger(std::string_view text) {
  return PlistValue(text).int64Value();
}

bool isNonEmpty(const DAAPValue& value) {
  if (const std::string* text = value.string()) return !text->empty();
  if (const DAAPArray* array = value.array()) return !array->empty();
  if (const DAAPDictionary* dictionary = value.dictionary()) return !dictionary->empty();
  if (const PlistData* data = value.data()) return !data->empty();
  return !value.isNull();
}

// Embedded property lists are small; these bounds keep a hostile one from
// costing more than its share of the document's budget or a deep stack.
PlistReadLimits embeddedPlistLimits(std::size_t listSize) {
  PlistReadLimits limits;
  limits.maxBytes =
      std::min(std::size_t{16} * 1024 * 1024, DAAPDocumentBudget::remaining(listSize));
  limits.maxDepth = 32;
  limits.maxObjects = 65536;
  return limits;
}

}  // namespace

DAAPParser& DAAPParser::sharedInstance() {
  static DAAPParser parser;  // made once, on first use, by any thread
  return parser;
}

DAAPValue DAAPParser::decodeData(Bytes data) {
  if (data.size() > kMaxDocumentSize) {
    TILL_LOG(3, "%@: DMAPParser parseStream: document of %lu bytes is too large", kSpeaker,
             data.size());
    return {};
  }
  const auto length = static_cast<std::int32_t>(data.size());
  if (length < static_cast<std::int32_t>(DAAPTagReader::kHeaderSize)) return {};
  const std::uint32_t code = DAAPTagReader::readUInt32(data.data());
  const std::uint32_t size = DAAPTagReader::readUInt32(data.data() + 4);
  const std::int32_t present = length - static_cast<std::int32_t>(DAAPTagReader::kHeaderSize);
  if (size > static_cast<std::uint32_t>(present)) {
    TILL_LOG(3, "%@: DMAPParser parseStream: got %d bytes; expected %ld; code '%c%c%c%c'", kSpeaker,
             present, size, DAAPCode::character(code, 0), DAAPCode::character(code, 1),
             DAAPCode::character(code, 2), DAAPCode::character(code, 3));
    return {};
  }
  const DAAPDocumentBudget budget(data.size());
  return sharedInstance().processResponseCode(code, data.subspan(DAAPTagReader::kHeaderSize, size));
}

DAAPValue DAAPParser::decodeHexString(std::string_view hexadecimal) {
  std::string digits;
  digits.reserve(hexadecimal.size());
  for (const char c : hexadecimal) {
    if (c != ' ' && c != '\t' && c != '\n' && c != '\r') digits += c;
  }
  PlistData data;
  data.reserve(digits.size() / 2);
  for (std::size_t index = 0; index + 1 < digits.size(); index += 2) {
    data.push_back(hexPairValue(digits[index], digits[index + 1]));
  }
  TILL_LOG(3, "%@: Converted command: %@", kSpeaker, hexDescription(data));
  return decodeData(data);
}

std::string_view DAAPParser::typeForDRCPValueType(std::uint32_t type) {
  switch (type) {
    case 1:
      return "boolean";
    case 3:
      return "uint32";
    case 4:
      return "float";
    case 5:
      return "indexed";
    case 6:
      return "keyed";
    case 7:
      return "string";
    case 12:
      return "group";
    case 13:
      return "action";
    case 14:
      return "node";
    case 15:
      return "item";
    case 16:
      return "image";
    case 18:
      return "point";
    case 19:
      return "dpad";
    case 20:
      return "touch";
    default:
      return "undefined";
  }
}

DAAPValue DAAPParser::processResponseCode(std::uint32_t code, Bytes bytes) const {
  const std::optional<DAAPResponseKind> kind = daapResponseKind(code);
  if (!kind) {
    unknownCode(code, bytes);
    return {};
  }
  switch (*kind) {
    case DAAPResponseKind::ListingHeader:
      return parseListingHeader(bytes);
    case DAAPResponseKind::ListingItem:
      return parseListingItem(bytes);
    case DAAPResponseKind::Speakers:
      return parseGetSpeakersResponse(bytes);
    case DAAPResponseKind::ListingCollection:
      return parseListingCollection(bytes, 0);
    case DAAPResponseKind::ControlPrompts:
      return parseControlPromptResponse(bytes);
    case DAAPResponseKind::Properties:
      return parseDACPPropertyResponse(bytes);
    case DAAPResponseKind::ContentCodes:
      return parseContentCodes(bytes);
    case DAAPResponseKind::Error: {
      std::optional<DAAPDictionary> error = parseError(bytes);
      return error ? DAAPValue(std::move(*error)) : DAAPValue();
    }
    case DAAPResponseKind::Login: {
      const std::optional<std::int32_t> session = parseLogin(bytes);
      return session ? DAAPValue(std::int64_t{*session}) : DAAPValue();
    }
    case DAAPResponseKind::ServerInfo:
      return parseServerInfo(bytes);
    case DAAPResponseKind::Acknowledgement:
      return {};
  }
  return {};
}

void DAAPParser::unknownCode(std::uint32_t code, Bytes bytes) const {
  if (code == "aeMX"_dmap) {
    TILL_LOG(3, "%@: xmlcode!", kSpeaker);
    return;
  }
  const std::size_t size = bytes.size();
  switch (size) {
    case 1:
      TILL_LOG(3, "%@: Unknown code: '%@', size=%ld, value=%u", kSpeaker, DAAPCode::text(code),
               size, bytes[0]);
      return;
    case 2:
      TILL_LOG(3, "%@: Unknown code: '%@', size=%ld, value=%u", kSpeaker, DAAPCode::text(code),
               size, *DAAPBytes::hostOrderAt<std::uint16_t>(bytes, 0));
      return;
    case 4:
      TILL_LOG(3, "%@: Unknown code: '%@', size=%ld, value=0x%x", kSpeaker, DAAPCode::text(code),
               size, *DAAPBytes::hostOrderAt<std::uint32_t>(bytes, 0));
      return;
    case 0:
    case 8:
      TILL_LOG(3, "%@: Unknown code: '%@', size=%ld", kSpeaker, DAAPCode::text(code), size);
      return;
    default:
      TILL_LOG(3, "%@: Unknown code: '%@', size=%ld, value=%s", kSpeaker, DAAPCode::text(code),
               size, loggedValueText(bytes));
      return;
  }
}

std::optional<std::string> DAAPParser::parseUTF8String(Bytes bytes) const {
  if (bytes.empty() || (bytes.size() == 1 && bytes[0] == 0)) return std::string();
  return decodedUTF8(bytes);
}

std::optional<std::string> DAAPParser::parseUnicodeCharacter(Bytes bytes) const {
  if (bytes.size() != 2) return std::nullopt;
  const std::uint16_t unit = *DAAPBytes::uint16At(bytes, 0);
  if (unit >= 0xD800 && unit <= 0xDFFF) return std::nullopt;  // half a pair is no character
  std::string text;
  appendUtf8(text, unit);
  return text;
}

DAAPValue DAAPParser::processXMLContent(Bytes bytes) const {
  if (bytes.empty()) return {};
  const auto plist = PropertyListSerialization::read(bytes, embeddedPlistLimits(bytes.size()));
  if (!plist) {
    TILL_LOG(3, "%@: Attempting to process XML response: %@", kSpeaker, plist.errorDescription());
    return {};
  }
  DAAPDocumentBudget::charge(*plist);
  return DAAPValue::fromPlist(*plist);
}

std::uint64_t DAAPParser::SwapInt64BigToHost(Bytes bytes) const {
  return DAAPBytes::bigEndianUnchecked(bytes.data(), std::min<std::size_t>(bytes.size(), 8));
}

DAAPArray DAAPParser::processFlavors(Bytes bytes) const {
  const std::uint32_t first = leadingCode(bytes);
  if (bytes.size() < 4 || first != "aeif"_dmap) {
    DAAPDictionary flavor = processFlavor(bytes);
    if (!flavor.empty()) return DAAPArray{DAAPValue(std::move(flavor))};
    TILL_LOG(3, "%@: Flavor doesn't look correct like the correct size.", kSpeaker);
    unknownCode(first, bytes);
    return {};
  }
  DAAPArray flavors;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    flavors.emplace_back(processFlavor(tag->value));  // every child is a flavor, whatever its code
  }
  return flavors;
}

DAAPDictionary DAAPParser::processFlavor(Bytes bytes) const {
  DAAPDictionary flavor;
  walkPlainTags(bytes, DAAPTagTables::flavor(), flavor);
  return flavor;
}

void DAAPParser::parseDict(Bytes bytes, const DAAPReceiver& receiver) const {
  static constexpr std::string_view kPairKey = "key";
  static constexpr std::string_view kPairValue = "value";
  DAAPDictionary pair;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code == "mdvl"_dmap) {
      setString(tag->value, pair, key(kPairValue));
    } else if (tag->code == "mdky"_dmap) {
      setString(tag->value, pair, key(kPairKey));
    }
    const std::string* pairKey = lookup(pair, kPairKey).string();
    const DAAPValue& pairValue = lookup(pair, kPairValue);
    if (pairKey && !pairValue.isNull()) {
      receiver.setValue(pairValue, DAAPKey(*pairKey));
      pair.clear();
    }
  }
}

void DAAPParser::setBool(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const {
  const std::size_t size = bytes.size();
  if (size != 1 && size != 2 && size != 4 && size != 8) {
    TILL_LOG(3, "%@: setBool being passed a %ld byte value for: <%@>!", kSpeaker, size, key);
    return;
  }
  // Only the first byte counts, whatever the width.
  receiver.setObject(bytes[0] != 0, key);
}

void DAAPParser::setSInt8(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const {
  if (bytes.size() != 1) {
    TILL_LOG(3, "%@: setSInt8 being passed a %ld byte value for: <%@>!", kSpeaker, bytes.size(),
             key);
    return;
  }
  receiver.setObject(std::int64_t{static_cast<std::int8_t>(bytes[0])}, key);
}

void DAAPParser::setUInt8(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const {
  if (bytes.size() != 1) {
    TILL_LOG(3, "%@: setUInt8 being passed a %ld byte value for: <%@>!", kSpeaker, bytes.size(),
             key);
    return;
  }
  receiver.setObject(std::int64_t{bytes[0]}, key);
}

void DAAPParser::setSInt16(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const {
  if (bytes.size() != 2) {
    TILL_LOG(3, "%@: setSInt16 being passed a %ld byte value for: <%@>!", kSpeaker, bytes.size(),
             key);
    return;
  }
  receiver.setObject(std::int64_t{static_cast<std::int16_t>(*DAAPBytes::uint16At(bytes, 0))}, key);
}

void DAAPParser::setUInt16(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const {
  if (bytes.size() != 2) {
    TILL_LOG(3, "%@: setUInt16 being passed a %ld byte value for: <%@>!", kSpeaker, bytes.size(),
             key);
    return;
  }
  receiver.setObject(std::int64_t{*DAAPBytes::uint16At(bytes, 0)}, key);
}

void DAAPParser::setDate(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const {
  if (bytes.size() != 4) {
    TILL_LOG(3, "%@: setDate being passed a %ld byte value for: <%@>!", kSpeaker, bytes.size(),
             key);
    return;
  }
  const PlistDate date{static_cast<double>(*DAAPBytes::uint32At(bytes, 0))};
  if (key == kBogusDateKey) {
    const double now =
        std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
    if (date.secondsSince1970 > now) {
      TILL_LOG(3, "%@: skipping bogus date:%@ for %@", kSpeaker, DAAPValue(date), key);
      return;
    }
  }
  receiver.setObject(date, key);
}

void DAAPParser::setUInt32(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const {
  if (bytes.size() != 4) {
    TILL_LOG(3, "%@: setUInt32 being passed a %ld byte value for: <%@>!", kSpeaker, bytes.size(),
             key);
    return;
  }
  receiver.setObject(std::int64_t{*DAAPBytes::uint32At(bytes, 0)}, key);
}

void DAAPParser::setFloat32(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const {
  if (bytes.size() != 4) {
    TILL_LOG(3, "%@: setFloat32 being passed a %ld byte value for: <%@>!", kSpeaker, bytes.size(),
             key);
    return;
  }
  // The one value the wire carries in the sender's byte order.
  receiver.setObject(static_cast<double>(*DAAPBytes::hostOrderAt<float>(bytes, 0)), key);
}

void DAAPParser::setUInt64(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const {
  if (bytes.size() != 8) {
    TILL_LOG(3, "%@: setUInt64 being passed a %ld byte value for: <%@>!", kSpeaker, bytes.size(),
             key);
    return;
  }
  receiver.setObject(DAAPValue(SwapInt64BigToHost(bytes)), key);
}

void DAAPParser::setString(Bytes bytes, const DAAPReceiver& receiver, const DAAPKey& key) const {
  if (bytes.empty()) return;
  // Through setValue: text that isn't UTF-8 clears what the key held.
  std::optional<std::string> text = parseUTF8String(bytes);
  receiver.setValue(text ? DAAPValue(std::move(*text)) : DAAPValue(), key);
}

void DAAPParser::setTyped(DAAPValueKind kind, Bytes bytes, const DAAPReceiver& receiver,
                          const DAAPKey& key) const {
  switch (kind) {
    case DAAPValueKind::Bool:
      return setBool(bytes, receiver, key);
    case DAAPValueKind::SInt8:
      return setSInt8(bytes, receiver, key);
    case DAAPValueKind::UInt8:
      return setUInt8(bytes, receiver, key);
    case DAAPValueKind::SInt16:
      return setSInt16(bytes, receiver, key);
    case DAAPValueKind::UInt16:
      return setUInt16(bytes, receiver, key);
    case DAAPValueKind::UInt32:
      return setUInt32(bytes, receiver, key);
    case DAAPValueKind::Float32:
      return setFloat32(bytes, receiver, key);
    case DAAPValueKind::UInt64:
      return setUInt64(bytes, receiver, key);
    case DAAPValueKind::Date:
      return setDate(bytes, receiver, key);
    case DAAPValueKind::String:
      return setString(bytes, receiver, key);
  }
}

bool DAAPParser::setFromTable(std::span<const DAAPTagEntry> table, std::uint32_t code, Bytes bytes,
                              const DAAPReceiver& receiver) const {
  const DAAPTagEntry* entry = DAAPTagTables::find(table, code);
  if (!entry) return false;
  setTyped(entry->kind, bytes, receiver, key(entry->key));
  return true;
}

void DAAPParser::walkPlainTags(Bytes bytes, std::span<const DAAPTagEntry> table,
                               const DAAPReceiver& receiver) const {
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (!setFromTable(table, tag->code, tag->value, receiver)) unknownCode(tag->code, tag->value);
  }
}

void DAAPParser::checkStatus(Bytes bytes) const {
  const std::optional<std::uint32_t> status = DAAPBytes::uint32At(bytes, 0);
  if (status && *status != kStatusOK) {
    TILL_LOG(3, "%@: DMAP returned status code %u", kSpeaker, *status);
  }
}

// Response parsers.

DAAPDictionary DAAPParser::parseServerInfo(Bytes bytes) const {
  DAAPDictionary info;
  if (bytes.data() == nullptr || bytes.empty()) return info;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code == "msml"_dmap) {
      DAAPReceiver(info).setValue(parseMACAddressListing(tag->value), key("macAddresses"));
    } else if (!setFromTable(DAAPTagTables::serverInfo(), tag->code, tag->value, info)) {
      unknownCode(tag->code, tag->value);
    }
  }
  return info;
}

DAAPArray DAAPParser::parseContentCodes(Bytes bytes) const {
  DAAPArray codes;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code == "mdcl"_dmap) {
      codes.emplace_back(parseContentCollectionDict(tag->value));
    } else if (tag->code == "mstt"_dmap) {
      checkStatus(tag->value);
    } else {
      unknownCode(tag->code, tag->value);
    }
  }
  return codes;
}

DAAPDictionary DAAPParser::parseContentCollectionDict(Bytes bytes) const {
  DAAPDictionary entry;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code == "mcty"_dmap) {
      // Two bytes whatever the length says; a shorter value has no type.
      if (const std::optional<std::uint16_t> type = DAAPBytes::uint16At(tag->value, 0)) {
        entry.insert_or_assign(key("dmap.contentcodestype"), std::int64_t{*type});
      }
    } else if (!setFromTable(DAAPTagTables::contentCollection(), tag->code, tag->value, entry)) {
      unknownCode(tag->code, tag->value);
    }
  }
  return entry;
}

std::optional<std::int32_t> DAAPParser::parseLogin(Bytes bytes) const {
  std::optional<std::int32_t> session;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code == "mlid"_dmap) {
      if (const std::optional<std::uint32_t> identifier = DAAPBytes::uint32At(tag->value, 0)) {
        session = static_cast<std::int32_t>(*identifier);
      }
    } else if (tag->code == "mstt"_dmap) {
      checkStatus(tag->value);
    } else {
      unknownCode(tag->code, tag->value);
    }
  }
  return session;
}

std::optional<DAAPDictionary> DAAPParser::parseError(Bytes bytes) const {
  if (bytes.size() < 9) return std::nullopt;
  DAAPDictionary error;
  walkPlainTags(bytes, DAAPTagTables::error(), error);
  return error;
}

DAAPItemRef DAAPParser::parseListingItem(Bytes bytes, int depth) const {
  DAAPItemRef item = DAAPItem::item();
  std::uint16_t valueType = 0;  // set by `cmvt`, read by the `cval` after it
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    handleListingItemTag(*tag, *item, valueType, depth);
  }
  item->freeze();
  return item;
}

void DAAPParser::handleListingItemTag(const DAAPTag& tag, DAAPItem& item, std::uint16_t& valueType,
                                      int depth) const {
  if (setFromTable(DAAPTagTables::listingItem(), tag.code, tag.value, item)) return;
  if (handleListingItemNumbers(tag, item)) return;
  if (handleListingItemExtensions(tag, item)) return;
  if (handleListingItemControl(tag, item, valueType, depth)) return;
  unknownCode(tag.code, tag.value);
}

// The hot fields and the numbers whose width varies.
bool DAAPParser::handleListingItemNumbers(const DAAPTag& tag, DAAPItem& item) const {
  const Bytes value = tag.value;
  const auto setText = [&](auto setter) {
    if (!value.empty()) (item.*setter)(parseUTF8String(value));
  };
  switch (tag.code) {
    case "miid"_dmap:
      if (value.size() == 8) item.setItemID(SwapInt64BigToHost(value));
      if (value.size() == 4) item.setItemID(*DAAPBytes::uint32At(value, 0));
      return true;
    case "minm"_dmap:
      setText(&DAAPItem::setName);
      return true;
    case "asal"_dmap:
      setText(&DAAPItem::setSongalbum);
      return true;
    case "asar"_dmap:
      setText(&DAAPItem::setSongartist);
      return true;
    case "asaa"_dmap:
      setText(&DAAPItem::setSongalbumartist);
      return true;
    case "asai"_dmap:
      item.setSongalbumid(SwapInt64BigToHost(value));
      return true;
    case "mcti"_dmap:
      if (const auto identifier = DAAPBytes::uint32At(value, 0))
        item.setContainerItemID(*identifier);
      return true;
    case "mdst"_dmap:
      if (const auto status = DAAPBytes::uint8At(value, 0)) item.setDownloadStatus(*status);
      return true;
    case "mpco"_dmap:
      if (value.size() == 8) setUInt64(value, item, key("dmap.parentcontainerid"));
      if (value.size() == 4) setUInt32(value, item, key("dmap.parentcontainerid"));
      return true;
    case "aeMk"_dmap:
      if (value.size() == 4) setUInt32(value, item, key("com.orvane.sonorel.extended-media-kind"));
      if (value.size() == 1) setUInt8(value, item, key("com.orvane.sonorel.extended-media-kind"));
      return true;
    case "aeSI"_dmap:
      if (value.size() == 8) {
        item.setObject(DAAPValue(SwapInt64BigToHost(value)), key("com.orvane.sonorel.orms-songid"));
      }
      if (value.size() == 4) setUInt32(value, item, key("com.orvane.sonorel.orms-songid"));
      return true;
    case "aeHC"_dmap:
      if (DAAPBytes::uint8At(value, 0) == 1) {
        setUInt8(value, item, key("com.orvane.sonorel.has-chapter-data"));
      }
      return true;
    case "aeHV"_dmap:
      if (DAAPBytes::uint8At(value, 0) == 1)
        setUInt8(value, item, key("com.orvane.sonorel.has-video"));
      return true;
    case "aeCS"_dmap:
      if (value.size() == 4) {
        item.setObject(std::to_string(*DAAPBytes::uint32At(value, 0)),
                       key("com.orvane.sonorel.artworkchecksum"));
      } else {
        std::optional<std::string> text = parseUTF8String(value);
        item.setValue(text ? DAAPValue(std::move(*text)) : DAAPValue(),
                      key("com.orvane.sonorel.artworkchecksum"));
      }
      return true;
    default:
      return false;
  }
}

// Nested values, embedded data, and the tags an item knows but ignores.
bool DAAPParser::handleListingItemExtensions(const DAAPTag& tag, DAAPItem& item) const {
  const Bytes value = tag.value;
  switch (tag.code) {
    case "mdcl"_dmap:
      parseDict(value, item);
      return true;
    case "aefl"_dmap:
      item.setObject(processFlavors(value), key("com.orvane.sonorel.item-flavor-listing"));
      return true;
    case "aeMX"_dmap: {
      DAAPValue movieInfo = processXMLContent(value);
      if (movieInfo.isDictionary()) {
        item.setObject(std::move(movieInfo), key("com.orvane.sonorel.movie-info-xml"));
      }
      return true;
    }
    case "pfdt"_dmap:
      item.setObject(PlistData(value.begin(), value.end()), key("fileData"));
      return true;
    case "mshc"_dmap: {
      std::optional<std::string> character = parseUnicodeCharacter(value);
      item.setValue(character ? DAAPValue(std::move(*character)) : DAAPValue(),
                    key("headerItemCharacter"));
      return true;
    }
    case "ceQW"_dmap:
      setUInt32(value, item, key("com.orvane.sonorel.playqueue-warning-threshold"));
      TILL_LOG(3, "%@: **QUEUE** kExtDACPAddToPlayQueueWarningThresholdCodeNameStr, %@", kSpeaker,
               item.objectForKey("com.orvane.sonorel.playqueue-warning-threshold"));
      return true;
    case "mlit"_dmap:  // a listing item never nests another one directly
    case "aePI"_dmap:
    case "aeTr"_dmap:
    case "asdk"_dmap:
    case "cmik"_dmap:
      return true;
    default:
      return false;
  }
}

// The remote-control vocabulary: a listing as context, a volume, and a
// typed value whose type comes from the `cmvt` before it.
bool DAAPParser::handleListingItemControl(const DAAPTag& tag, DAAPItem& item,
                                          std::uint16_t& valueType, int depth) const {
  const Bytes value = tag.value;
  switch (tag.code) {
    case "cmvl"_dmap:
      if (depth >= kMaxListingDepth) {
        TILL_LOG(3, "%@: listing nested deeper than %d levels; '%@' skipped", kSpeaker,
                 kMaxListingDepth, DAAPCode::text(tag.code));
        return true;
      }
      item.setObject(parseListingCollection(value, 0, depth + 1), key("context"));
      return true;
    case "cmvo"_dmap:
      if (const auto volume = DAAPBytes::uint32At(value, 0)) {
        item.setObject(static_cast<double>(static_cast<float>(*volume / 100.0)), key("volume"));
      }
      return true;
    case "cmvt"_dmap:
      if (value.size() == 2) {
        valueType = *DAAPBytes::uint16At(value, 0);
        item.setObject(std::string(typeForDRCPValueType(valueType)), key("type"));
      }
      return true;
    case "cval"_dmap:
      setControlValue(value, item, valueType);
      return true;
    default:
      return false;
  }
}

void DAAPParser::setControlValue(Bytes bytes, DAAPItem& item, std::uint16_t valueType) const {
  const DAAPKey valueKey = key("value");
  switch (valueType) {
    case 1:
      return setBool(bytes, item, valueKey);
    case 2:
      return setUInt16(bytes, item, valueKey);
    case 3:
      return setUInt32(bytes, item, valueKey);
    case 4:
      return setFloat32(bytes, item, valueKey);
    case 5:
    case 6:
    case 7:
      return setString(bytes, item, valueKey);
    default:
      return;  // no type yet, or one without a value encoding
  }
}

DAAPArray DAAPParser::parseListingCollection(Bytes bytes, std::size_t capacity, int depth) const {
  DAAPArray items;
  // The hint comes off the wire: never reserve more items than the bytes
  // could hold.
  items.reserve(std::min(capacity, bytes.size() / DAAPTagReader::kHeaderSize));
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code == "mlit"_dmap) {
      items.emplace_back(parseListingItem(tag->value, depth));
    } else if (tag->code != "mstt"_dmap) {
      unknownCode(tag->code, tag->value);
    }
  }
  return items;
}

DAAPArray DAAPParser::parseBrowseResults(Bytes bytes) const {
  DAAPArray items;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code != "mlit"_dmap) {
      unknownCode(tag->code, tag->value);
      continue;
    }
    DAAPItemRef item = DAAPItem::item();
    item->setName(decodedUTF8(tag->value));
    item->freeze();
    items.emplace_back(std::move(item));
  }
  return items;
}

DAAPDictionary DAAPParser::parseListingHeader(Bytes bytes) const {
  DAAPDictionary header;
  std::size_t capacityHint = 0;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    const Bytes value = tag->value;
    switch (tag->code) {
      case "mrco"_dmap:
        setUInt32(value, header, key("dmap.returnedcount"));
        if (value.size() == 4) capacityHint = *DAAPBytes::uint32At(value, 0);
        break;
      case "mlcl"_dmap:
        header.insert_or_assign(key("dmap.listing"), parseListingCollection(value, capacityHint));
        break;
      case "mshl"_dmap:
        header.insert_or_assign(key("headers"), parseListingCollection(value, kHeadersCapacity));
        break;
      case "mudl"_dmap:
        header.insert_or_assign(key("dmap.deletedidlisting"), parseDeletedIDsList(value));
        break;
      case "abal"_dmap:
      case "abar"_dmap:
      case "abcp"_dmap:
      case "abgn"_dmap:
        header.insert_or_assign(key("items"), parseBrowseResults(value));
        break;
      default:
        if (!setFromTable(DAAPTagTables::listingHeader(), tag->code, value, header)) {
          unknownCode(tag->code, value);
        }
    }
  }
  return header;
}

DAAPArray DAAPParser::parseDeletedIDsList(Bytes bytes) const {
  static constexpr std::string_view kLongItemID = "dmap.longitemid";
  DAAPArray identifiers;
  DAAPDictionary scratch;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code != "mild"_dmap) {
      unknownCode(tag->code, tag->value);
      continue;
    }
    setUInt64(tag->value, scratch, key(kLongItemID));
    const DAAPValue& identifier = lookup(scratch, kLongItemID);
    if (!identifier.isNull()) identifiers.push_back(identifier);
    scratch.clear();
  }
  return identifiers;
}

DAAPDictionary DAAPParser::parseControlPromptCollection(Bytes bytes) const {
  DAAPDictionary prompt;
  walkPlainTags(bytes, DAAPTagTables::controlPromptCollection(), prompt);
  return prompt;
}

DAAPDictionary DAAPParser::parseControlPromptResponse(Bytes bytes) const {
  DAAPDictionary response;
  DAAPArray prompts;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code == "mdcl"_dmap) {
      prompts.emplace_back(parseControlPromptCollection(tag->value));
    } else if (tag->code == "miid"_dmap) {
      if (tag->value.size() == 4) {
        setUInt32(tag->value, response, key("dmap.itemid"));
      } else {
        setUInt64(tag->value, response, key("dmap.itemid"));
      }
    } else if (tag->code == "mstt"_dmap) {
      checkStatus(tag->value);
    } else {
      unknownCode(tag->code, tag->value);
    }
  }
  if (!prompts.empty()) response.insert_or_assign(key("items"), std::move(prompts));
  return response;
}

DAAPArray DAAPParser::parseGetSpeakersResponse(Bytes bytes) const {
  DAAPArray speakers;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code == "mdcl"_dmap) {
      speakers.emplace_back(parseListingItem(tag->value));
    } else if (tag->code == "mstt"_dmap) {
      checkStatus(tag->value);
    } else {
      unknownCode(tag->code, tag->value);
    }
  }
  return speakers;
}

DAAPDictionary DAAPParser::parseDACPPropertyResponse(Bytes bytes) const {
  DAAPDictionary properties;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (setFromTable(DAAPTagTables::dacpProperty(), tag->code, tag->value, properties)) continue;
    if (handlePropertyIdentifiers(*tag, properties)) continue;
    if (handlePropertyQueue(*tag, properties)) continue;
    unknownCode(tag->code, tag->value);
  }
  return properties;
}

// The now-playing identifiers, the volume, and the tags whose handling
// differs from a listing item's.
bool DAAPParser::handlePropertyIdentifiers(const DAAPTag& tag, DAAPDictionary& result) const {
  static constexpr std::string_view kNowPlayingKeys[] = {
      "databaseID", "com.orvane.sonorel.orms-playlistid", "dmap.containeritemid", "dmap.itemid"};
  const Bytes value = tag.value;
  switch (tag.code) {
    case "canp"_dmap:
    case "capl"_dmap: {
      // Four numbers whatever the length says; only those wholly inside
      // the value are read.
      const std::size_t width = tag.code == "canp"_dmap ? 4 : 8;
      for (std::size_t index = 0; index < 4; ++index) {
        if (!DAAPBytes::has(value, index * width, width)) break;
        const std::uint64_t number =
            DAAPBytes::bigEndianUnchecked(value.data() + index * width, width);
        result.insert_or_assign(key(kNowPlayingKeys[index]), DAAPValue(number));
      }
      return true;
    }
    case "cmvo"_dmap:
      if (const auto volume = DAAPBytes::uint32At(value, 0)) {
        result.insert_or_assign(key("volume"),
                                static_cast<double>(static_cast<float>(*volume / 100.0)));
      }
      return true;
    case "aeHC"_dmap:
      if (DAAPBytes::uint8At(value, 0) == 1) {
        setUInt8(value, result, key("com.orvane.sonorel.has-chapter-data"));
      }
      return true;
    case "aeCS"_dmap:
      if (value.size() == 4) {
        result.insert_or_assign(key("com.orvane.sonorel.artworkchecksum"),
                                std::to_string(*DAAPBytes::uint32At(value, 0)));
      } else if (const std::optional<std::string> text = parseUTF8String(value)) {
        result.insert_or_assign(key("com.orvane.sonorel.artworkchecksum"), leadingInteger(*text));
      }
      return true;
    case "ceSD"_dmap:
      handleSecondScreen(value, result);
      return true;
    case "casu"_dmap:
      return true;
    default:
      return false;
  }
}

bool DAAPParser::handlePropertyQueue(const DAAPTag& tag, DAAPDictionary& result) const {
  const Bytes value = tag.value;
  const std::size_t size = value.size();
  switch (tag.code) {
    case "ceQu"_dmap:
      if (DAAPBytes::uint8At(value, 0) == 1) {
        setUInt8(value, result, key("com.orvane.sonorel.playqueue-mode"));
        TILL_LOG(3, "%@: **QUEUE** kExtDACPPlayQueueModeCode: YES", kSpeaker);
      } else {
        TILL_LOG(3, "%@: **QUEUE** kExtDACPPlayQueueModeCode: NO", kSpeaker);
      }
      return true;
    case "ceMQ"_dmap:
      if (DAAPBytes::uint8At(value, 0) == 1) {
        setUInt8(value, result, key("com.orvane.sonorel.manually-queued"));
        TILL_LOG(3, "%@: **QUEUE** kExtDACPItemManuallyQueuedCode: YES", kSpeaker);
      } else {
        TILL_LOG(3, "%@: **QUEUE** kExtDACPItemManuallyQueuedCode: NO", kSpeaker);
      }
      return true;
    case "ceNQ"_dmap:
      setUInt32(value, result, key("com.orvane.sonorel.num-manually-queued"));
      TILL_LOG(3, "%@: **QUEUE** kExtDACPNumManuallyQueuedTracksCode, %@", kSpeaker,
               lookup(result, "com.orvane.sonorel.num-manually-queued"));
      return true;
    case "ceQF"_dmap:
      setString(value, result, key("com.orvane.sonorel.active-queue-feed-name"));
      TILL_LOG(3, "%@: **QUEUE** kExtDACPActiveQueueFeedNameCode, %@", kSpeaker,
               lookup(result, "com.orvane.sonorel.active-queue-feed-name"));
      return true;
    case "ceQW"_dmap:
      setUInt32(value, result, key("com.orvane.sonorel.playqueue-warning-threshold"));
      TILL_LOG(3, "%@: **QUEUE** kExtDACPAddToPlayQueueWarningThresholdCodeNameStr, %@", kSpeaker,
               lookup(result, "com.orvane.sonorel.playqueue-warning-threshold"));
      return true;
    case "ceQI"_dmap:
      TILL_LOG(3, "%@: **QUEUE** kExtDACPQueueIndexCode, size:%ld", kSpeaker, size);
      return true;
    case "ceQn"_dmap:
      TILL_LOG(3, "%@: **QUEUE** kExtDACPPlayQueueNameCode, size:%ld", kSpeaker, size);
      return true;
    case "ceQr"_dmap:
      TILL_LOG(3, "%@: **QUEUE** kExtDACPPlayQueueArtistCode, size:%ld", kSpeaker, size);
      return true;
    case "ceQa"_dmap:
      TILL_LOG(3, "%@: **QUEUE** kExtDACPPlayQueueAlbumCode, size:%ld", kSpeaker, size);
      return true;
    case "ceQg"_dmap:
      TILL_LOG(3, "%@: **QUEUE** kExtDACPPlayQueueGenreCode, size:%ld", kSpeaker, size);
      return true;
    case "ceQs"_dmap:
      TILL_LOG(3, "%@: **QUEUE** kExtDACPPlayQueueSpecCode, size:%ld", kSpeaker, size);
      return true;
    default:
      return false;
  }
}

void DAAPParser::handleSecondScreen(Bytes bytes, DAAPDictionary& result) const {
  const DAAPValue info = processXMLContent(bytes);
  if (!info.isDictionary()) return;
  if (const DAAPValue& ware = info["id"]; isNonEmpty(ware)) {
    result.insert_or_assign(key("secondScreenWareID"), ware);
  }
  if (const DAAPValue& url = info["url"]; isNonEmpty(url)) {
    result.insert_or_assign(key("secondScreenURL"), url);
  }
}

DAAPArray DAAPParser::parseMACAddressListing(Bytes bytes) const {
  DAAPArray addresses;
  DAAPTagReader reader(bytes);
  while (const std::optional<DAAPTag> tag = reader.next()) {
    if (tag->code == "msma"_dmap) {
      addresses.emplace_back(SwapInt64BigToHost(tag->value));
    } else {
      unknownCode(tag->code, tag->value);
    }
  }
  return addresses;
}

}  // namespace larder
