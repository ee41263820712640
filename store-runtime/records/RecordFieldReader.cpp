#include "store-runtime/records/RecordFieldReader.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <charconv>
#include <cmath>

#include "store-runtime/records/RecordDateText.h"

namespace larder {

namespace {

const PlistDictionary& emptyDictionary() {
  static const PlistDictionary empty;
  return empty;
}

// Shortest text that reads back as the same number.
std::optional<std::string> numberText(const PlistValue& value) {
  if (value.type() == PlistValue::Type::Integer) return std::to_string(value.int64Value());
  if (value.type() == PlistValue::Type::UnsignedInteger) return std::to_string(value.uint64Value());
  if (!value.isReal() || !std::isfinite(value.doubleValue())) return std::nullopt;
  std::array<char, 32> buffer{};
  const auto [end, failure] =
      std::to_chars(buffer.data(), buffer.data() + buffer.size(), value.doubleValue());
  if (failure != std::errc()) return std::nullopt;
  return std::string(buffer.data(), end);
}

template <typename Integer>
std::optional<Integer> wholeText(const std::string& text) {
  Integer number{};
  const auto [end, failure] = std::from_chars(text.data(), text.data() + text.size(), number);
  if (failure != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return number;
}

std::optional<std::int64_t> integralReal(const PlistValue& value) {
  // 2^63 is the first real outside the range.
  constexpr double kLimit = 9223372036854775808.0;
  const double real = value.doubleValue();
  if (!value.isReal() || std::trunc(real) != real || real < -kLimit || real >= kLimit) {
    return std::nullopt;
  }
  return static_cast<std::int64_t>(real);
}

std::optional<bool> booleanText(std::string text) {
  std::ranges::transform(text, text.begin(),
                         [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  if (text == "true" || text == "yes" || text == "1") return true;
  if (text == "false" || text == "no" || text == "0") return false;
  return std::nullopt;
}

}  // namespace

RecordFieldReader::RecordFieldReader(const PlistValue& source)
    : source_(source.dictionary() ? *source.dictionary() : emptyDictionary()),
      ok_(source.dictionary() != nullptr) {}

const PlistValue& RecordFieldReader::value(std::string_view key) const {
  const auto found = source_.find(key);
  return found == source_.end() ? PlistValue::null() : found->second;
}

std::optional<std::string> RecordFieldReader::string(std::string_view key) {
  const PlistValue& stored = value(key);
  if (stored.isNull()) return std::nullopt;
  if (const std::string* text = stored.string()) return *text;
  if (converting_) {
    if (auto text = numberText(stored)) return text;
  }
  return refuse<std::string>();
}

std::optional<std::int64_t> RecordFieldReader::integer(std::string_view key) {
  const PlistValue& stored = value(key);
  if (stored.isNull()) return std::nullopt;
  if (stored.type() == PlistValue::Type::Integer) return stored.int64Value();
  if (converting_) {
    if (auto number = integralReal(stored)) return number;
    if (const std::string* text = stored.string()) {
      if (auto number = wholeText<std::int64_t>(*text)) return number;
    }
  }
  return refuse<std::int64_t>();
}

std::optional<std::uint64_t> RecordFieldReader::unsignedInteger(std::string_view key) {
  const PlistValue& stored = value(key);
  if (stored.isNull()) return std::nullopt;
  if (stored.type() == PlistValue::Type::UnsignedInteger) return stored.uint64Value();
  if (stored.type() == PlistValue::Type::Integer && stored.int64Value() >= 0) {
    return stored.uint64Value();
  }
  if (const std::string* text = converting_ ? stored.string() : nullptr) {
    if (auto number = wholeText<std::uint64_t>(*text)) return number;
  }
  return refuse<std::uint64_t>();
}

std::optional<double> RecordFieldReader::real(std::string_view key) {
  const PlistValue& stored = value(key);
  if (stored.isNull()) return std::nullopt;
  if ((stored.isInteger() || stored.isReal()) && std::isfinite(stored.doubleValue())) {
    return stored.doubleValue();
  }
  return refuse<double>();
}

std::optional<bool> RecordFieldReader::boolean(std::string_view key) {
  const PlistValue& stored = value(key);
  if (stored.isNull()) return std::nullopt;
  if (stored.isBoolean() || stored.isInteger()) return stored.boolValue();
  if (const std::string* text = converting_ ? stored.string() : nullptr) {
    if (auto flag = booleanText(*text)) return flag;
  }
  return refuse<bool>();
}

std::optional<PlistDate> RecordFieldReader::date(std::string_view key) {
  const PlistValue& stored = value(key);
  if (stored.isNull()) return std::nullopt;
  if (const PlistDate* date = stored.date()) {
    if (std::isfinite(date->secondsSince1970)) return *date;
    return refuse<PlistDate>();
  }
  if ((stored.isInteger() || stored.isReal()) && std::isfinite(stored.doubleValue())) {
    return PlistDate{stored.doubleValue()};
  }
  if (const std::string* text = converting_ ? stored.string() : nullptr) {
    if (auto date = RecordDateText::parse(*text)) return date;
  }
  return refuse<PlistDate>();
}

std::optional<PlistDictionary> RecordFieldReader::dictionary(std::string_view key) {
  const PlistValue& stored = value(key);
  if (stored.isNull()) return std::nullopt;
  if (const PlistDictionary* entries = stored.dictionary()) return *entries;
  return refuse<PlistDictionary>();
}

std::optional<std::vector<std::string>> RecordFieldReader::strings(std::string_view key) {
  const PlistValue& stored = value(key);
  if (stored.isNull()) return std::nullopt;
  const PlistArray* items = stored.array();
  if (!items) return refuse<std::vector<std::string>>();
  std::vector<std::string> texts;
  texts.reserve(items->size());
  for (const PlistValue& item : *items) {
    const std::string* text = item.string();
    if (!text) return refuse<std::vector<std::string>>();
    texts.push_back(*text);
  }
  return texts;
}

}  // namespace larder
