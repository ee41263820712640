#include "platform/value/PlistValue.h"

#include <charconv>
#include <chrono>
#include <cmath>
#include <limits>

namespace larder {

namespace {

constexpr std::string_view kWhitespace = " \t\n\r\f\v";

std::string_view skipLeadingWhitespace(std::string_view text) {
  const auto start = text.find_first_not_of(kWhitespace);
  return start == std::string_view::npos ? std::string_view{} : text.substr(start);
}

struct DecimalPrefix {
  bool negative = false;
  std::uint64_t magnitude = 0;
  bool overflowed = false;
};

// Reads "[ws][+-]digits" and ignores whatever follows, saturating the
// magnitude instead of failing: identifiers stored as text are read the way
// a person would read them, not validated.
DecimalPrefix parseDecimalPrefix(std::string_view text) {
  DecimalPrefix result;
  text = skipLeadingWhitespace(text);
  if (!text.empty() && (text.front() == '+' || text.front() == '-')) {
    result.negative = text.front() == '-';
    text.remove_prefix(1);
  }
  constexpr std::uint64_t kMax = std::numeric_limits<std::uint64_t>::max();
  for (const char c : text) {
    if (c < '0' || c > '9') break;
    const auto digit = static_cast<std::uint64_t>(c - '0');
    if (result.magnitude > (kMax - digit) / 10) {
      result.overflowed = true;
      result.magnitude = kMax;
      break;
    }
    result.magnitude = result.magnitude * 10 + digit;
  }
  return result;
}

std::int64_t stringToInt64(std::string_view text) {
  const DecimalPrefix prefix = parseDecimalPrefix(text);
  constexpr auto kMax = static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());
  if (prefix.negative) {
    if (prefix.magnitude > kMax) return std::numeric_limits<std::int64_t>::min();
    return -static_cast<std::int64_t>(prefix.magnitude);
  }
  return prefix.magnitude > kMax ? std::numeric_limits<std::int64_t>::max()
                                 : static_cast<std::int64_t>(prefix.magnitude);
}

std::uint64_t stringToUint64(std::string_view text) {
  const DecimalPrefix prefix = parseDecimalPrefix(text);
  if (prefix.negative) return static_cast<std::uint64_t>(stringToInt64(text));
  return prefix.magnitude;
}

double stringToDouble(std::string_view text) {
  text = skipLeadingWhitespace(text);
  // from_chars accepts a minus sign but not a plus sign.
  if (!text.empty() && text.front() == '+') text.remove_prefix(1);
  double value = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (error == std::errc::result_out_of_range) {
    return (!text.empty() && text.front() == '-') ? -HUGE_VAL : HUGE_VAL;
  }
  return error == std::errc{} ? value : 0.0;
}

// Text such as "YES", "true" or "1" counts as true, the way flags written by
// hand into property lists are usually meant.
bool stringToBool(std::string_view text) {
  text = skipLeadingWhitespace(text);
  if (!text.empty() && (text.front() == '+' || text.front() == '-')) text.remove_prefix(1);
  while (!text.empty() && text.front() == '0') text.remove_prefix(1);
  if (text.empty()) return false;
  const char c = text.front();
  return c == 'Y' || c == 'y' || c == 'T' || c == 't' || (c >= '1' && c <= '9');
}

// Truncates toward zero; NaN gives 0 and out-of-range values saturate, since
// a plain cast would be undefined behaviour for them.
std::int64_t doubleToInt64(double value) {
  if (std::isnan(value)) return 0;
  constexpr double kTwoTo63 = 9223372036854775808.0;
  if (value >= kTwoTo63) return std::numeric_limits<std::int64_t>::max();
  if (value < -kTwoTo63) return std::numeric_limits<std::int64_t>::min();
  return static_cast<std::int64_t>(value);
}

std::uint64_t doubleToUint64(double value) {
  if (std::isnan(value)) return 0;
  if (value < 0) return static_cast<std::uint64_t>(doubleToInt64(value));
  constexpr double kTwoTo64 = 18446744073709551616.0;
  if (value >= kTwoTo64) return std::numeric_limits<std::uint64_t>::max();
  return static_cast<std::uint64_t>(value);
}

}  // namespace

PlistValue::PlistValue(std::uint64_t value) {
  if (value <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
    storage_ = static_cast<std::int64_t>(value);
  } else {
    storage_ = value;
  }
}

std::int64_t PlistValue::int64Value() const {
  switch (type()) {
    case Type::Boolean:
      return std::get<bool>(storage_) ? 1 : 0;
    case Type::Integer:
      return std::get<std::int64_t>(storage_);
    case Type::UnsignedInteger:
      return static_cast<std::int64_t>(std::get<std::uint64_t>(storage_));
    case Type::Real:
      return doubleToInt64(std::get<double>(storage_));
    case Type::String:
      return stringToInt64(std::get<std::string>(storage_));
    default:
      return 0;
  }
}

std::uint64_t PlistValue::uint64Value() const {
  switch (type()) {
    case Type::Boolean:
      return std::get<bool>(storage_) ? 1 : 0;
    case Type::Integer:
      return static_cast<std::uint64_t>(std::get<std::int64_t>(storage_));
    case Type::UnsignedInteger:
      return std::get<std::uint64_t>(storage_);
    case Type::Real:
      return doubleToUint64(std::get<double>(storage_));
    case Type::String:
      return stringToUint64(std::get<std::string>(storage_));
    default:
      return 0;
  }
}

double PlistValue::doubleValue() const {
  switch (type()) {
    case Type::Boolean:
      return std::get<bool>(storage_) ? 1.0 : 0.0;
    case Type::Integer:
      return static_cast<double>(std::get<std::int64_t>(storage_));
    case Type::UnsignedInteger:
      return static_cast<double>(std::get<std::uint64_t>(storage_));
    case Type::Real:
      return std::get<double>(storage_);
    case Type::String:
      return stringToDouble(std::get<std::string>(storage_));
    default:
      return 0.0;
  }
}

bool PlistValue::boolValue() const {
  switch (type()) {
    case Type::Boolean:
      return std::get<bool>(storage_);
    case Type::Integer:
      return std::get<std::int64_t>(storage_) != 0;
    case Type::UnsignedInteger:
      return std::get<std::uint64_t>(storage_) != 0;
    case Type::Real: {
      const double value = std::get<double>(storage_);
      return !std::isnan(value) && value != 0.0;
    }
    case Type::String:
      return stringToBool(std::get<std::string>(storage_));
    default:
      return false;
  }
}

const PlistValue& PlistValue::operator[](std::string_view key) const {
  const PlistDictionary* entries = dictionary();
  if (entries == nullptr) return null();
  const auto found = entries->find(key);
  return found == entries->end() ? null() : found->second;
}

const PlistValue& PlistValue::null() {
  static const PlistValue absent;
  return absent;
}

bool operator==(const PlistValue& a, const PlistValue& b) {
  return a.storage_ == b.storage_;
}

PlistDate PlistDate::now() {
  using Seconds = std::chrono::duration<double>;
  return PlistDate{Seconds(std::chrono::system_clock::now().time_since_epoch()).count()};
}

}  // namespace larder
