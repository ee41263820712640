#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace larder {

class PlistValue;

using PlistArray = std::vector<PlistValue>;
using PlistDictionary = std::map<std::string, PlistValue, std::less<>>;
using PlistData = std::vector<std::uint8_t>;

// An absolute point in time, in seconds since 1970-01-01 UTC.
struct PlistDate {
  double secondsSince1970 = 0;
  // The present moment of the system clock.
  static PlistDate now();
  friend bool operator==(const PlistDate&, const PlistDate&) = default;
};

// Object reference of a keyed archive, as binary property lists carry it.
struct PlistUid {
  std::uint64_t value = 0;
  friend bool operator==(const PlistUid&, const PlistUid&) = default;
};

// One property-list value. A default-constructed value is "absent" (null):
// that is how optional fields and failed lookups are represented, so callers
// never need a second "is there a value" flag.
class PlistValue {
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
    Uid,
  };

  PlistValue() = default;
  PlistValue(bool value) : storage_(value) {}               // NOLINT(google-explicit-constructor)
  PlistValue(int value) : storage_(std::int64_t{value}) {}  // NOLINT(google-explicit-constructor)
  PlistValue(std::int64_t value) : storage_(value) {}       // NOLINT(google-explicit-constructor)
  PlistValue(std::uint64_t value);                          // NOLINT(google-explicit-constructor)
  PlistValue(double value) : storage_(value) {}             // NOLINT(google-explicit-constructor)
  PlistValue(const char* value)
      : storage_(std::string(value)) {}  // NOLINT(google-explicit-constructor)
  PlistValue(std::string value)
      : storage_(std::move(value)) {}  // NOLINT(google-explicit-constructor)
  PlistValue(std::string_view value)
      : storage_(std::string(value)) {}  // NOLINT(google-explicit-constructor)
  PlistValue(PlistData value)
      : storage_(std::move(value)) {}               // NOLINT(google-explicit-constructor)
  PlistValue(PlistDate value) : storage_(value) {}  // NOLINT(google-explicit-constructor)
  PlistValue(PlistArray value)
      : storage_(std::move(value)) {}  // NOLINT(google-explicit-constructor)
  PlistValue(PlistDictionary value)
      : storage_(std::move(value)) {}              // NOLINT(google-explicit-constructor)
  PlistValue(PlistUid value) : storage_(value) {}  // NOLINT(google-explicit-constructor)

  [[nodiscard]] Type type() const { return static_cast<Type>(storage_.index()); }
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
  [[nodiscard]] bool isUid() const { return type() == Type::Uid; }

  // Typed access. Each returns nullptr when the value is of another type.
  [[nodiscard]] const std::string* string() const { return std::get_if<std::string>(&storage_); }
  [[nodiscard]] const PlistData* data() const { return std::get_if<PlistData>(&storage_); }
  [[nodiscard]] const PlistArray* array() const { return std::get_if<PlistArray>(&storage_); }
  [[nodiscard]] PlistArray* array() { return std::get_if<PlistArray>(&storage_); }
  [[nodiscard]] const PlistDictionary* dictionary() const {
    return std::get_if<PlistDictionary>(&storage_);
  }
  [[nodiscard]] PlistDictionary* dictionary() { return std::get_if<PlistDictionary>(&storage_); }
  [[nodiscard]] const PlistDate* date() const { return std::get_if<PlistDate>(&storage_); }
  [[nodiscard]] const PlistUid* uid() const { return std::get_if<PlistUid>(&storage_); }

  // Numeric conversions in the manner of a boxed number: integers, reals and
  // booleans convert into each other; a string is read as a decimal number
  // (leading whitespace and sign allowed, trailing garbage ignored), which is
  // how identifiers that some sources store as strings are read. Anything
  // else gives 0 / false.
  [[nodiscard]] std::int64_t int64Value() const;
  [[nodiscard]] std::uint64_t uint64Value() const;
  [[nodiscard]] double doubleValue() const;
  [[nodiscard]] bool boolValue() const;

  // Member lookup on dictionaries; an absent value for any other type or key.
  [[nodiscard]] const PlistValue& operator[](std::string_view key) const;

  // Absent value shared by failed lookups.
  static const PlistValue& null();

  friend bool operator==(const PlistValue& a, const PlistValue& b);

 private:
  std::variant<std::monostate, bool, std::int64_t, std::uint64_t, double, std::string, PlistData,
               PlistDate, PlistArray, PlistDictionary, PlistUid>
      storage_;
};

}  // namespace larder
