#include "tools/larderctl/ValueText.h"

#include <array>
#include <cmath>
#include <ctime>
#include <map>

#include "platform/plist/JsonConversion.h"

namespace larder {
namespace {

using Names = std::map<std::int64_t, std::string_view>;

// The enumerations that records carry as numbers.
const std::map<std::string_view, Names>& enumerations() {
  static const std::map<std::string_view, Names> table{
      {"source",
       {{2, "store software query"}, {3, "legacy query"}, {4, "registry or purchase record"}}},
      {"downloadType", {{1, "install"}, {2, "stage"}, {3, "stage and install"}}},
      {"clientType",
       {{0, "store application"},
        {1, "book application"},
        {2, "device configuration tool"},
        {3, "metadata search"},
        {4, "web browser"}}},
  };
  return table;
}

bool isDateKey(std::string_view key) {
  return key.ends_with("Date");
}

}  // namespace

std::string ValueText::localTime(double secondsSince1970) {
  if (!std::isfinite(secondsSince1970)) return "-";
  const auto seconds = static_cast<std::time_t>(std::floor(secondsSince1970));
  std::tm local{};
  if (::localtime_r(&seconds, &local) == nullptr) return "-";
  std::array<char, 64> text{};
  const std::size_t length =
      std::strftime(text.data(), text.size(), "%Y-%m-%d %H:%M:%S %Z", &local);
  return std::string(text.data(), length);
}

std::string ValueText::of(std::string_view key, const PlistValue& value) {
  if (const std::string* text = value.string()) return *text;
  if (const PlistDate* date = value.date()) return localTime(date->secondsSince1970);
  if (isDateKey(key) && (value.isReal() || value.isInteger()))
    return localTime(value.doubleValue());
  if (value.isInteger()) {
    const auto names = enumerations().find(key);
    const std::int64_t number = value.int64Value();
    if (names != enumerations().end()) {
      const auto name = names->second.find(number);
      if (name != names->second.end())
        return std::string(name->second) + " (" + std::to_string(number) + ")";
    }
    return value.type() == PlistValue::Type::UnsignedInteger ? std::to_string(value.uint64Value())
                                                             : std::to_string(number);
  }
  return JsonConversion::toJson(value).dump();
}

std::string ValueText::textOr(const PlistValue& value, const char* fallback) {
  const std::string* text = value.string();
  return text && !text->empty() ? *text : fallback;
}

}  // namespace larder
