#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>

#include "platform/error/Result.h"
#include "platform/value/PlistValue.h"

namespace larder {

// Bounds for every property list that comes from outside the process (store
// answers, files on disk, D-Bus arguments). A document that exceeds one is
// refused as a whole: callers see "no value" and an error text, never a
// partial tree.
//
// maxBytes bounds the input and also the text and data bytes of the decoded
// tree: a binary document may reference one object from many places, and
// each place gets its own copy. maxDepth counts nested containers (the root
// container is at depth 1) and also bounds the stack a read uses. maxObjects
// counts every value produced, dictionary keys included.
struct PlistReadLimits {
  std::size_t maxBytes = 256u * 1024u * 1024u;
  std::size_t maxDepth = 512;
  std::size_t maxObjects = 16u * 1024u * 1024u;
};

enum class PlistFormat { Xml, Binary };

class PropertyListSerialization {
 public:
  // Failures of the readers: an error of kErrorDomain whose description is
  // one line that says what is wrong with the input.
  static constexpr std::string_view kErrorDomain = "PropertyListSerialization";
  static constexpr std::int64_t kMalformedCode = 1;  // not a property list we read
  static constexpr std::int64_t kLimitCode = 2;      // beyond the limits of the read
  static VendError readError(std::int64_t code, std::string description);

  // Reads an XML or binary ("bplist00") property list, telling them apart by
  // their first bytes.
  static Result<PlistValue> read(std::span<const std::uint8_t> bytes,
                                 const PlistReadLimits& limits = {});
  static Result<PlistValue> read(std::string_view bytes, const PlistReadLimits& limits = {});

  static Result<PlistValue> readBinary(std::span<const std::uint8_t> bytes,
                                       const PlistReadLimits& limits = {});
  static Result<PlistValue> readXml(std::span<const std::uint8_t> bytes,
                                    const PlistReadLimits& limits = {});

  // Writers. Null values inside containers are skipped (a property list has
  // no null); a null root gives an empty dictionary.
  static PlistData writeBinary(const PlistValue& value);
  static std::string writeXml(const PlistValue& value);
  static PlistData write(const PlistValue& value, PlistFormat format);
};

}  // namespace larder
