#include "platform/plist/BinaryPlistReader.h"

#include <bit>
#include <cstring>
#include <string_view>
#include <vector>

#include "platform/plist/BinaryPlistWriter.h"
#include "platform/plist/Utf8.h"

namespace larder {

namespace {

constexpr std::size_t kHeaderSize = 8;
constexpr std::size_t kTrailerSize = 32;
constexpr std::string_view kMagic = "bplist00";

std::uint64_t readBigEndian(const std::uint8_t* bytes, unsigned width) {
  std::uint64_t value = 0;
  for (unsigned index = 0; index < width; ++index) value = (value << 8) | bytes[index];
  return value;
}

bool isHighSurrogate(char16_t unit) {
  return unit >= 0xD800 && unit <= 0xDBFF;
}
bool isLowSurrogate(char16_t unit) {
  return unit >= 0xDC00 && unit <= 0xDFFF;
}

class BinaryDecoder {
 public:
  BinaryDecoder(std::span<const std::uint8_t> bytes, const PlistReadLimits& limits)
      : bytes_(bytes), limits_(limits) {}

  Result<PlistValue> decode() {
    PlistValue root;
    if (!parseTrailer() || !decodeObject(topObject_, 1, root)) {
      return PropertyListSerialization::readError(PropertyListSerialization::kMalformedCode,
                                                  "binary property list: " + error_);
    }
    return root;
  }

 private:
  bool fail(std::string message) {
    error_ = std::move(message);
    return false;
  }

  bool parseTrailer() {
    if (bytes_.size() < kHeaderSize + 1 + kTrailerSize) return fail("file too short");
    if (std::memcmp(bytes_.data(), kMagic.data(), kHeaderSize) != 0) return fail("bad header");
    const std::size_t trailerStart = bytes_.size() - kTrailerSize;
    const std::uint8_t* trailer = bytes_.data() + trailerStart;
    offsetWidth_ = trailer[6];
    referenceWidth_ = trailer[7];
    objectCount_ = readBigEndian(trailer + 8, 8);
    topObject_ = readBigEndian(trailer + 16, 8);
    const std::uint64_t offsetTableOffset = readBigEndian(trailer + 24, 8);
    if (offsetWidth_ < 1 || offsetWidth_ > 8) return fail("bad offset size in trailer");
    if (referenceWidth_ < 1 || referenceWidth_ > 8) return fail("bad reference size in trailer");
    if (objectCount_ == 0) return fail("no objects");
    if (topObject_ >= objectCount_) return fail("top object out of range");
    if (offsetTableOffset <= kHeaderSize || offsetTableOffset > trailerStart) {
      return fail("offset table out of range");
    }
    // Division rather than multiplication: the count comes from the file and
    // could overflow any product.
    if (objectCount_ > (trailerStart - offsetTableOffset) / offsetWidth_) {
      return fail("offset table out of range");
    }
    objectsEnd_ = static_cast<std::size_t>(offsetTableOffset);
    inProgress_.assign(static_cast<std::size_t>(objectCount_), false);
    return true;
  }

  // True when `count` items of `unitSize` bytes fit between position and the
  // end of the object area.
  [[nodiscard]] bool fits(std::size_t position, std::uint64_t count, std::uint64_t unitSize) const {
    return position <= objectsEnd_ && count <= (objectsEnd_ - position) / unitSize;
  }

  bool objectPosition(std::uint64_t index, std::size_t& position) {
    const std::size_t entry = objectsEnd_ + static_cast<std::size_t>(index) * offsetWidth_;
    const std::uint64_t offset = readBigEndian(bytes_.data() + entry, offsetWidth_);
    if (offset < kHeaderSize || offset >= objectsEnd_) {
      return fail("offset of object " + std::to_string(index) + " out of range");
    }
    position = static_cast<std::size_t>(offset);
    return true;
  }

  bool countObjects(std::uint64_t count) {
    if (count > limits_.maxObjects - decodedObjects_) {
      return fail("more than " + std::to_string(limits_.maxObjects) + " objects");
    }
    decodedObjects_ += static_cast<std::size_t>(count);
    return true;
  }

  bool chargeBytes(std::uint64_t count) {
    if (count > limits_.maxBytes - decodedBytes_) {
      return fail("decoded text and data over " + std::to_string(limits_.maxBytes) + " bytes");
    }
    decodedBytes_ += static_cast<std::size_t>(count);
    return true;
  }

  // Lengths up to 14 sit in the marker; longer ones follow it as an integer.
  bool readLength(std::uint8_t info, std::size_t& position, std::uint64_t& length) {
    if (info != 0xF) {
      length = info;
      return true;
    }
    if (position >= objectsEnd_) return fail("length out of range");
    const std::uint8_t marker = bytes_[position];
    if ((marker >> 4) != 0x1 || (marker & 0xF) > 3) return fail("bad length marker");
    const unsigned width = 1u << (marker & 0xF);
    if (!fits(position + 1, width, 1)) return fail("length out of range");
    length = readBigEndian(bytes_.data() + position + 1, width);
    position += 1 + width;
    return true;
  }

  bool readReference(std::size_t position, std::uint64_t& index) {
    index = readBigEndian(bytes_.data() + position, referenceWidth_);
    if (index >= objectCount_) return fail("object reference out of range");
    return true;
  }

  bool decodeObject(std::uint64_t index, std::size_t depth, PlistValue& out) {
    std::size_t position = 0;
    if (!countObjects(1) || !objectPosition(index, position)) return false;
    const std::uint8_t marker = bytes_[position++];
    const std::uint8_t info = marker & 0xF;
    switch (marker >> 4) {
      case 0x0:
        return decodeBoolean(marker, out);
      case 0x1:
        return decodeInteger(info, position, out);
      case 0x2:
        return decodeReal(info, position, out);
      case 0x3:
        return decodeDate(marker, position, out);
      case 0x4:
        return decodeData(info, position, out);
      case 0x5:
      case 0x6: {
        std::string text;
        if (!decodeString(marker, position, text)) return false;
        out = PlistValue(std::move(text));
        return true;
      }
      case 0x8:
        return decodeUid(info, position, out);
      case 0xA:
        return decodeContainer(index, depth,
                               [&] { return decodeArray(info, position, depth, out); });
      case 0xD:
        return decodeContainer(index, depth,
                               [&] { return decodeDictionary(info, position, depth, out); });
      default:
        return fail("unsupported object marker " + std::to_string(marker));
    }
  }

  bool decodeBoolean(std::uint8_t marker, PlistValue& out) {
    if (marker != 0x08 && marker != 0x09) {
      return fail("unsupported object marker " + std::to_string(marker));
    }
    out = PlistValue(marker == 0x09);
    return true;
  }

  // 1-, 2- and 4-byte integers are unsigned, 8-byte ones signed; 16-byte
  // ones are accepted when their value fits 64 bits.
  bool decodeInteger(std::uint8_t widthLog2, std::size_t position, PlistValue& out) {
    if (widthLog2 > 4) return fail("bad integer size");
    const unsigned width = 1u << widthLog2;
    if (!fits(position, width, 1)) return fail("integer out of range");
    const std::uint8_t* bytes = bytes_.data() + position;
    if (width < 8) {
      out = PlistValue(static_cast<std::int64_t>(readBigEndian(bytes, width)));
    } else if (width == 8) {
      out = PlistValue(static_cast<std::int64_t>(readBigEndian(bytes, 8)));
    } else {
      const std::uint64_t high = readBigEndian(bytes, 8);
      const std::uint64_t low = readBigEndian(bytes + 8, 8);
      const bool negative64 = high == ~std::uint64_t{0} && (low >> 63) != 0;
      if (high != 0 && !negative64) return fail("integer does not fit 64 bits");
      out = negative64 ? PlistValue(static_cast<std::int64_t>(low)) : PlistValue(low);
    }
    return true;
  }

  bool readDouble(std::uint8_t widthLog2, std::size_t position, double& value) {
    if (widthLog2 != 2 && widthLog2 != 3) return fail("bad real size");
    const unsigned width = 1u << widthLog2;
    if (!fits(position, width, 1)) return fail("real out of range");
    const std::uint64_t bits = readBigEndian(bytes_.data() + position, width);
    value = width == 4 ? static_cast<double>(std::bit_cast<float>(static_cast<std::uint32_t>(bits)))
                       : std::bit_cast<double>(bits);
    return true;
  }

  bool decodeReal(std::uint8_t widthLog2, std::size_t position, PlistValue& out) {
    double value = 0;
    if (!readDouble(widthLog2, position, value)) return false;
    out = PlistValue(value);
    return true;
  }

  bool decodeDate(std::uint8_t marker, std::size_t position, PlistValue& out) {
    if (marker != 0x33) return fail("bad date size");
    double secondsSince2001 = 0;
    if (!readDouble(3, position, secondsSince2001)) return false;
    out = PlistValue(PlistDate{secondsSince2001 + kPlistDateEpochOffset});
    return true;
  }

  bool decodeData(std::uint8_t info, std::size_t position, PlistValue& out) {
    std::uint64_t length = 0;
    if (!readLength(info, position, length)) return false;
    if (!fits(position, length, 1)) return fail("data out of range");
    if (!chargeBytes(length)) return false;
    const std::uint8_t* begin = bytes_.data() + position;
    out = PlistValue(PlistData(begin, begin + length));
    return true;
  }

  bool decodeUid(std::uint8_t info, std::size_t position, PlistValue& out) {
    const unsigned width = info + 1u;
    if (width > 8) return fail("bad uid size");
    if (!fits(position, width, 1)) return fail("uid out of range");
    out = PlistValue(PlistUid{readBigEndian(bytes_.data() + position, width)});
    return true;
  }

  bool decodeString(std::uint8_t marker, std::size_t position, std::string& text) {
    const bool ascii = (marker >> 4) == 0x5;
    if (!ascii && (marker >> 4) != 0x6) return fail("dictionary key is not a string");
    std::uint64_t length = 0;
    if (!readLength(marker & 0xF, position, length)) return false;
    return ascii ? decodeAsciiString(position, length, text)
                 : decodeUtf16String(position, length, text);
  }

  bool decodeAsciiString(std::size_t position, std::uint64_t length, std::string& text) {
    if (!fits(position, length, 1)) return fail("string out of range");
    if (!chargeBytes(length)) return false;
    const auto* begin = reinterpret_cast<const char*>(bytes_.data() + position);
    const std::string_view raw(begin, static_cast<std::size_t>(length));
    bool ascii = true;
    for (const char c : raw) ascii &= (static_cast<unsigned char>(c) & 0x80u) == 0;
    if (ascii) {
      text.assign(raw);
      return true;
    }
    text.clear();
    text.reserve(raw.size() * 2);
    for (const char c : raw) appendUtf8(text, static_cast<unsigned char>(c));
    return true;
  }

  bool decodeUtf16String(std::size_t position, std::uint64_t length, std::string& text) {
    if (!fits(position, length, 2)) return fail("string out of range");
    if (!chargeBytes(length * 2)) return false;
    const std::uint8_t* units = bytes_.data() + position;
    const auto unitAt = [units](std::size_t index) {
      return static_cast<char16_t>((units[2 * index] << 8) | units[2 * index + 1]);
    };
    text.clear();
    text.reserve(static_cast<std::size_t>(length) * 3);
    for (std::size_t index = 0; index < length; ++index) {
      const char16_t unit = unitAt(index);
      if (isHighSurrogate(unit) && index + 1 < length && isLowSurrogate(unitAt(index + 1))) {
        const char16_t low = unitAt(++index);
        appendUtf8(text, 0x10000 + ((char32_t{unit} - 0xD800) << 10) + (char32_t{low} - 0xDC00));
      } else if (isHighSurrogate(unit) || isLowSurrogate(unit)) {
        appendUtf8(text, kUnicodeReplacementCharacter);
      } else {
        appendUtf8(text, unit);
      }
    }
    return true;
  }

  // Containers are where depth grows and where cycles can close, so both are
  // checked here; an object stays marked only while its own members decode,
  // which lets several containers share one member.
  template <typename DecodeMembers>
  bool decodeContainer(std::uint64_t index, std::size_t depth, DecodeMembers decodeMembers) {
    if (depth > limits_.maxDepth) {
      return fail("nesting deeper than " + std::to_string(limits_.maxDepth));
    }
    const auto slot = static_cast<std::size_t>(index);
    if (inProgress_[slot]) return fail("object " + std::to_string(index) + " contains itself");
    inProgress_[slot] = true;
    const bool decoded = decodeMembers();
    inProgress_[slot] = false;
    return decoded;
  }

  bool decodeArray(std::uint8_t info, std::size_t position, std::size_t depth, PlistValue& out) {
    std::uint64_t count = 0;
    if (!readLength(info, position, count)) return false;
    if (!fits(position, count, referenceWidth_)) return fail("array out of range");
    if (count > limits_.maxObjects - decodedObjects_) {
      return fail("more than " + std::to_string(limits_.maxObjects) + " objects");
    }
    out = PlistValue(PlistArray{});
    PlistArray& elements = *out.array();
    // Exact reservation: elements never move while their own members decode.
    elements.reserve(static_cast<std::size_t>(count));
    for (std::uint64_t member = 0; member < count; ++member) {
      std::uint64_t reference = 0;
      if (!readReference(position + member * referenceWidth_, reference)) return false;
      if (!decodeObject(reference, depth + 1, elements.emplace_back())) return false;
    }
    return true;
  }

  bool decodeKey(std::uint64_t index, std::string& key) {
    std::size_t position = 0;
    if (!countObjects(1) || !objectPosition(index, position)) return false;
    const std::uint8_t marker = bytes_[position];
    return decodeString(marker, position + 1, key);
  }

  bool decodeDictionary(std::uint8_t info, std::size_t position, std::size_t depth,
                        PlistValue& out) {
    std::uint64_t count = 0;
    if (!readLength(info, position, count)) return false;
    if (!fits(position, count, 2ull * referenceWidth_)) return fail("dictionary out of range");
    if (count > (limits_.maxObjects - decodedObjects_) / 2) {
      return fail("more than " + std::to_string(limits_.maxObjects) + " objects");
    }
    out = PlistValue(PlistDictionary{});
    PlistDictionary& entries = *out.dictionary();
    const std::size_t valuesStart = position + static_cast<std::size_t>(count) * referenceWidth_;
    std::string key;
    for (std::uint64_t member = 0; member < count; ++member) {
      std::uint64_t keyReference = 0;
      std::uint64_t valueReference = 0;
      if (!readReference(position + member * referenceWidth_, keyReference) ||
          !readReference(valuesStart + member * referenceWidth_, valueReference) ||
          !decodeKey(keyReference, key)) {
        return false;
      }
      // Keys usually arrive sorted, which makes the end a good hint. A
      // repeated key keeps the last value.
      auto entry = entries.try_emplace(entries.end(), std::move(key));
      if (!decodeObject(valueReference, depth + 1, entry->second)) return false;
    }
    return true;
  }

  std::span<const std::uint8_t> bytes_;
  const PlistReadLimits& limits_;
  unsigned offsetWidth_ = 0;
  unsigned referenceWidth_ = 0;
  std::uint64_t objectCount_ = 0;
  std::uint64_t topObject_ = 0;
  std::size_t objectsEnd_ = 0;
  std::size_t decodedObjects_ = 0;
  std::size_t decodedBytes_ = 0;
  std::vector<bool> inProgress_;
  std::string error_;
};

}  // namespace

Result<PlistValue> BinaryPlistReader::read(std::span<const std::uint8_t> bytes,
                                           const PlistReadLimits& limits) {
  if (bytes.size() > limits.maxBytes) {
    return PropertyListSerialization::readError(
        PropertyListSerialization::kLimitCode,
        "binary property list: larger than " + std::to_string(limits.maxBytes) + " bytes");
  }
  BinaryDecoder decoder(bytes, limits);
  return decoder.decode();
}

}  // namespace larder
