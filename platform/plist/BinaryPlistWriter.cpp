#include "platform/plist/BinaryPlistWriter.h"

#include <algorithm>
#include <array>
#include <bit>
#include <limits>
#include <optional>
#include <unordered_map>
#include <utility>
#include <vector>

#include "platform/plist/Utf8.h"

namespace larder {

namespace {

// Object markers: the high nibble is the type, the low nibble a size or a
// length (0xF: the length follows as an integer object).
constexpr std::uint8_t kMarkerFalse = 0x08;
constexpr std::uint8_t kMarkerTrue = 0x09;
constexpr std::uint8_t kTypeInteger = 0x1;
constexpr std::uint8_t kMarkerReal64 = 0x23;
constexpr std::uint8_t kMarkerDate = 0x33;
constexpr std::uint8_t kTypeData = 0x4;
constexpr std::uint8_t kTypeAsciiString = 0x5;
constexpr std::uint8_t kTypeUtf16String = 0x6;
constexpr std::uint8_t kTypeUid = 0x8;
constexpr std::uint8_t kTypeArray = 0xA;
constexpr std::uint8_t kTypeDictionary = 0xD;
constexpr std::uint8_t kLengthFollows = 0xF;

constexpr std::array<std::uint8_t, 8> kMagic = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};

// Smallest of 1, 2, 4 and 8 bytes that holds the value.
unsigned byteWidthFor(std::uint64_t value) {
  if (value <= 0xFFu) return 1;
  if (value <= 0xFFFFu) return 2;
  if (value <= 0xFFFFFFFFu) return 4;
  return 8;
}

unsigned log2OfWidth(unsigned width) {
  return static_cast<unsigned>(std::countr_zero(width));
}

bool isAscii(std::string_view text) {
  for (const char c : text) {
    if ((static_cast<unsigned char>(c) & 0x80u) != 0) return false;
  }
  return true;
}

void appendUtf16(std::vector<char16_t>& units, std::string_view utf8) {
  units.clear();
  units.reserve(utf8.size());
  std::size_t position = 0;
  while (position < utf8.size()) {
    const char32_t codePoint = decodeUtf8(utf8, position);
    if (codePoint >= 0x10000) {
      const char32_t offset = codePoint - 0x10000;
      units.push_back(static_cast<char16_t>(0xD800 + (offset >> 10)));
      units.push_back(static_cast<char16_t>(0xDC00 + (offset & 0x3FF)));
    } else {
      units.push_back(static_cast<char16_t>(codePoint));
    }
  }
}

void appendBigEndian(PlistData& out, std::uint64_t value, unsigned width) {
  for (unsigned shift = width * 8; shift > 0; shift -= 8) {
    out.push_back(static_cast<std::uint8_t>(value >> (shift - 8)));
  }
}

void putBigEndian(std::uint8_t* at, std::uint64_t value, unsigned width) {
  for (unsigned index = 0; index < width; ++index) {
    at[index] = static_cast<std::uint8_t>(value >> ((width - 1 - index) * 8));
  }
}

// Non-negative integers take the fewest bytes; 1-, 2- and 4-byte integers
// are unsigned in this format and 8-byte ones signed, so negative values
// always take 8.
void appendInteger(PlistData& out, std::int64_t value) {
  const unsigned width = value < 0 ? 8 : byteWidthFor(static_cast<std::uint64_t>(value));
  out.push_back(static_cast<std::uint8_t>((kTypeInteger << 4) | log2OfWidth(width)));
  appendBigEndian(out, static_cast<std::uint64_t>(value), width);
}

void appendUnsigned128(PlistData& out, std::uint64_t value) {
  out.push_back(static_cast<std::uint8_t>((kTypeInteger << 4) | log2OfWidth(16)));
  appendBigEndian(out, 0, 8);
  appendBigEndian(out, value, 8);
}

void appendMarker(PlistData& out, std::uint8_t type, std::uint64_t length) {
  if (length < kLengthFollows) {
    out.push_back(static_cast<std::uint8_t>((type << 4) | length));
    return;
  }
  out.push_back(static_cast<std::uint8_t>((type << 4) | kLengthFollows));
  appendInteger(out, static_cast<std::int64_t>(length));
}

void appendDouble(PlistData& out, std::uint8_t marker, double value) {
  out.push_back(marker);
  appendBigEndian(out, std::bit_cast<std::uint64_t>(value), 8);
}

void appendUid(PlistData& out, std::uint64_t value) {
  const unsigned width = byteWidthFor(value);
  out.push_back(static_cast<std::uint8_t>((kTypeUid << 4) | (width - 1)));
  appendBigEndian(out, value, width);
}

// Strings already numbered, by their text. Open addressing over one flat
// array of 8-byte slots that point into a list of the strings: a journal of
// 10,000 entries holds some 70,000 distinct strings, and a node-based map
// spent more time allocating its nodes than encoding them (a table of whole
// string views spent it faulting in its pages).
class StringNumbers {
 public:
  // The number of `text`, or `candidate` when it had none; then true.
  std::pair<std::uint64_t, bool> findOrAdd(std::string_view text, std::uint64_t candidate) {
    if ((strings_.size() + 1) * 2 > slots_.size()) grow();
    const std::size_t hash = std::hash<std::string_view>{}(text);
    const auto tag = static_cast<std::uint32_t>(hash >> 32);
    for (std::size_t index = hash & mask_;; index = (index + 1) & mask_) {
      Slot& slot = slots_[index];
      if (slot.string == kEmpty) {
        slot = {static_cast<std::uint32_t>(strings_.size()), tag};
        strings_.push_back({text, candidate, hash});
        return {candidate, true};
      }
      const Known& known = strings_[slot.string];
      if (slot.tag == tag && known.text == text) return {known.number, false};
    }
  }

 private:
  static constexpr std::uint32_t kEmpty = std::numeric_limits<std::uint32_t>::max();
  struct Slot {
    std::uint32_t string = kEmpty;  // into strings_
    std::uint32_t tag = 0;          // the hash's high half, to skip most comparisons
  };
  struct Known {
    std::string_view text;
    std::uint64_t number;
    std::size_t hash;
  };

  void grow() {
    slots_.assign(std::max<std::size_t>(1024, slots_.size() * 2), Slot{});
    mask_ = slots_.size() - 1;
    for (std::size_t string = 0; string < strings_.size(); ++string) {
      std::size_t index = strings_[string].hash & mask_;
      while (slots_[index].string != kEmpty) index = (index + 1) & mask_;
      slots_[index] = {static_cast<std::uint32_t>(string),
                       static_cast<std::uint32_t>(strings_[string].hash >> 32)};
    }
  }

  std::vector<Slot> slots_;
  std::vector<Known> strings_;
  std::size_t mask_ = 0;
};

// One entry of the object table. Scalars are encoded as soon as they are
// numbered (their bytes do not depend on the reference width), so the value
// tree is walked once; containers keep their member references until the
// reference width is known.
struct PendingObject {
  std::uint8_t containerType = 0;  // kTypeArray, kTypeDictionary, or 0 for a scalar
  std::size_t begin = 0;           // scalars: into the scalar bytes; containers: references
  std::size_t count = 0;           // scalars: bytes; arrays: elements; dictionaries: pairs
};

class BinaryEncoder {
 public:
  PlistData encode(const PlistValue& root) {
    const PlistValue emptyDictionary{PlistDictionary{}};
    const PlistValue& top = root.isNull() ? emptyDictionary : root;
    reserveFor(top);
    referenceFor(top);  // object 0
    for (std::size_t index = 0; index < containerValues_.size(); ++index) {
      collectMembers(index);
    }
    referenceWidth_ = byteWidthFor(objects_.size() - 1);
    writeFile();
    return std::move(out_);
  }

 private:
  // Room for the objects and references of a tree shaped as `root`'s
  // first level is: growing the tables of a large list, copy after copy,
  // cost more than this look at one element of each.
  void reserveFor(const PlistValue& root) {
    std::size_t values = 1;
    auto membersOf = [](const PlistValue& value) -> std::size_t {
      if (const PlistArray* elements = value.array()) return elements->size();
      if (const PlistDictionary* entries = value.dictionary()) return entries->size() * 2;
      return 0;
    };
    auto forEachMember = [](const PlistValue& value, auto visit) {
      if (const PlistArray* elements = value.array()) {
        for (const PlistValue& element : *elements) visit(element);
      } else if (const PlistDictionary* entries = value.dictionary()) {
        for (const auto& entry : *entries) visit(entry.second);
      }
    };
    // Two levels down, each list guessed from its first element's size.
    forEachMember(root, [&](const PlistValue& member) {
      const std::size_t count = membersOf(member);
      values += count;
      if (const PlistArray* elements = member.array(); elements && !elements->empty()) {
        values += count * membersOf(elements->front());
      }
    });
    objects_.reserve(values);
    references_.reserve(values);
    scalarBytes_.reserve(values * 16);
  }

  // Numbers the members of the container, creating objects for the ones not
  // seen before. Breadth-first over a worklist, so nesting depth costs no
  // stack.
  void collectMembers(std::size_t containerIndex) {
    const PlistValue& value = *containerValues_[containerIndex];
    const std::size_t object = containerObjects_[containerIndex];
    const std::size_t first = references_.size();
    std::size_t count = 0;
    if (const PlistArray* elements = value.array()) {
      for (const PlistValue& element : *elements) {
        if (element.isNull()) continue;
        references_.push_back(referenceFor(element));
        ++count;
      }
    } else if (const PlistDictionary* entries = value.dictionary()) {
      // One walk over the map: its nodes are scattered in memory, so a second
      // walk for the values would cost as much as the first.
      valueReferences_.clear();
      for (const auto& [key, member] : *entries) {
        if (member.isNull()) continue;
        references_.push_back(referenceForString(key));
        valueReferences_.push_back(referenceFor(member));
        ++count;
      }
      references_.insert(references_.end(), valueReferences_.begin(), valueReferences_.end());
    }
    objects_[object].begin = first;
    objects_[object].count = count;
  }

  std::uint64_t referenceFor(const PlistValue& value) {
    switch (value.type()) {
      case PlistValue::Type::String:
        return referenceForString(*value.string());
      case PlistValue::Type::Integer:
      case PlistValue::Type::UnsignedInteger:
        return referenceForInteger(value);
      case PlistValue::Type::Boolean: {
        std::optional<std::uint64_t>& slot = booleans_[value.boolValue() ? 1 : 0];
        if (!slot) {
          const std::uint8_t marker = value.boolValue() ? kMarkerTrue : kMarkerFalse;
          slot = newScalar([&] { scalarBytes_.push_back(marker); });
        }
        return *slot;
      }
      case PlistValue::Type::Real:
        return newScalar([&] { appendDouble(scalarBytes_, kMarkerReal64, value.doubleValue()); });
      case PlistValue::Type::Date:
        return newScalar([&] {
          appendDouble(scalarBytes_, kMarkerDate,
                       value.date()->secondsSince1970 - kPlistDateEpochOffset);
        });
      case PlistValue::Type::Data:
        return newScalar([&] {
          const PlistData& bytes = *value.data();
          appendMarker(scalarBytes_, kTypeData, bytes.size());
          scalarBytes_.insert(scalarBytes_.end(), bytes.begin(), bytes.end());
        });
      case PlistValue::Type::Uid:
        return newScalar([&] { appendUid(scalarBytes_, value.uid()->value); });
      case PlistValue::Type::Array:
        return newContainer(value, kTypeArray);
      case PlistValue::Type::Dictionary:
        return newContainer(value, kTypeDictionary);
      case PlistValue::Type::Null:
        break;  // callers skip nulls
    }
    return 0;
  }

  template <typename Encode>
  std::uint64_t newScalar(Encode encode) {
    const std::size_t begin = scalarBytes_.size();
    encode();
    objects_.push_back({0, begin, scalarBytes_.size() - begin});
    return objects_.size() - 1;
  }

  std::uint64_t newContainer(const PlistValue& value, std::uint8_t type) {
    containerValues_.push_back(&value);
    containerObjects_.push_back(objects_.size());
    objects_.push_back({type, 0, 0});
    return objects_.size() - 1;
  }

  std::uint64_t referenceForString(std::string_view text) {
    const auto [number, added] = strings_.findOrAdd(text, objects_.size());
    if (added) newScalar([&] { appendString(text); });
    return number;
  }

  std::uint64_t referenceForInteger(const PlistValue& value) {
    const bool isSigned = value.type() == PlistValue::Type::Integer;
    auto& table = isSigned ? signedIntegers_ : unsignedIntegers_;
    const auto [entry, inserted] = table.try_emplace(value.uint64Value(), objects_.size());
    if (inserted) {
      newScalar([&] {
        if (isSigned) {
          appendInteger(scalarBytes_, value.int64Value());
        } else {
          appendUnsigned128(scalarBytes_, value.uint64Value());
        }
      });
    }
    return entry->second;
  }

  void appendString(std::string_view text) {
    if (isAscii(text)) {
      appendMarker(scalarBytes_, kTypeAsciiString, text.size());
      scalarBytes_.insert(scalarBytes_.end(), text.begin(), text.end());
      return;
    }
    appendUtf16(utf16Scratch_, text);
    appendMarker(scalarBytes_, kTypeUtf16String, utf16Scratch_.size());
    for (const char16_t unit : utf16Scratch_) appendBigEndian(scalarBytes_, unit, 2);
  }

  void writeFile() {
    out_.reserve(kMagic.size() + scalarBytes_.size() + objects_.size() * 10 +
                 references_.size() * referenceWidth_ + 64);
    out_.insert(out_.end(), kMagic.begin(), kMagic.end());
    std::vector<std::uint64_t> offsets;
    offsets.reserve(objects_.size());
    for (const PendingObject& object : objects_) {
      offsets.push_back(out_.size());
      if (object.containerType == 0) {
        const auto begin = scalarBytes_.begin() + static_cast<std::ptrdiff_t>(object.begin);
        out_.insert(out_.end(), begin, begin + static_cast<std::ptrdiff_t>(object.count));
      } else {
        writeContainer(object);
      }
    }
    const std::uint64_t offsetTableOffset = out_.size();
    const unsigned offsetWidth = byteWidthFor(offsets.back());
    std::uint8_t* table = grow(offsets.size() * offsetWidth);
    for (const std::uint64_t offset : offsets) {
      putBigEndian(table, offset, offsetWidth);
      table += offsetWidth;
    }
    writeTrailer(offsetWidth, offsetTableOffset);
  }

  void writeContainer(const PendingObject& object) {
    appendMarker(out_, object.containerType, object.count);
    const std::size_t referencesPerEntry = object.containerType == kTypeDictionary ? 2 : 1;
    const std::size_t end = object.begin + object.count * referencesPerEntry;
    std::uint8_t* at = grow((end - object.begin) * referenceWidth_);
    for (std::size_t index = object.begin; index < end; ++index) {
      putBigEndian(at, references_[index], referenceWidth_);
      at += referenceWidth_;
    }
  }

  // Room for `bytes` more at the end of the output, to be filled in place:
  // one size check for a whole reference list instead of one per byte.
  std::uint8_t* grow(std::size_t bytes) {
    const std::size_t at = out_.size();
    out_.resize(at + bytes);
    return out_.data() + at;
  }

  void writeTrailer(unsigned offsetWidth, std::uint64_t offsetTableOffset) {
    out_.insert(out_.end(), 6, 0);  // unused bytes and sort version
    out_.push_back(static_cast<std::uint8_t>(offsetWidth));
    out_.push_back(static_cast<std::uint8_t>(referenceWidth_));
    appendBigEndian(out_, objects_.size(), 8);
    appendBigEndian(out_, 0, 8);  // the root is always object 0
    appendBigEndian(out_, offsetTableOffset, 8);
  }

  std::vector<PendingObject> objects_;
  // Containers in the order they were numbered, with their object numbers.
  std::vector<const PlistValue*> containerValues_;
  std::vector<std::size_t> containerObjects_;
  std::vector<std::uint64_t> references_;
  std::vector<std::uint64_t> valueReferences_;
  PlistData scalarBytes_;
  StringNumbers strings_;
  std::unordered_map<std::uint64_t, std::uint64_t> signedIntegers_;
  std::unordered_map<std::uint64_t, std::uint64_t> unsignedIntegers_;
  std::array<std::optional<std::uint64_t>, 2> booleans_;
  std::vector<char16_t> utf16Scratch_;
  unsigned referenceWidth_ = 1;
  PlistData out_;
};

}  // namespace

PlistData BinaryPlistWriter::write(const PlistValue& root) {
  BinaryEncoder encoder;
  return encoder.encode(root);
}

}  // namespace larder
