#include "platform/plist/PropertyListSerialization.h"

#include <plist/plist.h>

#include <cmath>
#include <cstdlib>
#include <limits>
#include <memory>
#include <string_view>

#include "platform/plist/BinaryPlistReader.h"
#include "platform/plist/BinaryPlistWriter.h"
#include "platform/plist/Utf8.h"

namespace larder {

namespace {

constexpr std::string_view kBinaryMagic = "bplist00";
constexpr std::string_view kBinaryFamilyMagic = "bplist";

// Ownership of what libplist hands out.
struct PlistNodeDeleter {
  void operator()(void* node) const { plist_free(node); }
};
using PlistNode = std::unique_ptr<void, PlistNodeDeleter>;

struct MallocDeleter {
  void operator()(void* memory) const {
    std::free(memory);
  }  // NOLINT(cppcoreguidelines-no-malloc,cppcoreguidelines-owning-memory): libplist allocates with
     // malloc
};
using MallocString = std::unique_ptr<char, MallocDeleter>;
using MallocIterator = std::unique_ptr<void, MallocDeleter>;

struct XmlTextDeleter {
  void operator()(char* text) const { plist_to_xml_free(text); }
};
using XmlText = std::unique_ptr<char, XmlTextDeleter>;

VendError malformed(std::string message) {
  return PropertyListSerialization::readError(PropertyListSerialization::kMalformedCode,
                                              std::move(message));
}

VendError beyondLimits(std::string message) {
  return PropertyListSerialization::readError(PropertyListSerialization::kLimitCode,
                                              std::move(message));
}

PlistNode parseXmlDocument(std::string_view xml) {
  plist_t node = nullptr;
  plist_from_xml(xml.data(), static_cast<std::uint32_t>(xml.size()), &node);
  return PlistNode(node);
}

// libplist keeps integers in 64 bits with a width marker and has no
// accessor for it; comparing against a node it parsed from the unsigned
// decimal tells "above INT64_MAX" apart from "negative".
bool isUnsignedAboveInt64(plist_t node, std::uint64_t bits) {
  const PlistNode reference =
      parseXmlDocument("<plist><integer>" + std::to_string(bits) + "</integer></plist>");
  return reference && plist_compare_node_value(node, reference.get()) != 0;
}

// libplist's XML parser is iterative but its plist_free recurses once per
// nesting level, so a deep enough document would overflow the stack when the
// tree is released. This pass finds the nesting depth before libplist builds
// anything. It tokenizes the way libplist does: where a search starts, which
// searches step over double-quoted runs (processing instructions, DOCTYPE,
// attributes) and which do not (comments, CDATA, text). Every opening
// container tag counts and a closing tag only where libplist also closes a
// container, so up to the point where libplist gives up on a document the
// estimate is never below the depth of the tree it has built.
class XmlNestingScanner {
 public:
  explicit XmlNestingScanner(std::string_view xml) : xml_(xml) {}

  bool exceeds(std::size_t maxDepth) {
    std::size_t depth = 0;
    while ((position_ = xml_.find('<', position_)) != npos) {
      const std::string_view rest = xml_.substr(position_ + 1);
      if (rest.starts_with('?')) {
        skipPast("?>", position_ + 1, kStepOverQuotes);
      } else if (rest.starts_with("!--")) {
        skipPast("-->", position_ + 4, kPlain);
      } else if (rest.starts_with("![CDATA[")) {
        skipPast("]]>", position_ + 9, kPlain);
      } else if (rest.starts_with("!DOCTYPE")) {
        skipDoctype();
      } else if (rest.starts_with('!')) {
        position_ += 2;
      } else {
        switch (readTag()) {
          case Tag::Open:
            if (++depth > maxDepth) return true;
            break;
          case Tag::Empty:  // an empty container is a level of its own
            if (depth + 1 > maxDepth) return true;
            break;
          case Tag::Close:
            if (depth > 0) --depth;
            break;
          case Tag::Other:
            break;
        }
      }
    }
    return false;
  }

 private:
  enum class Tag { Open, Empty, Close, Other };

  static constexpr std::size_t npos = std::string_view::npos;
  static constexpr bool kStepOverQuotes = true;
  static constexpr bool kPlain = false;

  // Past a double-quoted run that starts at `quote`; npos if it never ends.
  [[nodiscard]] std::size_t afterQuotedRun(std::size_t quote) const {
    const std::size_t closing = xml_.find('"', quote + 1);
    return closing == npos ? npos : closing + 1;
  }

  [[nodiscard]] std::size_t findAnyOf(std::string_view stops, std::size_t from) const {
    while (from < xml_.size()) {
      if (xml_[from] == '"') {
        from = afterQuotedRun(from);
        continue;
      }
      if (stops.find(xml_[from]) != npos) return from;
      ++from;
    }
    return npos;
  }

  [[nodiscard]] std::size_t find(std::string_view needle, std::size_t from,
                                 bool stepOverQuotes) const {
    if (!stepOverQuotes) return xml_.find(needle, from);
    while (from < xml_.size()) {
      if (xml_.substr(from).starts_with(needle)) return from;
      from = xml_[from] == '"' ? afterQuotedRun(from) : from + 1;
    }
    return npos;
  }

  void skipPast(std::string_view terminator, std::size_t from, bool stepOverQuotes) {
    const std::size_t end = find(terminator, from, stepOverQuotes);
    position_ = end == npos ? xml_.size() : end + terminator.size();
  }

  void skipDoctype() {
    const std::size_t stop = findAnyOf("[>", position_ + 9);
    if (stop == npos) {
      position_ = xml_.size();
    } else if (xml_[stop] == '[') {
      skipPast("]>", stop, kStepOverQuotes);
    } else {
      position_ = stop + 1;
    }
  }

  Tag readTag() {
    const std::size_t nameStart = position_ + 1;
    const std::size_t nameEnd = std::min(xml_.find_first_of(" \r\n\t<>", nameStart), xml_.size());
    std::string_view name = xml_.substr(nameStart, nameEnd - nameStart);
    const std::size_t tagEnd = findAnyOf("<>", nameEnd);
    if (tagEnd == npos || xml_[tagEnd] == '<') {
      position_ = xml_.size();  // libplist gives up on the document here
      return Tag::Other;
    }
    position_ = tagEnd + 1;
    const bool empty = xml_[tagEnd - 1] == '/';
    if (empty && name.ends_with('/')) name.remove_suffix(1);
    name = name.substr(0, name.find('\0'));  // libplist compares names as C strings
    if (name == "array" || name == "dict") return empty ? Tag::Empty : Tag::Open;
    if (name == "/array" || name == "/dict") return Tag::Close;
    return Tag::Other;
  }

  std::string_view xml_;
  std::size_t position_ = 0;
};

// Turns libplist's tree into ours under the caller's limits.
class LibplistTreeReader {
 public:
  explicit LibplistTreeReader(const PlistReadLimits& limits) : limits_(limits) {}

  bool convert(plist_t node, std::size_t depth, PlistValue& out) {
    if (!countObject()) return false;
    switch (plist_get_node_type(node)) {
      case PLIST_BOOLEAN: {
        std::uint8_t value = 0;
        plist_get_bool_val(node, &value);
        out = PlistValue(value != 0);
        return true;
      }
      case PLIST_UINT:
        out = integerValue(node);
        return true;
      case PLIST_REAL: {
        double value = 0;
        plist_get_real_val(node, &value);
        out = PlistValue(value);
        return true;
      }
      case PLIST_STRING:
      case PLIST_KEY:
        out = PlistValue(stringValue(node));
        return true;
      case PLIST_DATA:
        out = dataValue(node);
        return true;
      case PLIST_DATE:
        out = dateValue(node);
        return true;
      case PLIST_UID: {
        std::uint64_t value = 0;
        plist_get_uid_val(node, &value);
        out = PlistValue(PlistUid{value});
        return true;
      }
      case PLIST_ARRAY:
        return enterContainer(depth) && convertArray(node, depth, out);
      case PLIST_DICT:
        return enterContainer(depth) && convertDictionary(node, depth, out);
      default:
        return fail("unsupported node type");
    }
  }

  [[nodiscard]] const std::string& error() const { return error_; }

 private:
  bool fail(std::string message) {
    error_ = std::move(message);
    return false;
  }

  bool countObject() {
    if (objects_ >= limits_.maxObjects) {
      return fail("more than " + std::to_string(limits_.maxObjects) + " objects");
    }
    ++objects_;
    return true;
  }

  // The nesting scan normally refuses such documents before parsing; this
  // check keeps the limit even if the two ever disagree, and says so.
  bool enterContainer(std::size_t depth) {
    if (depth > limits_.maxDepth) {
      return fail("parsed tree nested deeper than " + std::to_string(limits_.maxDepth));
    }
    return true;
  }

  static PlistValue integerValue(plist_t node) {
    std::uint64_t bits = 0;
    plist_get_uint_val(node, &bits);
    if (bits > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max()) &&
        !isUnsignedAboveInt64(node, bits)) {
      return PlistValue(static_cast<std::int64_t>(bits));
    }
    return PlistValue(bits);
  }

  static std::string stringValue(plist_t node) {
    if (plist_get_node_type(node) == PLIST_KEY) {
      char* raw = nullptr;
      plist_get_key_val(node, &raw);
      const MallocString text(raw);
      return text ? toWellFormedUtf8(text.get()) : std::string();
    }
    std::uint64_t length = 0;
    const char* text = plist_get_string_ptr(node, &length);
    if (text == nullptr) return {};
    return toWellFormedUtf8(std::string_view(text, static_cast<std::size_t>(length)));
  }

  static PlistValue dataValue(plist_t node) {
    std::uint64_t length = 0;
    const auto* bytes = reinterpret_cast<const std::uint8_t*>(plist_get_data_ptr(node, &length));
    if (bytes == nullptr) return PlistValue(PlistData{});
    return PlistValue(PlistData(bytes, bytes + length));
  }

  static PlistValue dateValue(plist_t node) {
    std::int32_t seconds = 0;
    std::int32_t microseconds = 0;
    plist_get_date_val(node, &seconds, &microseconds);
    // libplist hands out the fraction of a date before 2001 without its sign.
    const double fraction = std::abs(microseconds) / 1e6;
    const double secondsSince2001 = seconds < 0 ? seconds - fraction : seconds + fraction;
    return PlistValue(PlistDate{secondsSince2001 + kPlistDateEpochOffset});
  }

  bool convertArray(plist_t node, std::size_t depth, PlistValue& out) {
    out = PlistValue(PlistArray{});
    PlistArray& elements = *out.array();
    elements.reserve(plist_array_get_size(node));
    plist_array_iter rawIterator = nullptr;
    plist_array_new_iter(node, &rawIterator);
    const MallocIterator iterator(rawIterator);
    for (;;) {
      plist_t item = nullptr;
      plist_array_next_item(node, iterator.get(), &item);
      if (item == nullptr) return true;
      if (!convert(item, depth + 1, elements.emplace_back())) return false;
    }
  }

  bool convertDictionary(plist_t node, std::size_t depth, PlistValue& out) {
    out = PlistValue(PlistDictionary{});
    PlistDictionary& entries = *out.dictionary();
    plist_dict_iter rawIterator = nullptr;
    plist_dict_new_iter(node, &rawIterator);
    const MallocIterator iterator(rawIterator);
    for (;;) {
      char* rawKey = nullptr;
      plist_t item = nullptr;
      plist_dict_next_item(node, iterator.get(), &rawKey, &item);
      const MallocString key(rawKey);
      if (item == nullptr) return true;
      if (!countObject()) return false;
      auto entry = entries.try_emplace(toWellFormedUtf8(key ? key.get() : "")).first;
      if (!convert(item, depth + 1, entry->second)) return false;
    }
  }

  const PlistReadLimits& limits_;
  std::size_t objects_ = 0;
  std::string error_;
};

// Builds libplist's tree from ours for the XML writer.
class LibplistTreeWriter {
 public:
  static PlistNode build(const PlistValue& value) {
    switch (value.type()) {
      case PlistValue::Type::Null:
        return PlistNode(plist_new_dict());
      case PlistValue::Type::Boolean:
        return PlistNode(plist_new_bool(value.boolValue() ? 1 : 0));
      // libplist prints 64-bit integers signed, which is what the bit
      // pattern of an int64 needs.
      case PlistValue::Type::Integer:
        return PlistNode(plist_new_uint(value.uint64Value()));
      case PlistValue::Type::UnsignedInteger:
        return unsignedNode(value.uint64Value());
      case PlistValue::Type::Real:
        return PlistNode(plist_new_real(value.doubleValue()));
      case PlistValue::Type::String:
        return PlistNode(plist_new_string(toWellFormedUtf8(*value.string()).c_str()));
      case PlistValue::Type::Data: {
        const PlistData& bytes = *value.data();
        return PlistNode(plist_new_data(reinterpret_cast<const char*>(bytes.data()), bytes.size()));
      }
      case PlistValue::Type::Date:
        return dateNode(value.date()->secondsSince1970);
      case PlistValue::Type::Uid:
        return PlistNode(plist_new_uid(value.uid()->value));
      case PlistValue::Type::Array:
        return arrayNode(*value.array());
      case PlistValue::Type::Dictionary:
        return dictionaryNode(*value.dictionary());
    }
    return PlistNode(plist_new_dict());
  }

 private:
  // Only a node libplist parsed itself carries the "unsigned" width mark.
  static PlistNode unsignedNode(std::uint64_t value) {
    PlistNode node =
        parseXmlDocument("<plist><integer>" + std::to_string(value) + "</integer></plist>");
    return node ? std::move(node) : PlistNode(plist_new_uint(value));
  }

  // XML dates carry whole seconds; libplist keeps them in 32 bits.
  static PlistNode dateNode(double secondsSince1970) {
    double seconds = std::floor(secondsSince1970 - kPlistDateEpochOffset);
    if (std::isnan(seconds)) seconds = 0;
    constexpr double kMin = std::numeric_limits<std::int32_t>::min();
    constexpr double kMax = std::numeric_limits<std::int32_t>::max();
    seconds = std::min(std::max(seconds, kMin), kMax);
    return PlistNode(plist_new_date(static_cast<std::int32_t>(seconds), 0));
  }

  static PlistNode arrayNode(const PlistArray& elements) {
    PlistNode array(plist_new_array());
    for (const PlistValue& element : elements) {
      if (element.isNull()) continue;
      plist_array_append_item(array.get(), build(element).release());
    }
    return array;
  }

  static PlistNode dictionaryNode(const PlistDictionary& entries) {
    PlistNode dictionary(plist_new_dict());
    for (const auto& [key, member] : entries) {
      if (member.isNull()) continue;
      plist_dict_set_item(dictionary.get(), toWellFormedUtf8(key).c_str(), build(member).release());
    }
    return dictionary;
  }
};

std::span<const std::uint8_t> asBytes(std::string_view text) {
  return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

std::string_view asText(std::span<const std::uint8_t> bytes) {
  return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
}

}  // namespace

VendError PropertyListSerialization::readError(std::int64_t code, std::string description) {
  return VendError::withDomain(std::string(kErrorDomain), code, std::move(description));
}

Result<PlistValue> PropertyListSerialization::read(std::span<const std::uint8_t> bytes,
                                                   const PlistReadLimits& limits) {
  const std::string_view text = asText(bytes);
  if (text.empty()) return malformed("property list: empty input");
  if (text.starts_with(kBinaryMagic)) return readBinary(bytes, limits);
  if (text.starts_with(kBinaryFamilyMagic)) {
    return malformed("property list: unsupported binary format version");
  }
  return readXml(bytes, limits);
}

Result<PlistValue> PropertyListSerialization::read(std::string_view bytes,
                                                   const PlistReadLimits& limits) {
  return read(asBytes(bytes), limits);
}

Result<PlistValue> PropertyListSerialization::readBinary(std::span<const std::uint8_t> bytes,
                                                         const PlistReadLimits& limits) {
  return BinaryPlistReader::read(bytes, limits);
}

Result<PlistValue> PropertyListSerialization::readXml(std::span<const std::uint8_t> bytes,
                                                      const PlistReadLimits& limits) {
  if (bytes.empty()) return malformed("XML property list: empty input");
  if (bytes.size() > limits.maxBytes || bytes.size() > std::numeric_limits<std::uint32_t>::max()) {
    return beyondLimits("XML property list: larger than " + std::to_string(limits.maxBytes) +
                        " bytes");
  }
  // A terminated copy: the parser is handed a length, but a terminator costs
  // little and leaves no room for reading past the caller's buffer.
  const std::string xml(asText(bytes));
  if (XmlNestingScanner(xml).exceeds(limits.maxDepth)) {
    return beyondLimits("XML property list: nesting deeper than " +
                        std::to_string(limits.maxDepth));
  }
  const PlistNode root = parseXmlDocument(xml);
  if (!root) return malformed("XML property list: malformed document");
  LibplistTreeReader reader(limits);
  PlistValue value;
  if (!reader.convert(root.get(), 1, value)) {
    return malformed("XML property list: " + reader.error());
  }
  return value;
}

namespace {

// The writer's document type line names a public identifier that is not
// ours; a property list needs no document type to be read, by us or by
// libplist, so it is left out.
std::string withoutDocumentType(std::string xml) {
  std::size_t start = xml.find("<!DOCTYPE");
  if (start == std::string::npos) return xml;
  std::size_t end = xml.find('>', start);
  if (end == std::string::npos) return xml;
  if (end + 1 < xml.size() && xml[end + 1] == '\n') ++end;
  xml.erase(start, end + 1 - start);
  return xml;
}

}  // namespace

PlistData PropertyListSerialization::writeBinary(const PlistValue& value) {
  return BinaryPlistWriter::write(value);
}

std::string PropertyListSerialization::writeXml(const PlistValue& value) {
  const PlistNode root = LibplistTreeWriter::build(value);
  char* rawText = nullptr;
  std::uint32_t length = 0;
  plist_to_xml(root.get(), &rawText, &length);
  const XmlText text(rawText);
  return text ? withoutDocumentType(std::string(text.get(), length)) : std::string();
}

PlistData PropertyListSerialization::write(const PlistValue& value, PlistFormat format) {
  if (format == PlistFormat::Binary) return writeBinary(value);
  const std::string xml = writeXml(value);
  return PlistData(xml.begin(), xml.end());
}

}  // namespace larder
