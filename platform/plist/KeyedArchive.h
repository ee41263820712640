#pragma once

#include <optional>
#include <set>
#include <span>
#include <string>
#include <string_view>

#include "platform/error/Result.h"
#include "platform/value/PlistValue.h"

namespace larder {

// Our keyed object archive: a binary property list whose root is
//   { "$archiver": "larder.KeyedArchive", "$version": 1, "$top": { "root": <object> } }
// Objects are encoded as trees:
//  - strings, numbers, booleans, data and dates stand as themselves
//    (classes "string", "number", "data", "date");
//  - a dictionary is { "$class": "dictionary", "$entries": { key: object } };
//  - an array is { "$class": "array", "$items": [ object ] };
//  - a record is { "$class": "<ClassName>", <field>: <value>... }, written
//    and read by the record itself.
// Decoding is secure: every class met between the root and the records must
// be in the allowed set, so a file can never make us build a class the
// caller did not ask for. Fields inside a record are the record's matter.
class KeyedArchive {
 public:
  static constexpr std::string_view kClassKey = "$class";
  static constexpr std::string_view kDictionaryClass = "dictionary";
  static constexpr std::string_view kArrayClass = "array";
  static constexpr std::string_view kStringClass = "string";
  static constexpr std::string_view kNumberClass = "number";
  static constexpr std::string_view kDataClass = "data";
  static constexpr std::string_view kDateClass = "date";

  // Helpers for building trees.
  static PlistValue dictionary(PlistDictionary entries);
  static PlistValue array(PlistArray items);
  static PlistDictionary record(std::string_view className);

  static PlistData archivedData(const PlistValue& root);

  // The decoded tree with plain dictionaries and arrays unwrapped into
  // PlistDictionary and PlistArray, and records left as their dictionaries
  // (with "$class") for their classes to decode. An error when the data is
  // not an archive or names a class that is not allowed.
  static Result<PlistValue> unarchivedRoot(std::span<const std::uint8_t> data,
                                           const std::set<std::string, std::less<>>& allowed);

  // The class name of an encoded record, or empty.
  static std::string_view classNameOf(const PlistValue& encoded);
};

}  // namespace larder
