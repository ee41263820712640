#include "dmap/DAAPValue.h"

#include <cmath>
#include <ctime>
#include <limits>
#include <sstream>
#include <utility>

#include "dmap/DAAPItem.h"
#include "platform/log/TillLogManager.h"

namespace larder {

namespace {

void describeInto(std::ostringstream& out, const DAAPValue& value, int indent);

void describeArrayInto(std::ostringstream& out, const DAAPArray& array, int indent) {
  const std::string pad(static_cast<std::size_t>(indent + 4), ' ');
  out << "(\n";
  for (std::size_t index = 0; index < array.size(); ++index) {
    out << pad;
    describeInto(out, array[index], indent + 4);
    out << (index + 1 < array.size() ? ",\n" : "\n");
  }
  out << std::string(static_cast<std::size_t>(indent), ' ') << ")";
}

void describeDictionaryInto(std::ostringstream& out, const DAAPDictionary& dictionary, int indent) {
  const std::string pad(static_cast<std::size_t>(indent + 4), ' ');
  out << "{\n";
  for (const auto& [key, element] : dictionary) {
    out << pad << key.view() << " = ";
    describeInto(out, element, indent + 4);
    out << ";\n";
  }
  out << std::string(static_cast<std::size_t>(indent), ' ') << "}";
}

// Dates read as a person reads them, "2020-09-13 12:26:40 +0000".
void describeDateInto(std::ostringstream& out, const PlistDate& date) {
  const double seconds = date.secondsSince1970;
  constexpr double kYear10000 = 253402300800.0;
  if (!(seconds > -kYear10000 && seconds < kYear10000)) {
    out << "date(" << seconds << ")";
    return;
  }
  const auto whole = static_cast<std::time_t>(std::floor(seconds));
  std::tm parts{};
  gmtime_r(&whole, &parts);
  char text[64];
  std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S +0000", &parts);
  out << text;
}

void describeInto(std::ostringstream& out, const DAAPValue& value, int indent) {
  if (const PlistDate* date = value.date()) return describeDateInto(out, *date);
  if (const DAAPArray* array = value.array()) return describeArrayInto(out, *array, indent);
  if (const DAAPDictionary* dictionary = value.dictionary()) {
    return describeDictionaryInto(out, *dictionary, indent);
  }
  if (DAAPItemRef item = value.item()) {
    out << item->description();
    return;
  }
  out << describePlistValue(value.toPlist());
}

// `type()` passes a scalar's type on as it is: the two lists agree up to
// Date.
constexpr bool sameScalarTypes() {
  using D = DAAPValue::Type;
  using P = PlistValue::Type;
  const std::pair<D, P> pairs[] = {
      {D::Null, P::Null},       {D::Boolean, P::Boolean},
      {D::Integer, P::Integer}, {D::UnsignedInteger, P::UnsignedInteger},
      {D::Real, P::Real},       {D::String, P::String},
      {D::Data, P::Data},       {D::Date, P::Date}};
  for (const auto& [daap, plist] : pairs) {
    if (static_cast<int>(daap) != static_cast<int>(plist)) return false;
  }
  return true;
}
static_assert(sameScalarTypes());

}  // namespace

DAAPValue::DAAPValue(DAAPItemRef value) {
  if (value) storage_ = std::move(value);
}

DAAPItemRef DAAPValue::item() const {
  const DAAPItemRef* item = std::get_if<DAAPItemRef>(&storage_);
  return item ? *item : nullptr;
}

std::int64_t DAAPValue::int64Value() const {
  return scalar() ? scalar()->int64Value() : 0;
}
std::uint64_t DAAPValue::uint64Value() const {
  return scalar() ? scalar()->uint64Value() : 0;
}
double DAAPValue::doubleValue() const {
  return scalar() ? scalar()->doubleValue() : 0.0;
}
bool DAAPValue::boolValue() const {
  return scalar() ? scalar()->boolValue() : false;
}

const DAAPValue& DAAPValue::null() {
  static const DAAPValue kNull;
  return kNull;
}

const DAAPValue& DAAPValue::operator[](std::string_view key) const {
  const DAAPDictionary* entries = dictionary();
  return entries ? lookup(*entries, key) : null();
}

const DAAPValue& lookup(const DAAPDictionary& dictionary, std::string_view key) {
  const auto found = dictionary.find(key);
  return found == dictionary.end() ? DAAPValue::null() : found->second;
}

DAAPValue DAAPValue::fromPlist(const PlistValue& value) {
  if (const PlistDictionary* entries = value.dictionary()) return fromPlistDictionary(*entries);
  if (const PlistArray* elements = value.array()) {
    DAAPArray array;
    array.reserve(elements->size());
    for (const PlistValue& element : *elements) array.push_back(fromPlist(element));
    return array;
  }
  if (value.isUid()) return {};
  return DAAPValue(value);
}

PlistValue DAAPValue::toPlist() const {
  if (const DAAPArray* elements = array()) {
    PlistArray converted;
    converted.reserve(elements->size());
    for (const DAAPValue& element : *elements) converted.push_back(element.toPlist());
    return converted;
  }
  if (const DAAPDictionary* entries = dictionary()) return toPlistDictionary(*entries);
  if (DAAPItemRef record = item()) return toPlistDictionary(record->dictionaryRepresentation());
  return *scalar();
}

PlistDictionary toPlistDictionary(const DAAPDictionary& dictionary) {
  PlistDictionary converted;
  for (const auto& [key, value] : dictionary) {
    converted.emplace_hint(converted.end(), key.str(), value.toPlist());
  }
  return converted;
}

DAAPDictionary fromPlistDictionary(const PlistDictionary& dictionary) {
  DAAPDictionary converted;
  for (const auto& [key, value] : dictionary) {
    converted.emplace_hint(converted.end(), DAAPKey(key), DAAPValue::fromPlist(value));
  }
  return converted;
}

std::string DAAPValue::description() const {
  std::ostringstream out;
  describeInto(out, *this, 0);
  return out.str();
}

bool operator==(const DAAPValue& a, const DAAPValue& b) {
  return a.storage_ == b.storage_;
}

}  // namespace larder
