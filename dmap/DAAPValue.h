#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

#include "dmap/DAAPKey.h"
#include "platform/value/PlistValue.h"

namespace larder {

class DAAPItem;
class DAAPValue;

using DAAPItemRef = std::shared_ptr<DAAPItem>;
using DAAPArray = std::vector<DAAPValue>;
using DAAPDictionary = std::map<DAAPKey, DAAPValue, std::less<>>;

// What the DMAP parsers produce: the values of a property list plus
// `DAAPItem` records, which a listing holds in its arrays and dictionaries.
// `PlistValue` has no room for records, and its containers hold property
// lists only, so this type keeps its own containers (with keys that borrow
// their text) and holds every other value as a `PlistValue`; `toPlist()`
// turns a tree into a property list, each record becoming its
// `dictionaryRepresentation`. A default-constructed value is "nothing".
class DAAPValue {
 public:
  enum class Type {
    Null,
    Boolean,
    Integer,
    UnsignedInteger,  // only for integers above INT64_MAX
    Real,
    String,
    Data,
    Date,
    Array,
    Dictionary,
    Item,
  };

  DAAPValue() = default;
  DAAPValue(bool value) : storage_(PlistValue(value)) {}  // NOLINT(google-explicit-constructor)
  DAAPValue(int value) : storage_(PlistValue(value)) {}   // NOLINT(google-explicit-constructor)
  DAAPValue(std::int64_t value) : storage_(PlistValue(value)) {}            // NOLINT
  DAAPValue(std::uint64_t value) : storage_(PlistValue(value)) {}           // NOLINT
  DAAPValue(double value) : storage_(PlistValue(value)) {}                  // NOLINT
  DAAPValue(const char* value) : storage_(PlistValue(value)) {}             // NOLINT
  DAAPValue(std::string value) : storage_(PlistValue(std::move(value))) {}  // NOLINT
  DAAPValue(std::string_view value) : storage_(PlistValue(value)) {}        // NOLINT
  DAAPValue(PlistData value) : storage_(PlistValue(std::move(value))) {}    // NOLINT
  DAAPValue(PlistDate value) : storage_(PlistValue(value)) {}               // NOLINT
  DAAPValue(DAAPArray value) : storage_(std::move(value)) {}                // NOLINT
  DAAPValue(DAAPDictionary value) : storage_(std::move(value)) {}           // NOLINT
  DAAPValue(DAAPItemRef value);                                             // NOLINT

  [[nodiscard]] Type type() const {
    if (const PlistValue* value = scalar()) return static_cast<Type>(value->type());
    if (std::holds_alternative<DAAPArray>(storage_)) return Type::Array;
    return std::holds_alternative<DAAPDictionary>(storage_) ? Type::Dictionary : Type::Item;
  }
  [[nodiscard]] bool isNull() const { return type() == Type::Null; }
  [[nodiscard]] bool isBoolean() const { return type() == Type::Boolean; }
  [[nodiscard]] bool isInteger() const {
    return type() == Type::Integer || type() == Type::UnsignedInteger;
  }
  [[nodiscard]] bool isNumber() const {
    return isInteger() || type() == Type::Real || type() == Type::Boolean;
  }
  [[nodiscard]] bool isReal() const { return type() == Type::Real; }
  [[nodiscard]] bool isString() const { return type() == Type::String; }
  [[nodiscard]] bool isData() const { return type() == Type::Data; }
  [[nodiscard]] bool isDate() const { return type() == Type::Date; }
  [[nodiscard]] bool isArray() const { return type() == Type::Array; }
  [[nodiscard]] bool isDictionary() const { return type() == Type::Dictionary; }
  [[nodiscard]] bool isItem() const { return type() == Type::Item; }

  // Typed access; nullptr for a value of another type.
  [[nodiscard]] const std::string* string() const {
    return scalar() ? scalar()->string() : nullptr;
  }
  [[nodiscard]] const PlistData* data() const { return scalar() ? scalar()->data() : nullptr; }
  [[nodiscard]] const PlistDate* date() const { return scalar() ? scalar()->date() : nullptr; }
  [[nodiscard]] const DAAPArray* array() const { return std::get_if<DAAPArray>(&storage_); }
  [[nodiscard]] DAAPArray* array() { return std::get_if<DAAPArray>(&storage_); }
  [[nodiscard]] const DAAPDictionary* dictionary() const {
    return std::get_if<DAAPDictionary>(&storage_);
  }
  [[nodiscard]] DAAPDictionary* dictionary() { return std::get_if<DAAPDictionary>(&storage_); }
  // The record, or null for a value of another type.
  [[nodiscard]] DAAPItemRef item() const;

  // Numeric conversions as `PlistValue` does them (a string is read as a
  // decimal number); anything else gives 0 / false.
  [[nodiscard]] std::int64_t int64Value() const;
  [[nodiscard]] std::uint64_t uint64Value() const;
  [[nodiscard]] double doubleValue() const;
  [[nodiscard]] bool boolValue() const;

  // Member of a dictionary; nothing for any other type or a missing key.
  [[nodiscard]] const DAAPValue& operator[](std::string_view key) const;
  static const DAAPValue& null();

  // Embedded property lists enter a parse result through this.
  static DAAPValue fromPlist(const PlistValue& value);
  // Records become their `dictionaryRepresentation`.
  [[nodiscard]] PlistValue toPlist() const;

  [[nodiscard]] std::string description() const;

  // Records compare by identity, everything else by value.
  friend bool operator==(const DAAPValue& a, const DAAPValue& b);

 private:
  // Every value but a container or a record is a property-list value as
  // it stands, so that conversions and comparisons are the property list's
  // own. It never holds an array, a dictionary or a UID.
  explicit DAAPValue(PlistValue scalar) : storage_(std::move(scalar)) {}
  [[nodiscard]] const PlistValue* scalar() const { return std::get_if<PlistValue>(&storage_); }

  std::variant<PlistValue, DAAPArray, DAAPDictionary, DAAPItemRef> storage_;
};

// Lookup without building a key.
const DAAPValue& lookup(const DAAPDictionary& dictionary, std::string_view key);

// Conversions between the two dictionary types.
PlistDictionary toPlistDictionary(const DAAPDictionary& dictionary);
DAAPDictionary fromPlistDictionary(const PlistDictionary& dictionary);

}  // namespace larder
