#include "store-runtime/RecordFieldReader.h"

#include <cmath>

namespace larder {

namespace {

const PlistDictionary& emptyDictionary() {
  static const PlistDictionary empty;
  return empty;
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
  return refuse<std::string>();
}

std::optional<std::int64_t> RecordFieldReader::integer(std::string_view key) {
  const PlistValue& stored = value(key);
  if (stored.isNull()) return std::nullopt;
  if (stored.type() == PlistValue::Type::Integer) return stored.int64Value();
  return refuse<std::int64_t>();
}

std::optional<std::uint64_t> RecordFieldReader::unsignedInteger(std::string_view key) {
  const PlistValue& stored = value(key);
  if (stored.isNull()) return std::nullopt;
  if (stored.type() == PlistValue::Type::UnsignedInteger) return stored.uint64Value();
  if (stored.type() == PlistValue::Type::Integer && stored.int64Value() >= 0) {
    return stored.uint64Value();
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
